#include "QuorvelMedia/RCWaveformBuilder.h"

#include <algorithm>
#include <cmath>

extern "C" {
#include <libavutil/frame.h>
}

#include "platform/Misuse.h"

namespace quorvel {
namespace {

std::int16_t toInt16(float value) {
  const float scaled = std::nearbyint(value * 32767.0f);
  return std::int16_t(std::clamp(scaled, -32768.0f, 32767.0f));
}

template <class T>
float toFloat(T value);
template <>
float toFloat(std::uint8_t v) {
  return (float(v) - 128.0f) * (1.0f / 128.0f);
}
template <>
float toFloat(std::int16_t v) {
  return float(v) * (1.0f / 32768.0f);
}
template <>
float toFloat(std::int32_t v) {
  return float(v) * (1.0f / 2147483648.0f);
}
template <>
float toFloat(std::int64_t v) {
  return float(double(v) * (1.0 / 9223372036854775808.0));
}
template <>
float toFloat(float v) {
  return v;
}
template <>
float toFloat(double v) {
  return float(v);
}

// Reads frame i of planar or packed audio of sample type T as the mean of its channels.
template <class T, bool planar>
struct MixReader {
  const std::uint8_t* const* data;
  int channels;
  int offset;
  float scale;
  float operator()(int i) const {
    const int frame = offset + i;
    if (channels == 1) return toFloat(reinterpret_cast<const T*>(data[0])[frame]);
    float sum = 0.0f;
    for (int c = 0; c < channels; ++c) {
      sum += planar
                 ? toFloat(reinterpret_cast<const T*>(data[c])[frame])
                 : toFloat(reinterpret_cast<const T*>(data[0])[std::size_t(frame) * channels + c]);
    }
    return sum * scale;
  }
};

}  // namespace

RCWaveformBuilder::RCWaveformBuilder(int sampleRate, int samplesPerPixel)
    : waveform_(sampleRate, samplesPerPixel, 1, 16), samplesPerPixel_(samplesPerPixel) {}

template <class Reader>
void RCWaveformBuilder::accumulate(Reader read, int count) {
  int i = 0;
  while (i < count) {
    const int run = std::min(count - i, samplesPerPixel_ - inPixel_);
    float lo = inPixel_ ? min_ : read(i);
    float hi = inPixel_ ? max_ : lo;
    for (int k = 0; k < run; ++k) {
      const float v = read(i + k);
      lo = std::min(lo, v);
      hi = std::max(hi, v);
    }
    min_ = lo;
    max_ = hi;
    inPixel_ += run;
    i += run;
    if (inPixel_ == samplesPerPixel_) emitPixel();
  }
  framesAppended_ += count;
}

void RCWaveformBuilder::append(const std::uint8_t* const* data, AVSampleFormat format, int channels,
                               int offset, int count) {
  if (count <= 0 || channels <= 0) return;
  const float scale = 1.0f / float(channels);
  switch (format) {
#define QV_WAVEFORM_FORMAT(fmt, T, planar) \
  case fmt:                                \
    return accumulate(MixReader<T, planar>{data, channels, offset, scale}, count);
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_U8, std::uint8_t, false)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_U8P, std::uint8_t, true)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_S16, std::int16_t, false)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_S16P, std::int16_t, true)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_S32, std::int32_t, false)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_S32P, std::int32_t, true)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_S64, std::int64_t, false)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_S64P, std::int64_t, true)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_FLT, float, false)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_FLTP, float, true)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_DBL, double, false)
    QV_WAVEFORM_FORMAT(AV_SAMPLE_FMT_DBLP, double, true)
#undef QV_WAVEFORM_FORMAT
    default:
      QV_MISUSE(true, "RCWaveformBuilder: unsupported sample format {}", int(format));
  }
}

void RCWaveformBuilder::append(const AVFrame* frame) { append(frame, 0, frame->nb_samples); }

void RCWaveformBuilder::append(const AVFrame* frame, int offset, int count) {
  append(frame->extended_data, AVSampleFormat(frame->format), frame->ch_layout.nb_channels, offset,
         count);
}

void RCWaveformBuilder::emitPixel() {
  const std::int16_t pair[2] = {toInt16(min_), toInt16(max_)};
  waveform_.appendPixel(pair);
  inPixel_ = 0;
}

void RCWaveformBuilder::finish() {
  if (inPixel_ > 0) emitPixel();
}

}  // namespace quorvel
