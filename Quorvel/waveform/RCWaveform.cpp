#include "Quorvel/waveform/RCWaveform.h"

#include <stdexcept>

namespace quorvel {

platform::URL RCWaveform::waveformURLForAVURL(const platform::URL& avURL) {
  if (avURL.pathExtension().empty()) return avURL.URLByAppendingPathExtension("waveform");
  return avURL.URLByReplacingPathExtension("waveform");
}

RCWaveform::RCWaveform(int sampleRate, int samplesPerPixel, int channels, int bits)
    : sampleRate_(sampleRate), samplesPerPixel_(samplesPerPixel), channels_(channels), bits_(bits) {
  if (sampleRate < 1 || samplesPerPixel < 1 || channels < 1 || (bits != 8 && bits != 16))
    throw std::invalid_argument("RCWaveform: invalid shape");
}

double RCWaveform::durationSeconds() const {
  return sampleRate_ > 0 ? double(length()) * samplesPerPixel_ / sampleRate_ : 0.0;
}

void RCWaveform::appendPixel(std::span<const std::int16_t> minMax) {
  if (minMax.size() != 2 * std::size_t(channels_))
    throw std::invalid_argument("RCWaveform::appendPixel: wrong number of values");
  data_.insert(data_.end(), minMax.begin(), minMax.end());
}

void RCWaveform::truncate(std::size_t pixels) {
  if (pixels < length()) data_.resize(pixels * 2 * channels_);
}

}  // namespace quorvel
