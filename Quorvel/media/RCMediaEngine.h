// RCMediaEngine: the seam between the recordings framework and the code that
// parses and writes audio. Everything in libquorvel that needs to look inside
// an audio file (durations for repair, metadata, composing, waveforms, title
// writes) asks the process's current engine, so the framework itself links no
// media library. Two engines exist: the in-process one in libquorvel-media
// (RCInProcessMediaEngine.h: apps, the media worker, tests) and the worker
// client in libquorvel (RCMediaWorkerClient.h: the daemon), which runs every
// job in a separate quorvel-media process.
//
// The current engine is set once at start-up (setCurrent) and may be replaced
// by tests; current() may be called from any thread and hands out a shared
// reference, so an engine replaced while a job runs lives until the job ends.
// Every job blocks the calling thread until it has finished; engines allow
// calls from any thread, several at a time.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Quorvel/media/RCMetadataItem.h"
#include "platform/Date.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

// One fragment's used range, for composing.
struct RCComposerSegment {
  platform::URL fragmentURL;
  double contentStart;     // seconds into the fragment's own audio
  double contentDuration;  // seconds of it used
};

// What probing an audio file tells.
struct RCMediaProbe {
  // The file opened and holds an audio stream whose parameters were found.
  bool playable = false;
  // In seconds; NaN when the file does not say.
  double duration = 0;
  // The short name of the container ("mov,mp4,m4a,3gp,3g2,mj2", "flac", "wav").
  std::string containerName;
  // The untagged title and every language-tagged one, as stored in the file.
  std::vector<RCMetadataItem> titleItems;
  // The container's creation time, when it has one.
  std::optional<platform::Date> creationDate;
};

// Called on the job's thread with the fraction done so far, in [0, 1].
using RCMediaProgress = std::function<void(double fraction)>;

class RCMediaEngine {
 public:
  virtual ~RCMediaEngine() = default;

  // Opens `url` and reads its duration and common metadata. Fails when the
  // file cannot be opened (missing, unreadable, not a regular file, not a
  // media file); a media file without audio is a probe that is not playable.
  virtual platform::Result<RCMediaProbe> probe(const platform::URL& url) = 0;

  // Probes every file of `urls`, one result per file in the same order, as
  // probe() would. Callers with many files use it so an engine can answer
  // them in one round trip; the default probes them one by one.
  virtual std::vector<platform::Result<RCMediaProbe>> probeMany(
      const std::vector<platform::URL>& urls);

  // Concatenates the segments' used ranges, in order, into `destination`
  // (replaced atomically), and writes the composed waveform to
  // `waveformDestination` when given. When a segment's fragment holds
  // unusable audio, fails with an RCComposerSegmentError naming it (see
  // RCComposer.h); every other failure says nothing about the fragments.
  virtual platform::Status compose(const std::vector<RCComposerSegment>& segments,
                                   const platform::URL& destination,
                                   const std::optional<platform::URL>& waveformDestination,
                                   const RCMediaProgress& progress) = 0;

  // Decodes `audio` and writes its waveform file to `destination` (replaced
  // atomically).
  virtual platform::Status buildWaveform(const platform::URL& audio,
                                         const platform::URL& destination,
                                         const RCMediaProgress& progress) = 0;

  // Writes `title` for `language` (ISO 639-2 code or BCP-47 tag; empty for
  // the untagged title) into the m4a file `file`, replacing it atomically.
  virtual platform::Status writeTitle(const platform::URL& file, const std::string& title,
                                      const std::string& language) = 0;

  // The process's engine. Without one set, an engine whose every job fails
  // with an error saying that none is installed.
  static std::shared_ptr<RCMediaEngine> current();
  // Installs `engine` (nullptr: back to none) for every later job.
  static void setCurrent(std::shared_ptr<RCMediaEngine> engine);
};

}  // namespace quorvel
