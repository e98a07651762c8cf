#include "Quorvel/waveform/RCWaveform.h"

#include "platform/Misuse.h"

namespace quorvel {

platform::URL RCWaveform::waveformURLForAVURL(const platform::URL& avURL) {
  if (avURL.pathExtension().empty()) return avURL.URLByAppendingPathExtension("waveform");
  return avURL.URLByReplacingPathExtension("waveform");
}

RCWaveform::RCWaveform(int sampleRate, int samplesPerPixel, int channels, int bits)
    : sampleRate_(sampleRate), samplesPerPixel_(samplesPerPixel), channels_(channels), bits_(bits) {
  QV_MISUSE(sampleRate < 1 || samplesPerPixel < 1 || channels < 1 || (bits != 8 && bits != 16),
            "RCWaveform: invalid shape (rate {}, {} samples per pixel, {} channels, {} bits)",
            sampleRate, samplesPerPixel, channels, bits);
}

double RCWaveform::durationSeconds() const {
  return sampleRate_ > 0 ? double(length()) * samplesPerPixel_ / sampleRate_ : 0.0;
}

void RCWaveform::appendPixel(std::span<const std::int16_t> minMax) {
  QV_MISUSE(minMax.size() != std::size_t(2 * channels_),
            "RCWaveform::appendPixel: {} values for {} channels", minMax.size(), channels_);
  data_.insert(data_.end(), minMax.begin(), minMax.end());
}

void RCWaveform::truncate(std::size_t pixels) {
  if (pixels < length()) data_.resize(pixels * 2 * channels_);
}

}  // namespace quorvel
