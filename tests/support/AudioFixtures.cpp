#include "tests/support/AudioFixtures.h"

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/channel_layout.h>
#include <libavutil/opt.h>
#include <libswresample/swresample.h>
}

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <limits>
#include <memory>
#include <numbers>
#include <tuple>

#include "QuorvelMedia/RCFFmpegLogging.h"

namespace quorvel::testing {
namespace {

constexpr const char* kDomain = "org.quorvel.tests.AudioFixtures";

platform::Error ffError(int code, const std::string& what) {
  char text[AV_ERROR_MAX_STRING_SIZE] = {};
  av_strerror(code, text, sizeof text);
  return platform::Error(kDomain, code, what + ": " + text);
}

struct OutputContextDeleter {
  void operator()(AVFormatContext* context) const {
    if (context != nullptr && context->pb != nullptr && !(context->oformat->flags & AVFMT_NOFILE))
      avio_closep(&context->pb);
    avformat_free_context(context);
  }
};
// Deleters for the types FFmpeg frees through a pointer to the pointer.
template <auto Free>
struct FreeDeleter {
  template <typename T>
  void operator()(T* object) const {
    Free(&object);
  }
};
using InputContextDeleter = FreeDeleter<avformat_close_input>;
using CodecContextDeleter = FreeDeleter<avcodec_free_context>;
using FrameDeleter = FreeDeleter<av_frame_free>;
using PacketDeleter = FreeDeleter<av_packet_free>;
using SwrDeleter = FreeDeleter<swr_free>;

struct FormatChoice {
  const char* muxer;
  AVCodecID codec;
  AVSampleFormat sampleFormat;
};

platform::Result<FormatChoice> choose(const std::string& format) {
  if (format == "m4a") return FormatChoice{"ipod", AV_CODEC_ID_AAC, AV_SAMPLE_FMT_FLTP};
  if (format == "flac") return FormatChoice{"flac", AV_CODEC_ID_FLAC, AV_SAMPLE_FMT_S16};
  if (format == "wav") return FormatChoice{"wav", AV_CODEC_ID_PCM_S16LE, AV_SAMPLE_FMT_S16};
  return platform::fail(platform::Error(kDomain, -1, "unknown tone format " + format));
}

// Sends `frame` (nullptr drains) and writes every packet the encoder returns.
platform::Status encodeAndWrite(AVCodecContext* codec, AVFormatContext* output, AVStream* stream,
                                AVFrame* frame, AVPacket* packet) {
  int status = avcodec_send_frame(codec, frame);
  if (status < 0) return platform::fail(ffError(status, "avcodec_send_frame"));
  for (;;) {
    status = avcodec_receive_packet(codec, packet);
    if (status == AVERROR(EAGAIN) || status == AVERROR_EOF) return {};
    if (status < 0) return platform::fail(ffError(status, "avcodec_receive_packet"));
    av_packet_rescale_ts(packet, codec->time_base, stream->time_base);
    packet->stream_index = stream->index;
    status = av_interleaved_write_frame(output, packet);
    if (status < 0) return platform::fail(ffError(status, "av_interleaved_write_frame"));
  }
}

}  // namespace

platform::Status writeTone(const std::string& path, double seconds, const std::string& format,
                           int sampleRate, int channels, double frequencyHz, double amplitude,
                           M4ALayout layout) {
  return writeTone(
      path, ToneOptions{seconds, format, sampleRate, channels, frequencyHz, amplitude, layout, {}});
}

platform::Status writeDamagedAudio(const std::string& dir) {
  namespace fs = std::filesystem;
  const fs::path at(dir);
  auto cut = [&](const char* from, const char* to, double keep) {
    std::ifstream in(at / from, std::ios::binary);
    const std::string bytes(std::istreambuf_iterator<char>(in), {});
    std::ofstream(at / to, std::ios::binary) << bytes.substr(0, std::size_t(bytes.size() * keep));
    fs::remove(at / from);
  };
  std::ofstream(at / "empty.m4a").flush();
  std::ofstream(at / "text.m4a") << "a shopping list renamed to look like audio\n";
  for (auto [name, format, layout] : {std::tuple{"whole.m4a", "m4a", M4ALayout::MoovAtEnd},
                                      std::tuple{"first.m4a", "m4a", M4ALayout::MoovFirst},
                                      std::tuple{"whole.wav", "wav", M4ALayout::MoovAtEnd}}) {
    if (auto written = writeTone((at / name).string(), 2.0, format, 44100, 1, 440, 0.5, layout);
        !written)
      return written;
  }
  cut("whole.m4a", "cut.m4a", 2.0 / 3);
  cut("first.m4a", "cutdata.m4a", 0.5);
  cut("whole.wav", "cut.wav", 0.5);
  const std::string video =
      "ffmpeg -nostdin -v error -y -f lavfi -i color=s=32x32:d=0.5 -c:v mpeg4 -f mp4 '" +
      (at / "video.m4a").string() + "'";
  if (std::system(video.c_str()) != 0)
    return platform::fail(platform::Error(kDomain, -1, "ffmpeg could not write a video"));
  return {};
}

platform::Status writeTone(const std::string& path, const ToneOptions& tone) {
  RCInstallFFmpegLogging();
  auto choice = choose(tone.format);
  if (!choice) return platform::fail(choice.error());

  AVFormatContext* rawOutput = nullptr;
  int status = avformat_alloc_output_context2(&rawOutput, nullptr, choice->muxer, path.c_str());
  if (status < 0) return platform::fail(ffError(status, "avformat_alloc_output_context2"));
  std::unique_ptr<AVFormatContext, OutputContextDeleter> output(rawOutput);

  const AVCodec* encoder = avcodec_find_encoder(choice->codec);
  if (encoder == nullptr) return platform::fail(platform::Error(kDomain, -1, "no encoder"));
  std::unique_ptr<AVCodecContext, CodecContextDeleter> codec(avcodec_alloc_context3(encoder));
  codec->sample_rate = tone.sampleRate;
  codec->sample_fmt = choice->sampleFormat;
  av_channel_layout_default(&codec->ch_layout, tone.channels);
  codec->time_base = AVRational{1, tone.sampleRate};
  if (choice->codec == AV_CODEC_ID_AAC) codec->bit_rate = 64000 * tone.channels;
  if (output->oformat->flags & AVFMT_GLOBALHEADER) codec->flags |= AV_CODEC_FLAG_GLOBAL_HEADER;
  status = avcodec_open2(codec.get(), encoder, nullptr);
  if (status < 0) return platform::fail(ffError(status, "avcodec_open2"));

  AVStream* stream = avformat_new_stream(output.get(), nullptr);
  if (stream == nullptr) return platform::fail(platform::Error(kDomain, -1, "no stream"));
  stream->time_base = codec->time_base;
  status = avcodec_parameters_from_context(stream->codecpar, codec.get());
  if (status < 0) return platform::fail(ffError(status, "avcodec_parameters_from_context"));
  for (const auto& [key, value] : tone.metadata) {
    av_dict_set(&output->metadata, key.c_str(), value.c_str(), 0);
  }

  status = avio_open(&output->pb, path.c_str(), AVIO_FLAG_WRITE);
  if (status < 0) return platform::fail(ffError(status, "avio_open " + path));
  AVDictionary* options = nullptr;
  if (tone.format == "m4a" && tone.layout == M4ALayout::MoovFirst) {
    av_dict_set(&options, "movflags", "+faststart", 0);
  }
  status = avformat_write_header(output.get(), &options);
  av_dict_free(&options);
  if (status < 0) return platform::fail(ffError(status, "avformat_write_header"));

  const int frameSize = codec->frame_size > 0 ? codec->frame_size : 1024;
  const auto totalFrames = static_cast<int64_t>(std::llround(tone.seconds * tone.sampleRate));
  std::unique_ptr<AVFrame, FrameDeleter> frame(av_frame_alloc());
  std::unique_ptr<AVPacket, PacketDeleter> packet(av_packet_alloc());
  const double step = 2.0 * std::numbers::pi * tone.frequencyHz / tone.sampleRate;
  for (int64_t done = 0; done < totalFrames;) {
    const int count = static_cast<int>(std::min<int64_t>(frameSize, totalFrames - done));
    av_frame_unref(frame.get());
    frame->nb_samples = count;
    frame->format = codec->sample_fmt;
    frame->sample_rate = codec->sample_rate;
    av_channel_layout_copy(&frame->ch_layout, &codec->ch_layout);
    status = av_frame_get_buffer(frame.get(), 0);
    if (status < 0) return platform::fail(ffError(status, "av_frame_get_buffer"));
    for (int i = 0; i < count; ++i) {
      const double value = tone.amplitude * std::sin(step * double(done + i));
      for (int c = 0; c < tone.channels; ++c) {
        if (codec->sample_fmt == AV_SAMPLE_FMT_FLTP) {
          reinterpret_cast<float*>(frame->extended_data[c])[i] = static_cast<float>(value);
        } else {
          reinterpret_cast<int16_t*>(frame->data[0])[i * tone.channels + c] =
              static_cast<int16_t>(std::lround(std::clamp(value, -1.0, 1.0) * 32767.0));
        }
      }
    }
    frame->pts = done;
    if (auto written = encodeAndWrite(codec.get(), output.get(), stream, frame.get(), packet.get());
        !written) {
      return written;
    }
    done += count;
  }
  if (auto drained = encodeAndWrite(codec.get(), output.get(), stream, nullptr, packet.get());
      !drained) {
    return drained;
  }
  status = av_write_trailer(output.get());
  if (status < 0) return platform::fail(ffError(status, "av_write_trailer"));
  return {};
}

platform::Result<DecodedPCM> decodeToPCM(const std::string& path) {
  RCInstallFFmpegLogging();
  AVFormatContext* rawInput = nullptr;
  int status = avformat_open_input(&rawInput, path.c_str(), nullptr, nullptr);
  if (status < 0) return platform::fail(ffError(status, "avformat_open_input " + path));
  std::unique_ptr<AVFormatContext, InputContextDeleter> input(rawInput);
  status = avformat_find_stream_info(input.get(), nullptr);
  if (status < 0) return platform::fail(ffError(status, "avformat_find_stream_info"));
  const AVCodec* decoder = nullptr;
  const int streamIndex = av_find_best_stream(input.get(), AVMEDIA_TYPE_AUDIO, -1, -1, &decoder, 0);
  if (streamIndex < 0) return platform::fail(ffError(streamIndex, "no audio stream"));
  std::unique_ptr<AVCodecContext, CodecContextDeleter> codec(avcodec_alloc_context3(decoder));
  avcodec_parameters_to_context(codec.get(), input->streams[streamIndex]->codecpar);
  status = avcodec_open2(codec.get(), decoder, nullptr);
  if (status < 0) return platform::fail(ffError(status, "avcodec_open2"));

  DecodedPCM pcm;
  pcm.sampleRate = codec->sample_rate;
  pcm.channels = codec->ch_layout.nb_channels;
  SwrContext* rawSwr = nullptr;
  status =
      swr_alloc_set_opts2(&rawSwr, &codec->ch_layout, AV_SAMPLE_FMT_FLT, codec->sample_rate,
                          &codec->ch_layout, codec->sample_fmt, codec->sample_rate, 0, nullptr);
  std::unique_ptr<SwrContext, SwrDeleter> swr(rawSwr);
  if (status < 0 || swr_init(swr.get()) < 0) {
    return platform::fail(ffError(status, "swr_alloc_set_opts2"));
  }

  std::unique_ptr<AVFrame, FrameDeleter> frame(av_frame_alloc());
  std::unique_ptr<AVPacket, PacketDeleter> packet(av_packet_alloc());
  auto drain = [&]() -> platform::Status {
    for (;;) {
      int received = avcodec_receive_frame(codec.get(), frame.get());
      if (received == AVERROR(EAGAIN) || received == AVERROR_EOF) return {};
      if (received < 0) return platform::fail(ffError(received, "avcodec_receive_frame"));
      const std::size_t offset = pcm.samples.size();
      pcm.samples.resize(offset + std::size_t(frame->nb_samples) * pcm.channels);
      uint8_t* out[] = {reinterpret_cast<uint8_t*>(pcm.samples.data() + offset)};
      int converted =
          swr_convert(swr.get(), out, frame->nb_samples,
                      const_cast<const uint8_t**>(frame->extended_data), frame->nb_samples);
      if (converted < 0) return platform::fail(ffError(converted, "swr_convert"));
      pcm.samples.resize(offset + std::size_t(converted) * pcm.channels);
      av_frame_unref(frame.get());
    }
  };
  while (av_read_frame(input.get(), packet.get()) >= 0) {
    if (packet->stream_index == streamIndex) {
      // A damaged packet is skipped, as a player would.
      if (avcodec_send_packet(codec.get(), packet.get()) >= 0) {
        if (auto drained = drain(); !drained) return platform::fail(drained.error());
      }
    }
    av_packet_unref(packet.get());
  }
  avcodec_send_packet(codec.get(), nullptr);
  if (auto drained = drain(); !drained) return platform::fail(drained.error());
  return pcm;
}

namespace {
std::pair<std::size_t, std::size_t> frameRange(const DecodedPCM& pcm, std::size_t begin,
                                               std::size_t end) {
  const std::size_t frames = pcm.frames();
  if (end == 0 || end > frames) end = frames;
  return {std::min(begin, end), end};
}
}  // namespace

double estimatedFrequencyHz(const DecodedPCM& pcm, std::size_t beginFrame, std::size_t endFrame) {
  auto [begin, end] = frameRange(pcm, beginFrame, endFrame);
  if (end <= begin + 1 || pcm.sampleRate <= 0) return 0.0;
  std::size_t first = 0, last = 0, crossings = 0;
  for (std::size_t i = begin + 1; i < end; ++i) {
    if (pcm.samples[(i - 1) * pcm.channels] < 0.0f && pcm.samples[i * pcm.channels] >= 0.0f) {
      if (crossings == 0) first = i;
      last = i;
      ++crossings;
    }
  }
  if (crossings < 2) return 0.0;
  return double(crossings - 1) * pcm.sampleRate / double(last - first);
}

double maxAbsDifference(const DecodedPCM& a, const DecodedPCM& b) {
  if (a.channels != b.channels || a.sampleRate != b.sampleRate) {
    return std::numeric_limits<double>::infinity();
  }
  const std::size_t count = std::min(a.samples.size(), b.samples.size());
  double worst = 0.0;
  for (std::size_t i = 0; i < count; ++i) {
    worst = std::max(worst, std::fabs(double(a.samples[i]) - b.samples[i]));
  }
  return worst;
}

}  // namespace quorvel::testing
