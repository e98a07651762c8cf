// RCSavedRecordingsModel: the recordings database, Recordings.db in the
// saved-recordings directory (SQLite, WAL, busy timeout, so client apps and
// the daemon share the file; schema versioned with PRAGMA user_version).
//
// A model is bound to the queue it was made for (sharedModelForQueue) and
// must be used on that queue only (debug builds check every member but
// directory() and abort elsewhere); a model from modelWithDirectory is bound
// to no queue and must be used from one thread at a time. Its recordings
// follow the same rule.
//
// Saving: each change is saved at once, except inside performWithSavingDisabled,
// where changes wait for saveIfNecessary. A database that cannot be read, that
// holds tables this framework did not create, or that a newer schema wrote is
// reported as an error and left untouched: no new database is ever made over
// an existing file.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "Quorvel/database/RCSavedRecording.h"
#include "platform/Date.h"
#include "platform/Error.h"

namespace platform {
class DispatchQueue;
}  // namespace platform

namespace quorvel {

class RCSQLiteDatabase;

class RCSavedRecordingsModel : public std::enable_shared_from_this<RCSavedRecordingsModel> {
 public:
  static constexpr int kSchemaVersion = 1;
  static constexpr const char* kDatabaseFileName = "Recordings.db";
  static constexpr int kBusyTimeoutMilliseconds = 10000;

  // The saved-recordings directory as an absolute, standardized path: the
  // directory set with setSavedRecordingsDirectory, else $QUORVEL_RECORDINGS_DIR,
  // else ${XDG_DATA_HOME:-~/.local/share}/quorvel/Recordings. Created (with
  // its parents) when missing. Thread-safe.
  static std::string savedRecordingsDirectory();
  // Sets the directory (the daemon's --recordings-dir, tests); nullopt goes
  // back to the environment. Thread-safe.
  static void setSavedRecordingsDirectory(std::optional<std::string> directory);

  // The model of the saved-recordings directory bound to `queue`: one per
  // queue and directory, kept for the life of the process. Must be called on
  // `queue`. Fails when the database cannot be opened or used (see above).
  static platform::Result<std::shared_ptr<RCSavedRecordingsModel>> sharedModelForQueue(
      platform::DispatchQueue& queue);
  // A new model of the database in `directory`, bound to no queue (apps,
  // tools, tests). Any thread, one at a time.
  static platform::Result<std::shared_ptr<RCSavedRecordingsModel>> modelWithDirectory(
      const std::string& directory);
  // Forgets the shared models (tests that switch directories).
  static void resetSharedModelsForTesting();

  ~RCSavedRecordingsModel();
  RCSavedRecordingsModel(const RCSavedRecordingsModel&) = delete;
  RCSavedRecordingsModel& operator=(const RCSavedRecordingsModel&) = delete;

  const std::string& directory() const { return directory_; }

  // Calls `block` synchronously once per recording in the database (as it is
  // now, other processes' saved changes included), plus recordings inserted
  // but not saved yet; `stop` ends the walk. A failed read calls no block and
  // returns the error: callers must not take an empty walk for an empty
  // database then.
  using RecordingVisitor =
      std::function<void(const std::shared_ptr<RCSavedRecording>& recording, bool& stop)>;
  platform::Status enumerateExistingRecordingsWithBlock(const RecordingVisitor& block);

  // Calls `block` with the absolute path of the audio file of every
  // recording that enumerateExistingRecordingsWithBlock would visit (those
  // without a file are skipped), without making recording objects: for walks
  // over a whole large database that need only its files. A failed read
  // calls no block and returns the error.
  platform::Status enumerateRecordingFilePathsWithBlock(
      const std::function<void(const std::string& path)>& block);

  // Runs `block` synchronously with this model's own saving suspended;
  // changes made meanwhile wait for saveIfNecessary. Nests.
  void performWithSavingDisabled(const std::function<void()>& block);

  // Writes pending changes in one transaction. Nothing to do: success. On
  // failure the changes stay pending and the error is returned.
  platform::Status saveIfNecessary();
  bool hasChanges() const;

  // Inserts a recording of the audio file at `path` (absolute), with its
  // duration in seconds and date; its title is the file name without its
  // extension. Saved at once unless saving is disabled; a failed immediate
  // save is logged and stays pending for saveIfNecessary. Never null.
  std::shared_ptr<RCSavedRecording> insertRecordingWithAudioFile(std::string_view path,
                                                                 double duration,
                                                                 platform::Date date);

  // The recording a URIRepresentation names; nullptr when there is none.
  platform::Result<std::shared_ptr<RCSavedRecording>> recordingWithURIRepresentation(
      std::string_view uri);
  // The recording whose audio file is `url` (compared standardized); nullptr
  // when there is none.
  platform::Result<std::shared_ptr<RCSavedRecording>> recordingWithURL(const platform::URL& url);

 private:
  friend class RCSavedRecording;
  RCSavedRecordingsModel(std::string directory, std::unique_ptr<RCSQLiteDatabase> database,
                         platform::DispatchQueue* queue);
  static platform::Result<std::shared_ptr<RCSavedRecordingsModel>> open(
      const std::string& directory, platform::DispatchQueue* queue);

  // Aborts in debug builds when a queue-bound model is used off its queue,
  // naming the calling member's line (see QV_CHECK_MODEL_QUEUE).
  void checkQueue(const char* file, int line) const;
  void recordingDidChange(const std::shared_ptr<RCSavedRecording>& recording);
  platform::Result<std::vector<std::shared_ptr<RCSavedRecording>>> fetch(std::string_view where,
                                                                         std::string_view value);
  std::string storedPathForFile(std::string_view path) const;

  // Fixed at creation; any thread.
  std::string directory_;
  platform::DispatchQueue* queue_;

  // Bound queue only (one thread at a time for an unbound model):
  std::unique_ptr<RCSQLiteDatabase> database_;
  int savingDisabledDepth_ = 0;
  // Changed or inserted recordings not saved yet, in the order of their first change.
  std::vector<std::shared_ptr<RCSavedRecording>> pending_;
  // One object per recording while someone holds it.
  std::unordered_map<std::string, std::weak_ptr<RCSavedRecording>> recordingsByUUID_;
};

}  // namespace quorvel
