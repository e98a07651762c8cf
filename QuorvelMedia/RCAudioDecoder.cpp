#include "QuorvelMedia/RCAudioDecoder.h"

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
}

#include "Quorvel/errors/RCErrors.h"
#include "QuorvelMedia/RCFFmpegLogging.h"
#include "QuorvelMedia/RCMediaInput.h"

namespace quorvel {

RCAudioDecoder::RCAudioDecoder(platform::URL url, RCAVInputPtr format, AVStream* stream)
    : url_(std::move(url)), format_(std::move(format)), stream_(stream) {}

platform::Result<std::unique_ptr<RCAudioDecoder>> RCAudioDecoder::open(const platform::URL& url) {
  RCInstallFFmpegLogging();
  const std::string name = url.lastPathComponent();
  AVFormatContext* opened = nullptr;
  int result = RCOpenMediaInput(&opened, url.path().c_str());
  if (result < 0)
    return platform::fail(
        RCMediaErrorFromAV(RCMediaErrorCodeCannotOpen, result, "cannot open " + name));
  RCAVInputPtr format(opened);

  auto findAudio = [&format]() -> AVStream* {
    for (unsigned i = 0; i < format->nb_streams; ++i) {
      AVStream* s = format->streams[i];
      if (s->codecpar->codec_type == AVMEDIA_TYPE_AUDIO) return s;
    }
    return nullptr;
  };
  AVStream* stream = findAudio();
  const bool complete = stream && stream->codecpar->codec_id != AV_CODEC_ID_NONE &&
                        stream->codecpar->sample_rate > 0 &&
                        stream->codecpar->ch_layout.nb_channels > 0;
  if (!complete) {
    result = avformat_find_stream_info(format.get(), nullptr);
    if (result < 0) {
      return platform::fail(RCMediaErrorFromAV(RCMediaErrorCodeCannotOpen, result,
                                               "cannot read the streams of " + name));
    }
    stream = findAudio();
  }
  if (!stream || stream->codecpar->codec_id == AV_CODEC_ID_NONE ||
      stream->codecpar->sample_rate <= 0 || stream->codecpar->ch_layout.nb_channels <= 0) {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeNoAudioStream, name + " holds no usable audio stream"));
  }
  for (unsigned i = 0; i < format->nb_streams; ++i)
    if (format->streams[i] != stream) format->streams[i]->discard = AVDISCARD_ALL;
  return std::unique_ptr<RCAudioDecoder>(new RCAudioDecoder(url, std::move(format), stream));
}

const AVCodecParameters* RCAudioDecoder::codecParameters() const { return stream_->codecpar; }

double RCAudioDecoder::declaredDurationSeconds() const {
  if (stream_->duration > 0 && stream_->duration != AV_NOPTS_VALUE)
    return double(stream_->duration) * av_q2d(stream_->time_base);
  if (format_->duration > 0 && format_->duration != AV_NOPTS_VALUE)
    return double(format_->duration) / AV_TIME_BASE;
  return 0.0;
}

platform::Result<bool> RCAudioDecoder::readPacket(AVPacket* packet) {
  for (;;) {
    const int result = av_read_frame(format_.get(), packet);
    if (result == AVERROR_EOF) return false;
    if (result < 0)
      return platform::fail(RCMediaErrorFromAV(RCMediaErrorCodeDecodeFailed, result,
                                               "cannot read " + url_.lastPathComponent()));
    if (packet->stream_index == stream_->index) {
      if (packet->flags & AV_PKT_FLAG_CORRUPT) {
        av_packet_unref(packet);
        return platform::fail(RCMediaError(RCMediaErrorCodeTruncated,
                                           url_.lastPathComponent() + " is damaged or truncated"));
      }
      return true;
    }
    av_packet_unref(packet);
  }
}

platform::Status RCAudioDecoder::openCodec() {
  if (codec_) return {};
  const AVCodec* codec = avcodec_find_decoder(stream_->codecpar->codec_id);
  const std::string name = url_.lastPathComponent();
  if (!codec)
    return platform::fail(RCMediaError(RCMediaErrorCodeDecodeFailed,
                                       fmt::format("no decoder for the audio of {}", name)));
  auto context = RCAVOwn<RCAVCodecContextPtr>(avcodec_alloc_context3(codec));
  if (!frame_) frame_ = RCAVMakeFrame();
  int result = avcodec_parameters_to_context(context.get(), stream_->codecpar);
  if (result >= 0) {
    context->pkt_timebase = stream_->time_base;
    context->thread_count = 1;
    result = avcodec_open2(context.get(), codec, nullptr);
  }
  if (result >= 0) codec_ = std::move(context);
  if (result < 0) {
    return platform::fail(RCMediaErrorFromAV(RCMediaErrorCodeDecodeFailed, result,
                                             "cannot open the decoder for " + name));
  }
  return {};
}

platform::Status RCAudioDecoder::decode(const AVPacket* packet, const FrameHandler& handler) {
  if (auto opened = openCodec(); !opened) return opened;
  if (draining_) return {};
  if (!packet) draining_ = true;
  int result = avcodec_send_packet(codec_.get(), packet);
  if (result < 0 && result != AVERROR_EOF) {
    // A damaged packet: the codec drops it; a file of nothing but damage
    // fails later for holding no audio.
    if (result == AVERROR_INVALIDDATA) return {};
    return platform::fail(RCMediaErrorFromAV(RCMediaErrorCodeDecodeFailed, result,
                                             "cannot decode " + url_.lastPathComponent()));
  }
  for (;;) {
    result = avcodec_receive_frame(codec_.get(), frame_.get());
    if (result == AVERROR(EAGAIN) || result == AVERROR_EOF) return {};
    if (result == AVERROR_INVALIDDATA) continue;
    if (result < 0)
      return platform::fail(RCMediaErrorFromAV(RCMediaErrorCodeDecodeFailed, result,
                                               "cannot decode " + url_.lastPathComponent()));
    auto handled = handler(frame_.get());
    av_frame_unref(frame_.get());
    if (!handled) return handled;
  }
}

platform::Status RCAudioDecoder::decodeAll(const FrameHandler& handler,
                                           const std::function<bool()>& cancelled) {
  RCAVPacketPtr packet = RCAVMakePacket();
  for (;;) {
    if (cancelled && cancelled())
      return platform::fail(RCMediaError(RCMediaErrorCodeDecodeFailed, "cancelled"));
    auto more = readPacket(packet.get());
    if (!more) return platform::fail(more.error());
    if (!*more) return decode(nullptr, handler);
    auto status = decode(packet.get(), handler);
    av_packet_unref(packet.get());
    if (!status) return status;
  }
}

}  // namespace quorvel
