// The recordings database on a real SQLite file: where it lives, what it
// keeps, how saving is deferred, how it refuses files it must not touch, and
// two writers (connections, processes) inserting at the same time.
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <set>
#include <thread>

#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/errors/RCErrors.h"
#include "platform/SerialQueue.h"
#include "tests/support/RecordingsDirectoryFixture.h"
#include "tests/support/ScopedEnvironment.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using testing::RecordingsDirectoryTest;

std::shared_ptr<RCSavedRecordingsModel> openModel(const std::string& directory) {
  auto model = RCSavedRecordingsModel::modelWithDirectory(directory);
  EXPECT_TRUE(model) << model.error();
  return model ? *model : nullptr;
}

std::vector<std::shared_ptr<RCSavedRecording>> allRecordings(RCSavedRecordingsModel& model) {
  std::vector<std::shared_ptr<RCSavedRecording>> recordings;
  auto status = model.enumerateExistingRecordingsWithBlock(
      [&](const std::shared_ptr<RCSavedRecording>& recording, bool&) {
        recordings.push_back(recording);
      });
  EXPECT_TRUE(status) << status.error();
  return recordings;
}

std::set<std::string> fileNames(RCSavedRecordingsModel& model) {
  std::set<std::string> names;
  for (const auto& recording : allRecordings(model))
    names.insert(recording->url()->lastPathComponent());
  return names;
}

using RecordingsModelTest = RecordingsDirectoryTest;

TEST_F(RecordingsModelTest, DirectoryComesFromSettingThenEnvironmentThenXDGThenHomeAndIsCreated) {
  RCSavedRecordingsModel::setSavedRecordingsDirectory(std::nullopt);
  const std::string env = (root_ / "env/./a/../Recs").string(), xdg = (root_ / "xdg").string(),
                    home = (root_ / "home").string();
  struct Case {
    const char *dir, *xdg, *home;
    fs::path expected;
  };
  for (const Case& c : {Case{env.c_str(), xdg.c_str(), home.c_str(), root_ / "env/Recs"},
                        {nullptr, xdg.c_str(), home.c_str(), root_ / "xdg/quorvel/Recordings"},
                        {nullptr, "relative/is/ignored", home.c_str(),
                         root_ / "home/.local/share/quorvel/Recordings"}}) {
    testing::ScopedEnvironment scoped{
        {"QUORVEL_RECORDINGS_DIR", c.dir}, {"XDG_DATA_HOME", c.xdg}, {"HOME", c.home}};
    EXPECT_EQ(RCSavedRecordingsModel::savedRecordingsDirectory(), c.expected.string());
    EXPECT_TRUE(fs::is_directory(c.expected));
  }
  RCSavedRecordingsModel::setSavedRecordingsDirectory((root_ / "set").string());
  testing::ScopedEnvironment dir{{"QUORVEL_RECORDINGS_DIR", env.c_str()}};
  EXPECT_EQ(RCSavedRecordingsModel::savedRecordingsDirectory(), (root_ / "set").string());
}

TEST_F(RecordingsModelTest, InsertedRecordingsPersistWithTitleURLURIAndDate) {
  auto model = openModel(recordings_);
  ASSERT_TRUE(model);
  platform::Date date = platform::Date::dateWithTimeIntervalSince1970(1700000000.25);
  auto walk = model->insertRecordingWithAudioFile(recordingsPath("Morning Walk.m4a"), 12.5, date);
  auto outside = model->insertRecordingWithAudioFile((root_ / "elsewhere.wav").string(), 1, date);
  EXPECT_EQ(walk->customLabel(), "Morning Walk");
  EXPECT_EQ(walk->url()->path(), recordingsPath("Morning Walk.m4a"));
  EXPECT_EQ(walk->URIRepresentation(), "quorvel://recording/" + walk->uniqueID().string());
  EXPECT_FALSE(model->hasChanges());

  // Another connection (another app) sees both, with the same fields.
  auto other = openModel(recordings_);
  auto seen = allRecordings(*other);
  ASSERT_EQ(seen.size(), 2u);
  EXPECT_EQ(seen[0]->uniqueID(), walk->uniqueID());
  EXPECT_EQ(seen[0]->customLabel(), "Morning Walk");
  EXPECT_EQ(*seen[0]->url(), *walk->url());
  EXPECT_NEAR(seen[0]->date().timeIntervalSince1970(), 1700000000.25, 1e-3);
  EXPECT_DOUBLE_EQ(seen[0]->duration(), 12.5);
  EXPECT_EQ(seen[1]->url()->path(), (root_ / "elsewhere.wav").string());

  // Lookups by URI and by URL, the latter also through an unstandardized URL.
  auto byURI = other->recordingWithURIRepresentation(walk->URIRepresentation());
  ASSERT_TRUE(byURI && *byURI);
  EXPECT_EQ((*byURI)->uniqueID(), walk->uniqueID());
  auto byURL = other->recordingWithURL(
      platform::URL::fileURLWithPath(recordings_.string() + "/x/../Morning Walk.m4a"));
  ASSERT_TRUE(byURL && *byURL);
  EXPECT_EQ(*byURL, seen[0]);  // one object per recording
  EXPECT_EQ(*other->recordingWithURIRepresentation("quorvel://recording/nope"), nullptr);
  EXPECT_EQ(*other->recordingWithURL(platform::URL::fileURLWithPath("/none.m4a")), nullptr);

  // A change saved by the first model reaches objects the second one holds.
  walk->setCustomLabel("Evening Walk");
  allRecordings(*other);
  EXPECT_EQ(seen[0]->customLabel(), "Evening Walk");
}

