// quorvelctl's waveform picture: draws a recording's waveform (its
// "<name>.waveform" file) as a PNG image, one band per channel, each column
// the range of the samples it covers, over a time axis in seconds.
//
// Plain functions without shared state; called from main() only.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "Quorvel/waveform/RCWaveform.h"
#include "platform/Error.h"

namespace quorvelctl {

struct WaveformPictureSize {
  int width = 800;
  int height = 200;
};

// The picture's pixels, 8-bit RGB, row by row from the top: `size.width`
// columns, each covering an equal share of the waveform's pixels (a column
// between two waveform pixels repeats the nearer one, so a short waveform is
// stretched), and `size.height` rows: a time axis of 16 rows at the bottom
// (ticks and labels in seconds, or minutes:seconds) when the picture is at
// least 64 rows high, the rest split evenly between the channels.
std::vector<std::uint8_t> renderWaveform(const quorvel::RCWaveform& waveform,
                                         WaveformPictureSize size);

// Writes the rendered waveform to `path` as a PNG file, replacing any file
// there.
platform::Status writeWaveformPNG(const quorvel::RCWaveform& waveform, WaveformPictureSize size,
                                  const std::string& path);

// `quorvelctl waveform URL --png FILE`: reads the waveform file beside the
// recording's composed audio file `url` and writes its picture to `png`.
// Returns the exit status: 0, or 1 with a message on stderr when the waveform
// file is missing or corrupt or the picture cannot be written.
int drawWaveform(const std::string& url, const std::string& png, WaveformPictureSize size);

}  // namespace quorvelctl
