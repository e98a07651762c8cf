// RCDecodeWaveform: the one loop that decodes a file's audio into waveform
// pixels, used by the media engine's waveform job and by the file-input
// waveform data source (which saves as it goes).
//
// Blocks the calling thread for as long as decoding takes; any thread.
#pragma once

#include <functional>

#include "Quorvel/waveform/RCWaveform.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

class RCWaveformBuilder;

struct RCWaveformDecoding {
  // After each decoded frame: the pixels so far and how far into the
  // declared duration decoding is (0 when the file declares none). A
  // failure stops decoding and is returned.
  std::function<platform::Status(const RCWaveformBuilder& builder, double fraction)> onFrame;
  // Asked before each packet; true stops decoding with a DecodeFailed error.
  std::function<bool()> cancelled;
};

// The waveform of the first audio stream of `audio`. Fails (kRCMediaErrorDomain)
// when the file cannot be opened or decoded, changes its sample rate midway,
// holds no audio, or holds noticeably less audio than it declares.
platform::Result<RCWaveform> RCDecodeWaveform(const platform::URL& audio,
                                              const RCWaveformDecoding& decoding = {});

}  // namespace quorvel