TEST_F(RecordingsModelTest, ChangesWithSavingDisabledWaitForSaveIfNecessary) {
  auto model = openModel(recordings_);
  auto observer = openModel(recordings_);
  std::shared_ptr<RCSavedRecording> inserted;
  model->performWithSavingDisabled([&] {
    model->performWithSavingDisabled([&] {
      inserted =
          model->insertRecordingWithAudioFile(recordingsPath("a.m4a"), 3, platform::Date::now());
    });
    inserted->setCustomLabel("Recovered");
    inserted->setDate(platform::Date::dateWithTimeIntervalSince1970(86400));
  });
  EXPECT_TRUE(model->hasChanges());
  EXPECT_TRUE(allRecordings(*observer).empty());
  // The model itself already lists it.
  ASSERT_EQ(allRecordings(*model).size(), 1u);
  ASSERT_TRUE(model->saveIfNecessary());
  EXPECT_FALSE(model->hasChanges());
  auto seen = allRecordings(*observer);
  ASSERT_EQ(seen.size(), 1u);
  EXPECT_EQ(seen[0]->customLabel(), "Recovered");
  EXPECT_NEAR(seen[0]->date().timeIntervalSince1970(), 86400, 1e-6);
  EXPECT_TRUE(model->saveIfNecessary());  // nothing to do
}

TEST_F(RecordingsModelTest, UnusableDatabasesAreReportedAndLeftExactlyAsTheyWere) {
  std::string path = recordingsPath("Recordings.db");
  struct Case {
    std::string name;
    std::function<void()> make;
    RCErrorCode expected;
  };
  auto makeWithSQL = [&](const char* sql) {
    return [&, sql] {
      sqlite3* db = nullptr;
      ASSERT_EQ(sqlite3_open(path.c_str(), &db), SQLITE_OK);
      ASSERT_EQ(sqlite3_exec(db, sql, nullptr, nullptr, nullptr), SQLITE_OK);
      sqlite3_close(db);
    };
  };
  std::vector<Case> cases = {
      {"garbage", [&] { std::ofstream(path) << std::string(5000, 'x'); },
       RCErrorCodeDatabaseUnreadable},
      {"damaged header",
       [&] {
         makeWithSQL("CREATE TABLE t(x); INSERT INTO t VALUES (1);")();
         std::fstream file(path, std::ios::in | std::ios::out | std::ios::binary);
         file.seekp(0);
         file << "SQLite formax 3";  // a damaged magic string
       },
       RCErrorCodeDatabaseUnreadable},
      {"newer schema",
       makeWithSQL("CREATE TABLE recordings(uuid TEXT, future BLOB); PRAGMA user_version = 7;"),
       RCErrorCodeDatabaseSchemaTooNew},
      {"foreign tables", makeWithSQL("CREATE TABLE photos(id INTEGER);"),
       RCErrorCodeDatabaseUnrecognized},
      {"same version, other columns",
       makeWithSQL("CREATE TABLE recordings(id INTEGER); PRAGMA user_version = 1;"),
       RCErrorCodeDatabaseUnrecognized},
  };
  for (const Case& c : cases) {
    fs::remove(path);
    c.make();
    std::string before = testing::readFile(path);
    auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_);
    ASSERT_FALSE(model) << c.name;
    EXPECT_EQ(model.error().domain(), RCErrorDomain) << c.name;
    EXPECT_EQ(model.error().code(), c.expected) << c.name << ": " << model.error();
    EXPECT_NE(model.error().localizedDescription().find("Recordings.db"), std::string::npos);
    EXPECT_TRUE(testing::readFile(path) == before) << c.name << ": the file was changed";
    EXPECT_FALSE(fs::exists(path + "-wal")) << c.name;
  }
  EXPECT_TRUE(logged("ERROR: cannot use the recordings database"));
}

