// The composer: joins the used ranges of a recording's fragment files into
// its one composed audio file, and optionally writes the composed waveform.
//
// When every fragment is AAC with identical codec parameters and the target
// is m4a, the packets are copied (no generation loss) with continuous
// timestamps; before each fragment's first used packet the packet that
// precedes it is copied too, so the decoder's overlap starts from that
// fragment's own audio and the join does not click. Otherwise (mixed formats,
// lossless or PCM targets) the audio is decoded, trimmed to the sample,
// converted to the first fragment's rate and channels and encoded in the
// target's codec.
//
// The output is written to a hidden temporary file beside the destination,
// flushed to disk and renamed over it: a crash leaves the old file or the new
// one; on failure the temporary file is removed and the destination is left
// as it was.
//
// RCComposeAudio blocks while it works; it may run on any thread, and calls
// on distinct destinations may run at the same time.
#pragma once

#include <functional>
#include <optional>
#include <vector>

#include "Quorvel/media/RCMediaEngine.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

// Called on the composing thread, often, with the fraction of the segments'
// total length composed so far.
using RCComposerProgress = std::function<void(double fraction)>;

// Concatenates the segments' used ranges, in order, into `destination` (its
// extension picks the container: m4a, flac or wav). Writes the composed
// waveform to `waveformDestination` when given. Never leaves a half file.
// Reports its progress to `progress` when given.
// Errors are in kRCMediaErrorDomain (or POSIX for file system failures and
// other failures to read). When a segment's fragment turns out to hold
// unusable audio (it does not open as audio, has no audio stream, does not
// decode, ends early), the error is an RCComposerSegmentError naming that
// segment's index, with what was found as its underlying error.
platform::Status RCComposeAudio(
    const std::vector<RCComposerSegment>& segments, const platform::URL& destination,
    const std::optional<platform::URL>& waveformDestination = std::nullopt,
    const RCComposerProgress& progress = {});

}  // namespace quorvel
