// RCSOrphanHandling: the orphan recovery run over the saved-recordings
// directory, an extension of the recordings model. An orphan is something in
// the directory that no database recording refers to and no client works
// on: a composition bundle, recovered into the database (or deleted when it
// holds no audio), or a bare audio file, deleted when it duplicates a file
// that stays or holds no playable audio and recovered otherwise.
//
// The run is synchronous and blocking (digests, media probes through the
// process's media engine, database writes). It uses the model it was made
// for, so it must be called on that model's queue: in the daemon the service
// serial queue, which it holds for its whole length. Nothing it waits for
// needs that queue. One object per run; not thread-safe.
//
// What it never deletes: anything in the in-use set (the caller's URLs, every
// database recording's file in every capture format, what the run recovers),
// any file that is the same file (device and inode) as one of those under
// another spelling of the directory, anything outside the directory, a file
// whose examination failed (an I/O error, a media worker that died or timed
// out: only a file the media engine read and found without playable audio is
// deleted as unplayable), a bundle that cannot be loaded, and a bundle
// modified in the last minute or that the database names by the time it
// would be removed.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Models/RCURLSet.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/files/RCMD5.h"
#include "platform/URL.h"

namespace quorvel {

// Gives `recording` a title and a date from its audio file: the file's title
// (for several language-tagged titles, the one of the first preferred
// language that has one), else the container's creation date rendered as a
// date and time, else the file's creation date on disk rendered as a date;
// the date is the file's creation date unless the container's was used.
// Returns false, leaving the recording untouched, when the file has no asset
// or no creation date on disk. Blocks until the media engine has read the
// metadata (its completion is called exactly once in every case, a dead
// worker included); never needs the caller's queue.
bool RCSApplyAssetMetadataToRecording(RCSavedRecording& recording);

class RCSOrphanHandling {
 public:
  // Counts of one run, for tests and benchmarks.
  struct Statistics {
    std::size_t listedEntries = 0;
    std::size_t filesDigested = 0;  // _MD5DataForPath calls (orphans and in-use files)
    std::size_t assetsProbed = 0;   // orphans whose audio was examined
    std::size_t recordingsInserted = 0;
    std::size_t itemsDeleted = 0;
  };

  // How old a bundle must be before the run may delete it (an app creates a
  // bundle first and inserts its recording a moment later), and how old a
  // leftover of an interrupted atomic replace before it is removed.
  static constexpr double kMinimumBundleAge = 60;
  static constexpr double kMinimumTempFileAge = 3600;
  // Where the kernel cannot say whether another process has an orphan open
  // (no lease on this file system, or a file of another owner), how long it
  // must have been left unchanged before it may be deleted.
  static constexpr double kMinimumUnleasedFileAge = 60;

  explicit RCSOrphanHandling(RCSavedRecordingsModel& model);
  RCSOrphanHandling(const RCSOrphanHandling&) = delete;
  RCSOrphanHandling& operator=(const RCSOrphanHandling&) = delete;

  // The whole run. `externallyInUseComposedAVURLs` are recordings that
  // clients work on; repeats are harmless. A database that cannot be read
  // ends the run before anything is touched.
  void performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs(
      const std::vector<platform::URL>& externallyInUseComposedAVURLs);

  // The digest of the file at `path`; nullopt when it has no attributes, is
  // empty, or cannot be read (the last logged).
  static std::optional<RCMD5Digest> _MD5DataForPath(const std::string& path);

  const Statistics& statistics() const { return statistics_; }

  // What the run knows of one directory entry (taken once, at listing).
  struct Entry;
  // The run's own file access: sizes and identities of in-use files, and
  // removals confined to the directory.
  class FileManager;

 private:
  // The digest, an empty value for an empty or missing file, or the read
  // error (logged as _MD5DataForPath logs it): the run tells an unreadable
  // file from one that holds nothing.
  static platform::Result<std::optional<RCMD5Digest>> digestLoggingFailure(const std::string& path);
  void _performOrphanRecoveryAndCleanupOfCompositionsWithInUseComposedAVURLs(
      RCURLSet& inUse, FileManager& fileManager,
      const std::vector<platform::URL>& URLsInSavedRecordingsDirectory);
  void _performOrphanRecoveryAndCleanupOfBareAssetsWithInUseComposedAVURLs(
      RCURLSet& inUse, FileManager& fileManager,
      const std::vector<platform::URL>& URLsInSavedRecordingsDirectory);
  void recoverComposition(RCURLSet& inUse, FileManager& fileManager,
                          const std::shared_ptr<class RCComposition>& composition);
  void removeStaleTemporaryFiles(FileManager& fileManager);
  bool databaseNames(const platform::URL& composedAVURL, const std::string& recordingURI);
  // Ends the run after a failed write: the database or a bundle could not
  // take a change, and the disk may be full. Nothing more is removed.
  void stop(const std::string& why);

  RCSavedRecordingsModel& model_;
  Statistics statistics_;
  bool stopped_ = false;
};

}  // namespace quorvel
