// RCWaveform: a recording's waveform, the minimum and maximum sample value of
// each run of `samplesPerPixel` audio frames ("pixel"), per channel. A value
// type; copies are independent; not synchronized (share const copies only).
//
// Values are stored as 16-bit numbers; a waveform of 8-bit resolution keeps
// them in [-128, 127]. data() is laid out pixel by pixel, channel by channel,
// minimum then maximum, the order of the waveform file (RCWaveformFile.h).
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

#include "platform/URL.h"

namespace quorvel {

class RCWaveform {
 public:
  static constexpr int kDefaultSamplesPerPixel = 256;

  // The waveform file of a recording: "<name>.waveform" beside its audio
  // file (same directory, extension replaced; added when there is none).
  static platform::URL waveformURLForAVURL(const platform::URL& avURL);

  RCWaveform() = default;
  // bits is 8 or 16; channels >= 1; sampleRate, samplesPerPixel >= 1.
  RCWaveform(int sampleRate, int samplesPerPixel, int channels, int bits = 16);

  int sampleRate() const { return sampleRate_; }
  int samplesPerPixel() const { return samplesPerPixel_; }
  int channels() const { return channels_; }
  int bits() const { return bits_; }
  // Number of pixels.
  std::size_t length() const { return channels_ > 0 ? data_.size() / (2 * channels_) : 0; }
  // Seconds of audio the pixels cover.
  double durationSeconds() const;

  std::int16_t min(std::size_t pixel, int channel) const { return data_[index(pixel, channel)]; }
  std::int16_t max(std::size_t pixel, int channel) const {
    return data_[index(pixel, channel) + 1];
  }
  std::span<const std::int16_t> data() const { return data_; }

  // Appends one pixel: `minMax` holds channels() pairs (min, max).
  void appendPixel(std::span<const std::int16_t> minMax);
  // Keeps the first `pixels` pixels.
  void truncate(std::size_t pixels);
  void reserve(std::size_t pixels) { data_.reserve(pixels * 2 * channels_); }
  std::vector<std::int16_t>& mutableData() { return data_; }

  friend bool operator==(const RCWaveform&, const RCWaveform&) = default;

 private:
  std::size_t index(std::size_t pixel, int channel) const {
    return (pixel * channels_ + channel) * 2;
  }
  int sampleRate_ = 0;
  int samplesPerPixel_ = kDefaultSamplesPerPixel;
  int channels_ = 1;
  int bits_ = 16;
  std::vector<std::int16_t> data_;
};

}  // namespace quorvel
