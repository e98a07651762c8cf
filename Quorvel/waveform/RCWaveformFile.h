// RCWaveformFile: reading and writing waveform files, the binary waveform
// format (version 2) that web waveform viewers read:
//
//   offset size  field (little-endian)
//   0      4     int32  version = 2
//   4      4     uint32 flags: bit 0 set = 8-bit values, clear = 16-bit
//   8      4     int32  sample rate (audio frames per second)
//   12     4     int32  samples per pixel
//   16     4     uint32 length (number of pixels)
//   20     4     int32  channels
//   24     ...   for each pixel, for each channel: min, then max
//
// Version 1 files (20-byte header without the channel count, one channel) are
// read too. The reader validates every field and the exact size before it
// allocates anything, so a truncated, oversized or garbage file is an error.
// Plain functions without shared state; safe to call from any thread.
#pragma once

#include <cstdint>
#include <span>
#include <string>

#include "Quorvel/waveform/RCWaveform.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

inline constexpr int kRCWaveformFileVersion = 2;
inline constexpr int kRCWaveformMaxChannels = 24;

// The file's bytes for `waveform`.
std::string RCEncodeWaveformFile(const RCWaveform& waveform);
// Parses a whole file. Errors are in kRCMediaErrorDomain, code CorruptWaveform.
platform::Result<RCWaveform> RCDecodeWaveformFile(std::span<const std::uint8_t> bytes);

// Reads and parses the file at `url`.
platform::Result<RCWaveform> RCReadWaveformFile(const platform::URL& url);
// Writes `waveform` to `url`, replacing any file there atomically.
platform::Status RCWriteWaveformFile(const RCWaveform& waveform, const platform::URL& url);

}  // namespace quorvel