TEST_F(RecordingsModelTest, SharedModelIsOnePerQueueAndDirectory) {
  platform::SerialQueue first("first");
  platform::SerialQueue second("second");
  std::shared_ptr<RCSavedRecordingsModel> a, b, c;
  first.sync([&] {
    a = *RCSavedRecordingsModel::sharedModelForQueue(first);
    b = *RCSavedRecordingsModel::sharedModelForQueue(first);
    a->insertRecordingWithAudioFile(recordingsPath("x.m4a"), 1, platform::Date::now());
  });
  second.sync([&] { c = *RCSavedRecordingsModel::sharedModelForQueue(second); });
  EXPECT_EQ(a, b);
  EXPECT_NE(a, c);
  second.sync([&] { EXPECT_EQ(allRecordings(*c).size(), 1u); });
}

TEST_F(RecordingsModelTest, AutoTraceLogsEveryStatementAtLevel7) {
  testing::ScopedEnvironment trace{{"SQLITE_AUTO_TRACE", "1"}};
  openModel(recordings_)
      ->insertRecordingWithAudioFile(recordingsPath("Traced.m4a"), 2, platform::Date::now());
  EXPECT_TRUE(std::ranges::any_of(log_.lines(), [](const testing::LogLine& line) {
    return line.level == platform::kLogLevelDebug &&
           line.text.starts_with("[RCSQLiteDatabase] SQL: INSERT INTO recordings") &&
           line.text.contains("'Traced'");
  }));
  trace.unset("SQLITE_AUTO_TRACE");
  auto quiet = openModel(recordings_);
  const std::size_t before = log_.lines().size();
  allRecordings(*quiet);
  EXPECT_EQ(log_.lines().size(), before);
}

TEST_F(RecordingsModelTest, AWriterHoldingTheLockDelaysButDoesNotLoseAnInsert) {
  auto model = openModel(recordings_);
  sqlite3* other = nullptr;
  ASSERT_EQ(sqlite3_open(recordingsPath("Recordings.db").c_str(), &other), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(other,
                         "BEGIN IMMEDIATE; INSERT INTO recordings (uuid, path, date) VALUES "
                         "('E621E1F8-C36C-495A-93FC-0C247A3E6E5F', 'held.m4a', 0);",
                         nullptr, nullptr, nullptr),
            SQLITE_OK);
  std::thread writer([&] {
    model->insertRecordingWithAudioFile(recordingsPath("waiting.m4a"), 1, platform::Date::now());
  });
  ASSERT_EQ(sqlite3_exec(other, "COMMIT", nullptr, nullptr, nullptr), SQLITE_OK);
  writer.join();
  sqlite3_close(other);
  EXPECT_FALSE(model->hasChanges());
  EXPECT_EQ(fileNames(*openModel(recordings_)), (std::set<std::string>{"held.m4a", "waiting.m4a"}));
}

TEST_F(RecordingsModelTest, TwoProcessesInsertingAtOnceBothLand) {
  constexpr int kEach = 150;
  // Both processes open the new database at the same time too.
  int gate[2];
  ASSERT_EQ(::pipe(gate), 0);
  pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    char go;
    ::close(gate[1]);
    if (::read(gate[0], &go, 1) != 1) ::_exit(3);
    auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_);
    if (!model) {
      fmt::print(stderr, "child: {}\n", model.error().description());
      ::_exit(1);
    }
    for (int i = 0; i < kEach; ++i) {
      (*model)->insertRecordingWithAudioFile(recordingsPath("child " + std::to_string(i) + ".m4a"),
                                             i, platform::Date::now());
      if ((*model)->hasChanges()) ::_exit(2);
    }
    ::_exit(0);
  }
  ::close(gate[0]);
  ASSERT_EQ(::write(gate[1], "g", 1), 1);
  ::close(gate[1]);
  auto model = openModel(recordings_);
  ASSERT_TRUE(model);
  for (int i = 0; i < kEach; ++i) {
    model->insertRecordingWithAudioFile(recordingsPath("parent " + std::to_string(i) + ".m4a"), i,
                                        platform::Date::now());
    ASSERT_FALSE(model->hasChanges());
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  const auto names = fileNames(*model);
  EXPECT_EQ(names.size(), 2u * kEach);
  EXPECT_TRUE(names.contains("child 149.m4a") && names.contains("parent 149.m4a"));
}

}  // namespace
}  // namespace quorvel
