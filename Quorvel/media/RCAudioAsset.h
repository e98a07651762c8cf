// RCAudioAsset: an audio file, for its duration and its common metadata
// (titles and creation date), read through the process's media engine
// (RCMediaEngine.h), so in the daemon the file is parsed by the media worker.
//
// assetWithURL probes the file once for its streams and duration; the asset
// holds no file open afterwards. Metadata loads asynchronously on
// RCAssetMetadataLoader's worker, which probes the file again.
// Immutable after creation: every member may be used from any thread.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "Quorvel/media/RCMetadataItem.h"
#include "platform/Date.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

// What the file's common metadata holds.
struct RCCommonMetadata {
  // The untagged title and every language-tagged one, as stored in the file.
  std::vector<RCMetadataItem> titleItems;
  // The container's creation time, when it has one.
  std::optional<platform::Date> creationDate;
};

class RCAudioAsset {
 public:
  using CommonMetadataCompletion =
      std::move_only_function<void(platform::Result<RCCommonMetadata>)>;

  // nullptr when the file cannot be opened (missing, unreadable, not a
  // regular file, not a media file) or holds no audio stream.
  static std::shared_ptr<RCAudioAsset> assetWithURL(const platform::URL& url);
  // The same, telling a file that was read and holds no playable audio
  // (nullptr: not a media file, or no audio stream) from one that could not
  // be examined (an error: I/O failure, no permission, a media worker that
  // died or timed out), which says nothing about its contents.
  static platform::Result<std::shared_ptr<RCAudioAsset>> examineAssetWithURL(
      const platform::URL& url);
  // What examineAssetWithURL finds, from a probe of `url` already made (one
  // result of RCMediaEngine::probeMany, which probes many files at once).
  static platform::Result<std::shared_ptr<RCAudioAsset>> examineAssetWithProbe(
      const platform::URL& url, platform::Result<RCMediaProbe> probe);

  const platform::URL& url() const { return url_; }
  // In seconds; NaN when the file does not say.
  double duration() const { return duration_; }
  // The short name of the container libavformat found ("mov,mp4,m4a,…",
  // "flac", "wav").
  const std::string& containerName() const { return containerName_; }

  // Loads the common metadata on the loader's worker and calls `completion`
  // there exactly once: with the metadata, or with an error when the file
  // can no longer be read (it vanished, was replaced by something else…).
  // The job keeps its own copy of the URL, so the asset may go away first.
  void loadCommonMetadataAsync(CommonMetadataCompletion completion) const;

  // The same, on the calling thread.
  platform::Result<RCCommonMetadata> loadCommonMetadata() const;

  RCAudioAsset(platform::URL url, double duration, std::string containerName);

 private:
  platform::URL url_;
  double duration_;
  std::string containerName_;
};

}  // namespace quorvel
