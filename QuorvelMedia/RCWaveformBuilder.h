// RCWaveformBuilder: turns decoded audio into waveform pixels. The channels
// are averaged into one; each run of samplesPerPixel frames becomes one pixel
// holding the minimum and maximum of that run as 16-bit values.
//
// Owned by whoever decodes (the waveform data source, the composer) and used
// on that one thread; not synchronized.
#pragma once

#include <cstdint>

extern "C" {
#include <libavutil/samplefmt.h>
}

#include "Quorvel/waveform/RCWaveform.h"

struct AVFrame;

namespace quorvel {

class RCWaveformBuilder {
 public:
  explicit RCWaveformBuilder(int sampleRate,
                             int samplesPerPixel = RCWaveform::kDefaultSamplesPerPixel);

  // Adds `count` frames starting at frame `offset` of `data` (FFmpeg's layout
  // for `format`: one plane per channel when planar, else one interleaved
  // plane). The rate must be the builder's.
  void append(const std::uint8_t* const* data, AVSampleFormat format, int channels, int offset,
              int count);
  // Adds all of a decoded frame, or the frames [offset, offset + count) of it.
  void append(const AVFrame* frame);
  void append(const AVFrame* frame, int offset, int count);

  // Emits the last, partial pixel (if any). Appending afterwards starts a new pixel.
  void finish();

  // The pixels completed so far (the partial one is not included before finish()).
  const RCWaveform& waveform() const { return waveform_; }
  // Audio frames added so far.
  std::int64_t framesAppended() const { return framesAppended_; }

 private:
  template <class Reader>
  void accumulate(Reader read, int count);
  void emitPixel();

  RCWaveform waveform_;
  int samplesPerPixel_;
  int inPixel_ = 0;
  float min_ = 0.0f;
  float max_ = 0.0f;
  std::int64_t framesAppended_ = 0;
};

}  // namespace quorvel
