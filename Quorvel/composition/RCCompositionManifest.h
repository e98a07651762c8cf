// RCCompositionManifest: the contents of a composition bundle's manifest.json,
// and its parser and writer. A value type; parse and serialize are pure
// functions of their input, safe on any thread.
//
// The file (format version 1):
//   {
//     "formatVersion": 1,
//     "composedAVURL": "Walk.m4a",         // name in the recordings directory
//     "composedDuration": 12.5,            // seconds
//     "savedRecordingURI": "quorvel://recording/<UUID>" | null,
//     "fragments": [                       // in composition order
//       { "file": "Walk-1.m4a",            // name inside the bundle
//         "timeRangeInComposition": { "start": 0, "duration": 5 },
//         "contentRange": { "start": 0, "duration": 5 | null },
//         "composed": false,
//         "unreadable": true }             // only when set
//     ]
//   }
// A content duration of null means "to the end of the file": the fragment is
// being captured and its length is not known yet.
//
// parse accepts only that shape: every field present with its type, finite
// non-negative times, plain file names (no '/', no "..") with a capture
// extension, and the format version it knows. Anything else is an error
// naming the first problem; nothing is guessed.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Error.h"

namespace quorvel {

struct RCTimeRange {
  double start = 0;
  double duration = 0;
  double end() const { return start + duration; }
  friend bool operator==(const RCTimeRange&, const RCTimeRange&) = default;
};

struct RCCompositionManifestFragment {
  std::string file;
  RCTimeRange timeRangeInComposition;
  double contentStart = 0;
  // nullopt: to the end of the file (capture in progress).
  std::optional<double> contentDuration;
  bool composed = false;
  // The media engine read its file and found no usable audio (a capture cut
  // off before its header, bytes damaged after the recording): it is left
  // out of the composed audio and takes no time in the composition, is never
  // composed, and its file stays for whoever can still rescue it. The
  // fragment cleanup clears the mark once the file reads again.
  bool unreadable = false;
  friend bool operator==(const RCCompositionManifestFragment&,
                         const RCCompositionManifestFragment&) = default;
};

struct RCCompositionManifest {
  static constexpr int kFormatVersion = 1;
  static constexpr const char* kFileName = "manifest.json";
  // Manifests larger than this are refused unread.
  static constexpr std::size_t kMaximumSize = 4 * 1024 * 1024;

  std::string composedName;
  double composedDuration = 0;
  // Empty when the composition belongs to no database record yet.
  std::string savedRecordingURI;
  std::vector<RCCompositionManifestFragment> fragments;

  static platform::Result<RCCompositionManifest> parse(std::string_view json);
  // Lays the fragments end to end in their order (each takes its content
  // duration, 0 while open-ended or unreadable) and, when there are
  // fragments, makes the composed duration their sum.
  void recomputeTimeRanges();
  // The JSON text; parse(serialize()) gives the manifest back.
  std::string serialize() const;

  friend bool operator==(const RCCompositionManifest&, const RCCompositionManifest&) = default;
};

}  // namespace quorvel
