#include "QuorvelMedia/RCAudioEncoder.h"

#include <algorithm>
#include <cctype>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavutil/audio_fifo.h>
}

#include "Quorvel/errors/RCErrors.h"
#include "QuorvelMedia/RCAudioOutput.h"
#include "QuorvelMedia/RCFFmpegLogging.h"

namespace quorvel {
namespace {

bool isPCM(AVCodecID id) {
  switch (id) {
    case AV_CODEC_ID_PCM_U8:
    case AV_CODEC_ID_PCM_S16LE:
    case AV_CODEC_ID_PCM_S24LE:
    case AV_CODEC_ID_PCM_S32LE:
    case AV_CODEC_ID_PCM_F32LE:
    case AV_CODEC_ID_PCM_F64LE:
      return true;
    default:
      return false;
  }
}

int bitsOf(const AVCodecParameters* model) {
  if (model->bits_per_raw_sample > 0) return model->bits_per_raw_sample;
  if (model->bits_per_coded_sample > 0 && isPCM(model->codec_id))
    return model->bits_per_coded_sample;
  return 16;
}

AVCodecID codecFor(const std::string& extension, const AVCodecParameters* model) {
  if (extension == "m4a") return AV_CODEC_ID_AAC;
  if (extension == "flac") return AV_CODEC_ID_FLAC;
  if (extension == "wav") return isPCM(model->codec_id) ? model->codec_id : AV_CODEC_ID_PCM_S16LE;
  return AV_CODEC_ID_NONE;
}

int supportedRate(const AVCodec* codec, int wanted) {
  if (!codec->supported_samplerates) return wanted;
  int best = 0;
  for (const int* rate = codec->supported_samplerates; *rate; ++rate) {
    if (*rate == wanted) return wanted;
    if (!best || std::abs(*rate - wanted) < std::abs(best - wanted)) best = *rate;
  }
  return best;
}

AVSampleFormat sampleFormatFor(const AVCodec* codec, int bits) {
  const AVSampleFormat* formats = codec->sample_fmts;
  if (!formats) return AV_SAMPLE_FMT_S16;
  if (codec->id == AV_CODEC_ID_FLAC) {
    const AVSampleFormat wanted = bits > 16 ? AV_SAMPLE_FMT_S32 : AV_SAMPLE_FMT_S16;
    for (const AVSampleFormat* f = formats; *f != AV_SAMPLE_FMT_NONE; ++f)
      if (*f == wanted) return wanted;
  }
  return formats[0];
}

}  // namespace

RCAudioEncoder::~RCAudioEncoder() = default;

platform::Result<std::unique_ptr<RCAudioEncoder>> RCAudioEncoder::open(
    const std::string& path, std::string_view extension, const AVCodecParameters* model) {
  RCInstallFFmpegLogging();
  std::string ext(extension);
  std::transform(ext.begin(), ext.end(), ext.begin(),
                 [](unsigned char c) { return char(std::tolower(c)); });
  const AVCodecID codecID = codecFor(ext, model);
  const AVCodec* codec = codecID == AV_CODEC_ID_NONE ? nullptr : avcodec_find_encoder(codecID);
  if (!codec)
    return platform::fail(RCMediaError(RCMediaErrorCodeUnsupportedFormat,
                                       fmt::format("no audio encoder for \".{}\"", extension)));
  std::unique_ptr<RCAudioEncoder> encoder(new RCAudioEncoder());
  encoder->codec_ = RCAVOwn<RCAVCodecContextPtr>(avcodec_alloc_context3(codec));
  encoder->frame_ = RCAVMakeFrame();
  encoder->packet_ = RCAVMakePacket();
  AVCodecContext* c = encoder->codec_.get();
  const int bits = bitsOf(model);
  c->sample_rate = supportedRate(codec, model->sample_rate);
  if (model->ch_layout.order == AV_CHANNEL_ORDER_NATIVE)
    av_channel_layout_copy(&c->ch_layout, &model->ch_layout);
  else
    av_channel_layout_default(&c->ch_layout, model->ch_layout.nb_channels);
  c->sample_fmt = sampleFormatFor(codec, bits);
  c->time_base = AVRational{1, c->sample_rate};
  c->thread_count = 1;
  if (codecID == AV_CODEC_ID_AAC) {
    const std::int64_t fallback =
        std::min<std::int64_t>(64000LL * c->ch_layout.nb_channels, 320000);
    c->bit_rate =
        model->codec_id == AV_CODEC_ID_AAC && model->bit_rate > 0 ? model->bit_rate : fallback;
  }
  if (codecID == AV_CODEC_ID_FLAC) c->bits_per_raw_sample = bits > 16 ? 24 : 16;
  c->flags |=
      AV_CODEC_FLAG_GLOBAL_HEADER;  // every container here keeps the codec setup in its header
  int result = avcodec_open2(c, codec, nullptr);
  if (result < 0)
    return platform::fail(
        RCMediaErrorFromAV(RCMediaErrorCodeEncodeFailed, result, "cannot open the encoder"));
  encoder->frameSize_ =
      (codec->capabilities & AV_CODEC_CAP_VARIABLE_FRAME_SIZE) || c->frame_size <= 0
          ? 4096
          : c->frame_size;
  encoder->fifo_ = RCAVOwn<RCAVAudioFifoPtr>(
      av_audio_fifo_alloc(c->sample_fmt, c->ch_layout.nb_channels, encoder->frameSize_));

  auto parameters = RCAVOwn<RCAVCodecParametersPtr>(avcodec_parameters_alloc());
  avcodec_parameters_from_context(parameters.get(), c);
  auto output = RCAudioOutput::open(path, extension, parameters.get());
  if (!output) return platform::fail(output.error());
  encoder->output_ = std::move(*output);
  return encoder;
}

AVSampleFormat RCAudioEncoder::sampleFormat() const { return codec_->sample_fmt; }
int RCAudioEncoder::sampleRate() const { return codec_->sample_rate; }
const AVChannelLayout& RCAudioEncoder::channelLayout() const { return codec_->ch_layout; }

platform::Status RCAudioEncoder::write(const std::uint8_t* const* data, int count) {
  if (count <= 0) return {};
  if (av_audio_fifo_write(fifo_.get(), reinterpret_cast<void**>(const_cast<std::uint8_t**>(data)),
                          count) < count)
    throw std::bad_alloc();
  framesIn_ += count;
  return encodeFromFifo(false);
}

platform::Status RCAudioEncoder::encodeFromFifo(bool final) {
  while (av_audio_fifo_size(fifo_.get()) >= frameSize_ ||
         (final && av_audio_fifo_size(fifo_.get()) > 0)) {
    const int count = std::min(frameSize_, av_audio_fifo_size(fifo_.get()));
    av_frame_unref(frame_.get());
    frame_->nb_samples = count;
    frame_->format = codec_->sample_fmt;
    frame_->sample_rate = codec_->sample_rate;
    av_channel_layout_copy(&frame_->ch_layout, &codec_->ch_layout);
    if (av_frame_get_buffer(frame_.get(), 0) < 0) throw std::bad_alloc();
    av_audio_fifo_read(fifo_.get(), reinterpret_cast<void**>(frame_->data), count);
    frame_->pts = nextPts_;
    nextPts_ += count;
    if (auto encoded = encodeFrame(frame_.get()); !encoded) return encoded;
  }
  return {};
}

platform::Status RCAudioEncoder::encodeFrame(AVFrame* frame) {
  int result = avcodec_send_frame(codec_.get(), frame);
  if (result < 0 && result != AVERROR_EOF)
    return platform::fail(
        RCMediaErrorFromAV(RCMediaErrorCodeEncodeFailed, result, "cannot encode audio"));
  for (;;) {
    result = avcodec_receive_packet(codec_.get(), packet_.get());
    if (result == AVERROR(EAGAIN) || result == AVERROR_EOF) return {};
    if (result < 0)
      return platform::fail(
          RCMediaErrorFromAV(RCMediaErrorCodeEncodeFailed, result, "cannot encode audio"));
    if (auto written = output_->writePacket(packet_.get()); !written) return written;
  }
}

platform::Status RCAudioEncoder::finish() {
  if (auto rest = encodeFromFifo(true); !rest) return rest;
  if (auto drained = encodeFrame(nullptr); !drained) return drained;
  return output_->finish();
}

}  // namespace quorvel
