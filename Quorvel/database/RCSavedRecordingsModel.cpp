// The recordings database on disk.
//
// Opening never creates a database over an existing one: the file is opened
// (created only when missing), PRAGMA user_version is read first, and only a
// file with version 0 and no tables at all is given the schema, inside
// BEGIN IMMEDIATE so two processes opening a new file at once make it once.
// A version above kSchemaVersion, a file SQLite cannot read (SQLITE_NOTADB,
// SQLITE_CORRUPT) and a version-0 file that already holds tables are errors.
//
// Writes take the write lock up front (BEGIN IMMEDIATE) and wait for it up to
// the busy timeout, so an app and the daemon inserting at the same time both
// land: WAL lets readers go on meanwhile.
#include "Quorvel/database/RCSavedRecordingsModel.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <map>
#include <mutex>

#include "Quorvel/database/RCSQLiteDatabase.h"
#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFileConfinement.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "platform/DispatchQueue.h"
#include "platform/Log.h"
#include "platform/URL.h"

namespace quorvel {
namespace {

constexpr const char* kColumns = "SELECT uuid, path, custom_label, date, duration FROM recordings";

constexpr const char* kSchema =
    "CREATE TABLE recordings ("
    " uuid TEXT PRIMARY KEY NOT NULL,"
    " path TEXT NOT NULL DEFAULT '',"
    " custom_label TEXT NOT NULL DEFAULT '',"
    " date REAL NOT NULL,"
    " duration REAL NOT NULL DEFAULT 0);"
    "CREATE INDEX recordings_by_path ON recordings(path);"
    "PRAGMA user_version = 1;";

std::string environment(const char* name) {
  const char* value = std::getenv(name);
  return value ? value : "";
}

std::string standardized(std::string_view path) {
  return platform::URL::fileURLWithPath(path).URLByStandardizingPath().path();
}

struct SharedModels {
  std::mutex mutex;
  std::map<std::pair<platform::DispatchQueue*, std::string>,
           std::shared_ptr<RCSavedRecordingsModel>>
      models;
};

SharedModels& sharedModels() {
  static SharedModels* models = new SharedModels();  // lives until the process ends
  return *models;
}

platform::Error withPath(const platform::Error& error, const std::string& path) {
  return platform::Error(error.domain(), error.code(), path + ": " + error.localizedDescription());
}

}  // namespace

std::string RCSavedRecordingsModel::savedRecordingsDirectory() {
  return RCSavedRecordingsDirectory();
}

void RCSavedRecordingsModel::setSavedRecordingsDirectory(std::optional<std::string> directory) {
  RCSetSavedRecordingsDirectory(std::move(directory));
}

platform::Result<std::shared_ptr<RCSavedRecordingsModel>>
RCSavedRecordingsModel::sharedModelForQueue(platform::DispatchQueue& queue) {
  QV_DCHECK_ON_QUEUE(queue);
  std::string directory = savedRecordingsDirectory();
  SharedModels& shared = sharedModels();
  std::lock_guard lock(shared.mutex);
  auto key = std::make_pair(&queue, directory);
  if (auto found = shared.models.find(key); found != shared.models.end()) return found->second;
  auto model = open(directory, &queue);
  if (!model) return model;
  shared.models.emplace(key, *model);
  return model;
}

platform::Result<std::shared_ptr<RCSavedRecordingsModel>>
RCSavedRecordingsModel::modelWithDirectory(const std::string& directory) {
  return open(standardized(directory), nullptr);
}

void RCSavedRecordingsModel::resetSharedModelsForTesting() {
  SharedModels& shared = sharedModels();
  std::lock_guard lock(shared.mutex);
  shared.models.clear();
}

platform::Result<std::shared_ptr<RCSavedRecordingsModel>> RCSavedRecordingsModel::open(
    const std::string& directory, platform::DispatchQueue* queue) {
  std::string path = directory + "/" + kDatabaseFileName;
  bool trace = environment("SQLITE_AUTO_TRACE") == "1";
  auto opened = RCSQLiteDatabase::open(path, kBusyTimeoutMilliseconds, trace);
  if (!opened) return platform::fail(withPath(opened.error(), path));
  std::unique_ptr<RCSQLiteDatabase> db = std::move(*opened);

  auto fail = [&](const platform::Error& error) {
    platform::Error described = withPath(error, path);
    QV_LOG(platform::kLogLevelError, "ERROR: cannot use the recordings database: {}",
           described.localizedDescription());
    return platform::fail(described);
  };

  // The version and the tables are read in one read transaction, so another
  // process giving a new file its schema meanwhile is seen whole or not at all.
  platform::Result<long long> version = 0;
  platform::Result<long long> tables = 0;
  if (auto begun = db->execute("BEGIN"); !begun) return fail(begun.error());
  version = db->integerForQuery("PRAGMA user_version");
  if (version) tables = db->integerForQuery("SELECT count(*) FROM sqlite_master");
  (void)db->execute("COMMIT");
  if (!version) return fail(version.error());
  if (!tables) return fail(tables.error());
  if (*version > kSchemaVersion) {
    return fail(RCError(RCErrorCodeDatabaseSchemaTooNew,
                        fmt::format("schema version {} is newer than this build knows ({})",
                                    *version, kSchemaVersion)));
  }
  if (*version == 0 && *tables > 0) {
    return fail(RCError(RCErrorCodeDatabaseUnrecognized,
                        "the file holds tables but no schema version of this framework"));
  }

  auto probeColumns = [&]() -> platform::Status {
    if (auto probe = db->prepare(std::string(kColumns) + " LIMIT 0"); !probe) {
      return platform::fail(RCError(
          RCErrorCodeDatabaseUnrecognized,
          "the recordings table lacks expected columns: " + probe.error().localizedDescription()));
    }
    return {};
  };
  // Everything that can refuse the file runs before anything writes to it.
  if (*version == kSchemaVersion) {
    if (auto probed = probeColumns(); !probed) return fail(probed.error());
  }

  auto mode =
      db->textForQueryRetryingWhileBusy("PRAGMA journal_mode=WAL", kBusyTimeoutMilliseconds);
  if (!mode) return fail(mode.error());
  if (!*mode || **mode != "wal") {
    QV_LOG(platform::kLogLevelError, "WARNING: {} stays in journal mode {}", path,
           mode->value_or("(none)"));
  }

  if (*version == 0) {
    if (auto begun = db->execute("BEGIN IMMEDIATE"); !begun) return fail(begun.error());
    auto recheck = db->integerForQuery("PRAGMA user_version");
    auto tables = db->integerForQuery("SELECT count(*) FROM sqlite_master");
    platform::Status made;
    if (!recheck) {
      made = platform::fail(recheck.error());
    } else if (!tables) {
      made = platform::fail(tables.error());
    } else if (*recheck == 0 && *tables == 0) {
      made = db->execute(kSchema);
    } else if (*recheck != kSchemaVersion) {
      made = platform::fail(RCError(RCErrorCodeDatabaseUnrecognized,
                                    "another process gave the new file an unknown schema"));
    }
    if (made) made = db->execute("COMMIT");
    if (!made) {
      (void)db->execute("ROLLBACK");
      return fail(made.error());
    }
  }

  if (auto probed = probeColumns(); !probed) return fail(probed.error());
  return std::shared_ptr<RCSavedRecordingsModel>(
      new RCSavedRecordingsModel(directory, std::move(db), queue));
}

RCSavedRecordingsModel::RCSavedRecordingsModel(std::string directory,
                                               std::unique_ptr<RCSQLiteDatabase> database,
                                               platform::DispatchQueue* queue)
    : directory_(std::move(directory)), queue_(queue), database_(std::move(database)) {}

RCSavedRecordingsModel::~RCSavedRecordingsModel() = default;

void RCSavedRecordingsModel::checkQueue([[maybe_unused]] const char* file,
                                        [[maybe_unused]] int line) const {
#if defined(QUORVEL_DCHECK_IS_ON)
  if (queue_ != nullptr) platform::detail::checkOnQueue(*queue_, file, line);
#endif
}

bool RCSavedRecordingsModel::hasChanges() const {
  checkQueue(__FILE__, __LINE__);
  return !pending_.empty();
}

std::string RCSavedRecordingsModel::storedPathForFile(std::string_view path) const {
  checkQueue(__FILE__, __LINE__);
  platform::URL url = platform::URL::fileURLWithPath(path);
  if (auto relative = RCPathRelativeToDirectory(url, directory_)) return *relative;
  return url.URLByStandardizingPath().path();
}

platform::Result<std::vector<std::shared_ptr<RCSavedRecording>>> RCSavedRecordingsModel::fetch(
    std::string_view where, std::string_view value) {
  checkQueue(__FILE__, __LINE__);
  std::string sql = std::string(kColumns) + std::string(where) + " ORDER BY date, rowid";
  auto statement = database_->prepare(sql);
  if (!statement) return platform::fail(statement.error());
  if (!where.empty()) statement->bind(1, value);
  std::erase_if(recordingsByUUID_, [](const auto& entry) { return entry.second.expired(); });
  std::vector<std::shared_ptr<RCSavedRecording>> recordings;
  for (;;) {
    auto row = statement->step();
    if (!row) return platform::fail(row.error());
    if (!*row) break;
    std::string uuidText = statement->text(0);
    auto uuid = platform::UUID::fromString(uuidText);
    if (!uuid) {
      QV_LOG(platform::kLogLevelError, "WARNING: skipping a recording with the bad UUID '{}'",
             uuidText);
      continue;
    }
    std::string storedPath = statement->text(1);
    std::string label = statement->text(2);
    platform::Date date = platform::Date::dateWithTimeIntervalSince1970(statement->real(3));
    double duration = statement->real(4);
    std::shared_ptr<RCSavedRecording> recording = recordingsByUUID_[uuid->string()].lock();
    if (recording) {
      if (!recording->hasChanges()) {
        recording->storedPath_ = std::move(storedPath);
        recording->customLabel_ = std::move(label);
        recording->date_ = date;
        recording->duration_ = duration;
      }
    } else {
      recording = std::make_shared<RCSavedRecording>(weak_from_this(), directory_, *uuid,
                                                     std::move(storedPath), std::move(label), date,
                                                     duration, false);
      recordingsByUUID_[uuid->string()] = recording;
    }
    recordings.push_back(std::move(recording));
  }
  return recordings;
}

platform::Status RCSavedRecordingsModel::enumerateExistingRecordingsWithBlock(
    const RecordingVisitor& block) {
  checkQueue(__FILE__, __LINE__);
  auto recordings = fetch("", "");
  if (!recordings) return platform::fail(recordings.error());
  for (const auto& recording : pending_) {
    if (recording->isNew_) recordings->push_back(recording);
  }
  bool stop = false;
  for (const auto& recording : *recordings) {
    block(recording, stop);
    if (stop) break;
  }
  return {};
}

platform::Status RCSavedRecordingsModel::enumerateRecordingFilePathsWithBlock(
    const std::function<void(const std::string& path)>& block) {
  checkQueue(__FILE__, __LINE__);
  auto statement = database_->prepare("SELECT path FROM recordings");
  if (!statement) return platform::fail(statement.error());
  std::vector<std::string> stored;
  for (;;) {
    auto row = statement->step();
    if (!row) return platform::fail(row.error());
    if (!*row) break;
    if (!statement->isNull(0)) stored.push_back(statement->text(0));
  }
  for (const auto& recording : pending_) {
    if (recording->isNew_) stored.push_back(recording->storedPath_);
  }
  std::string path;
  for (const std::string& storedPath : stored) {
    if (storedPath.empty()) continue;
    path = storedPath.front() == '/' ? storedPath : directory_ + "/" + storedPath;
    block(path);
  }
  return {};
}

void RCSavedRecordingsModel::performWithSavingDisabled(const std::function<void()>& block) {
  checkQueue(__FILE__, __LINE__);
  ++savingDisabledDepth_;
  struct Restore {
    int& depth;
    ~Restore() { --depth; }
  } restore{savingDisabledDepth_};
  block();
}

platform::Status RCSavedRecordingsModel::saveIfNecessary() {
  checkQueue(__FILE__, __LINE__);
  if (pending_.empty()) return {};
  auto fail = [&](const platform::Error& error) {
    (void)database_->execute("ROLLBACK");
    QV_LOG(platform::kLogLevelError, "ERROR: saving the recordings database failed: {}",
           error.localizedDescription());
    return platform::fail(error);
  };
  if (auto begun = database_->execute("BEGIN IMMEDIATE"); !begun) {
    QV_LOG(platform::kLogLevelError, "ERROR: saving the recordings database failed: {}",
           begun.error().localizedDescription());
    return begun;
  }
  for (const auto& recording : pending_) {
    const char* sql = recording->isNew_
                          ? "INSERT INTO recordings (path, custom_label, date, duration, uuid) "
                            "VALUES (?, ?, ?, ?, ?)"
                          : "UPDATE recordings SET path = ?, custom_label = ?, date = ?, "
                            "duration = ? WHERE uuid = ?";
    auto statement = database_->prepare(sql);
    if (!statement) return fail(statement.error());
    statement->bind(1, recording->storedPath_);
    statement->bind(2, recording->customLabel_);
    statement->bind(3, recording->date_.timeIntervalSince1970());
    statement->bind(4, recording->duration_);
    statement->bind(5, recording->uniqueID_.string());
    if (auto done = statement->run(); !done) return fail(done.error());
  }
  if (auto committed = database_->execute("COMMIT"); !committed) return fail(committed.error());
  for (const auto& recording : pending_) {
    recording->isNew_ = false;
    recording->isChanged_ = false;
  }
  pending_.clear();
  return {};
}

void RCSavedRecordingsModel::recordingDidChange(
    const std::shared_ptr<RCSavedRecording>& recording) {
  checkQueue(__FILE__, __LINE__);
  bool listed = false;
  for (const auto& pending : pending_) listed = listed || pending == recording;
  if (!listed) pending_.push_back(recording);
  if (savingDisabledDepth_ == 0) (void)saveIfNecessary();
}

std::shared_ptr<RCSavedRecording> RCSavedRecordingsModel::insertRecordingWithAudioFile(
    std::string_view path, double duration, platform::Date date) {
  checkQueue(__FILE__, __LINE__);
  platform::URL url = platform::URL::fileURLWithPath(path);
  std::string title = url.URLByDeletingPathExtension().lastPathComponent();
  platform::UUID uuid = platform::UUID::random();
  auto recording = std::make_shared<RCSavedRecording>(
      weak_from_this(), directory_, uuid, path.empty() ? std::string() : storedPathForFile(path),
      std::move(title), date, duration, true);
  recordingsByUUID_[uuid.string()] = recording;
  pending_.push_back(recording);
  if (savingDisabledDepth_ == 0) (void)saveIfNecessary();
  return recording;
}

platform::Result<std::shared_ptr<RCSavedRecording>>
RCSavedRecordingsModel::recordingWithURIRepresentation(std::string_view uri) {
  checkQueue(__FILE__, __LINE__);
  auto uuid = RCSavedRecording::uniqueIDFromURIRepresentation(uri);
  if (!uuid) return std::shared_ptr<RCSavedRecording>();
  for (const auto& recording : pending_) {
    if (recording->isNew_ && recording->uniqueID_ == *uuid) return recording;
  }
  auto found = fetch(" WHERE uuid = ?", uuid->string());
  if (!found) return platform::fail(found.error());
  return found->empty() ? nullptr : found->front();
}

platform::Result<std::shared_ptr<RCSavedRecording>> RCSavedRecordingsModel::recordingWithURL(
    const platform::URL& url) {
  checkQueue(__FILE__, __LINE__);
  std::string stored = storedPathForFile(url.path());
  for (const auto& recording : pending_) {
    if (recording->isNew_ && recording->storedPath_ == stored) return recording;
  }
  auto found = fetch(" WHERE path = ?", stored);
  if (!found) return platform::fail(found.error());
  return found->empty() ? nullptr : found->front();
}

}  // namespace quorvel
