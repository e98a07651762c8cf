// Errors of the framework's audio work (composing, decoding, waveform files):
// values in the domain kRCMediaErrorDomain with the codes below. Plain
// functions; safe to call from any thread.
#pragma once

#include <string_view>

#include "platform/Error.h"

namespace quorvel {

inline constexpr const char* kRCMediaErrorDomain = "org.quorvel.Media";

enum class RCMediaErrorCode : long {
  InvalidArgument = 1,    // a request that cannot be carried out as asked
  CannotOpen = 2,         // the file is missing, unreadable or not a media file
  NoAudioStream = 3,      // the file opened but holds no audio
  DecodeFailed = 4,       // the audio could not be read or decoded
  EncodeFailed = 5,       // writing the output failed inside the codec or muxer
  Truncated = 6,          // the audio ends before the range or duration it declares
  UnsupportedFormat = 7,  // no container/codec for this extension
  FileSystem = 8,         // temp file, fsync, rename
  CorruptWaveform = 9,    // a waveform file that is not a valid waveform
};

platform::Error RCMediaError(RCMediaErrorCode code, std::string description);
// An error for a negative FFmpeg result `averror`, described as "<what>: <FFmpeg's text>".
platform::Error RCMediaErrorFromAV(RCMediaErrorCode code, int averror, std::string_view what);

}  // namespace quorvel
