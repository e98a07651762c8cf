// The orphan recovery run on a real recordings directory: real audio made by
// the tests, a real database, the in-process media engine. Checks what stays,
// what goes, what is inserted with which title, and what is digested.
#include "Models/RCSavedRecordingsModel+RCSOrphanHandling.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <set>

#include "Models/RCPathOrder.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/files/RCFileCreationDate.h"
#include "Quorvel/locale/RCLocalizedRecordingDate.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/DelegatingMediaEngine.h"
#include "tests/support/RecordingsDirectoryFixture.h"
#include "tests/support/ScopedEnvironment.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;

// The in-process engine, with a hook before each probe (which may fail it
// or change the file) and the files of every batch of probes remembered.
class ProbeHookEngine : public testing::DelegatingMediaEngine {
 public:
  explicit ProbeHookEngine(std::function<platform::Status(const platform::URL&)> hook = {})
      : hook_(std::move(hook)) {}
  platform::Result<RCMediaProbe> probe(const platform::URL& url) override {
    if (auto hooked = hook_ ? hook_(url) : platform::Status(); !hooked)
      return platform::fail(hooked.error());
    return DelegatingMediaEngine::probe(url);
  }
  std::vector<platform::Result<RCMediaProbe>> probeMany(
      const std::vector<platform::URL>& urls) override {
    batches.emplace_back();
    for (const platform::URL& url : urls) batches.back().push_back(url.lastPathComponent());
    return DelegatingMediaEngine::probeMany(urls);
  }
  std::vector<std::vector<std::string>> batches;

 private:
  std::function<platform::Status(const platform::URL&)> hook_;
};

class OrphanHandlingTest : public testing::RecordingsDirectoryTest {
 protected:
  void TearDown() override {
    RCUseInProcessMediaEngine();
    RecordingsDirectoryTest::TearDown();
  }
  std::shared_ptr<RCSavedRecordingsModel> model() {
    if (!model_) {
      auto opened = RCSavedRecordingsModel::modelWithDirectory(
          RCSavedRecordingsModel::savedRecordingsDirectory());
      EXPECT_TRUE(opened) << opened.error();
      model_ = *opened;
    }
    return model_;
  }
  void tone(const std::string& name, double seconds, double frequency = 440) {
    const std::string format = fs::path(name).extension().string().substr(1);
    ASSERT_TRUE(testing::writeTone(recordingsPath(name), seconds, format, 44100, 1, frequency));
  }
  void copy(const std::string& from, const std::string& to) {
    fs::copy_file(recordingsPath(from), recordingsPath(to));
  }
  auto insert(const std::string& name) {
    return model()->insertRecordingWithAudioFile(recordingsPath(name), 1.0, platform::Date::now());
  }
  static void age(const fs::path& path, double seconds) {
    fs::last_write_time(
        path, fs::last_write_time(path) - std::chrono::duration_cast<fs::file_time_type::duration>(
                                              std::chrono::duration<double>(seconds)));
  }
  RCSOrphanHandling::Statistics run(const std::vector<platform::URL>& inUse = {}) {
    RCSOrphanHandling handling(*model());
    handling.performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs(inUse);
    return handling.statistics();
  }
  // The file names of the database's recordings.
  std::set<std::string> recorded() {
    std::set<std::string> found;
    EXPECT_TRUE(model()->enumerateExistingRecordingsWithBlock([&](const auto& recording, bool&) {
      found.insert(recording->url() ? recording->url()->lastPathComponent() : "");
    }));
    return found;
  }
  bool present(const std::string& name) const { return fs::exists(recordingsPath(name)); }
  void expectPresent(std::initializer_list<std::string> names, bool there = true) {
    for (const std::string& name : names) EXPECT_EQ(present(name), there) << name;
  }
  // Makes every database recording an orphan: a new, empty database.
  void forgetDatabase() {
    model_.reset();
    for (const char* suffix : {"", "-wal", "-shm"})
      fs::remove(recordingsPath(std::string(RCSavedRecordingsModel::kDatabaseFileName) + suffix));
  }
  // A recording `name` with one fragment of a second, not composed.
  void makeBundle(const std::string& name) {
    const std::string take = (root_ / "take.wav").string();
    ASSERT_TRUE(testing::writeTone(take, 1.0, "wav"));
    auto editor = RCCompositionEditor::createCompositionForNewRecording(*model(), name);
    ASSERT_TRUE(editor) << editor.error();
    ASSERT_TRUE(editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(take)));
  }

  std::shared_ptr<RCSavedRecordingsModel> model_;
};

TEST(PathOrderTest, ShorterFirstThenDigitRunsByValue) {
  std::vector<std::string> paths{"/r/13.m4a", "/r/10.m4a",      "/r/9.m4a",  "/r/12.m4a",
                                 "/r/b.m4a",  "/r/Take 12.m4a", "/r/B.m4a",  "/r/Take 2.m4a",
                                 "/r/😀.m4a",  "/r/ab.m4a",      "/r/007.m4a"};
  std::sort(paths.begin(), paths.end(), RCPathOrderLess);
  EXPECT_EQ(paths, (std::vector<std::string>{"/r/9.m4a", "/r/B.m4a", "/r/b.m4a", "/r/10.m4a",
                                             "/r/12.m4a", "/r/13.m4a", "/r/ab.m4a", "/r/😀.m4a",
                                             "/r/007.m4a", "/r/Take 2.m4a", "/r/Take 12.m4a"}));
  EXPECT_EQ(RCUTF16Length("😀é"), 3u);
  EXPECT_EQ(RCNumericCompare("a01", "a1"), 0);
}

// Identical orphans keep the first in path order, a copy of a database
// recording's file goes, same size with other bytes stays, empty and
// unplayable files go, other extensions stay, and only files whose sizes
// collide are digested. The orphans of a size of their own are probed in one
// batch before the pass, which uses each answer for its own file.
TEST_F(OrphanHandlingTest, BareAssetsKeepOneOfEachAndDigestOnlySizeCollisions) {
  tone("Kept.m4a", 1.0);
  insert("Kept.m4a");
  copy("Kept.m4a", "Copy of kept.m4a");
  copy("Kept.m4a", "Same size.m4a");
  {
    std::string bytes = testing::readFile(recordingsPath("Same size.m4a"));
    bytes[bytes.size() / 2] = char(bytes[bytes.size() / 2] ^ 0x55);
    testing::writeFile(recordingsPath("Same size.m4a"), bytes);
  }
  tone("Recording.m4a", 2.0, 330);
  copy("Recording.m4a", "Recording 2.m4a");
  tone("10.wav", 0.5);
  copy("10.wav", "9.wav");
  tone("12.flac", 0.5);
  copy("12.flac", "13.flac");
  testing::writeFile(recordingsPath("Empty.m4a"), "");
  testing::writeFile(recordingsPath("Noise.m4a"), std::string(3000, 'x'));
  tone("Unique.m4a", 1.5);
  copy("Recording.m4a", "Upper.M4A");
  copy("Recording.m4a", "Other.mp3");
  fs::create_directory(recordingsPath("Folder.m4a"));
  auto engine = std::make_shared<ProbeHookEngine>();
  RCMediaEngine::setCurrent(engine);

  auto statistics = run();

  EXPECT_EQ(engine->batches, (std::vector<std::vector<std::string>>{{"Noise.m4a", "Unique.m4a"}}));
  expectPresent({"Kept.m4a", "Same size.m4a", "Recording.m4a", "9.wav", "12.flac", "Unique.m4a"});
  EXPECT_EQ(recorded(), (std::set<std::string>{"Kept.m4a", "Same size.m4a", "Recording.m4a",
                                               "9.wav", "12.flac", "Unique.m4a"}));
  expectPresent(
      {"Copy of kept.m4a", "Recording 2.m4a", "10.wav", "13.flac", "Empty.m4a", "Noise.m4a"},
      false);
  expectPresent({"Upper.M4A", "Other.mp3", "Folder.m4a"});
  EXPECT_EQ(log_.count("orphanPath = Copy of kept.m4a matches existing file = Kept.m4a"), 1u);
  EXPECT_EQ(log_.count("orphanPath = Empty.m4a matches"), 0u);
  EXPECT_EQ(log_.count("'Empty.m4a' already has a duplicate"), 1u);
  EXPECT_EQ(log_.count("'Noise.m4a' unable to load AVURLAsset"), 1u);
  // Kept, its copy and the changed copy; each identical pair; nothing else.
  EXPECT_EQ(statistics.filesDigested, 9u);
  EXPECT_EQ(statistics.assetsProbed, 6u);  // the five unique orphans and Noise
  EXPECT_EQ(statistics.recordingsInserted, 5u);
}

// Bundles: one a client names through "..", one recovered into the database
// with its record written into its manifest (though files of its name
// outside the directory are in use), an empty old one removed, an empty
// young one and an unloadable one left alone.
TEST_F(OrphanHandlingTest, CompositionBundlesAreRecoveredRemovedOrLeftAlone) {
  for (const char* name : {"Walk", "Stray"}) ASSERT_NO_FATAL_FAILURE(makeBundle(name));
  for (const char* name : {"Hollow", "Fresh"})
    ASSERT_TRUE(RCCompositionEditor::createCompositionForNewRecording(*model(), name));
  fs::create_directory(recordingsPath("Broken.composition"));
  testing::writeFile(recordingsPath("Broken.composition/manifest.json"), "{");
  fs::create_directory(recordingsPath("Lower.COMPOSITION"));
  forgetDatabase();
  for (const char* name : {"Hollow.composition", "Broken.composition", "Lower.COMPOSITION"})
    age(recordingsPath(name), 3600);

  fs::copy_file(root_ / "take.wav", root_ / "Stray.m4a");
  run({platform::URL::fileURLWithPath(recordingsPath("x/../Walk.m4a")),
       platform::URL::fileURLWithPath((root_ / "Stray.m4a").string()),
       platform::URL::fileURLWithPath((root_ / "Gone" / "Stray.m4a").string())});

  EXPECT_EQ(recorded().size(), 1u);
  auto stray =
      model()->recordingWithURL(platform::URL::fileURLWithPath(recordingsPath("Stray.m4a")));
  ASSERT_TRUE(stray && *stray);
  auto recovered =
      RCComposition::load(platform::URL::fileURLWithPath(recordingsPath("Stray.composition")));
  ASSERT_TRUE(recovered) << recovered.error();
  EXPECT_EQ((*recovered)->savedRecordingURI(), (*stray)->URIRepresentation());
  EXPECT_FALSE(present("Hollow.composition"));
  expectPresent({"Walk.composition", "Fresh.composition", "Broken.composition", "Lower.COMPOSITION",
                 "Stray.composition"});
  EXPECT_EQ(log_.count("Leaving composition (Broken.composition) alone"), 1u);
  EXPECT_EQ(log_.count("(Walk.composition)"), 0u);
}

// What must survive: a database recording named through another spelling of
// the directory, a hard link to it, a file the media engine could not read,
// and a young leftover of an atomic replace (an old one goes).
TEST_F(OrphanHandlingTest, NeverDeletesWhatItCouldNotProveOrphaned) {
  tone("Only.m4a", 1.0);
  const fs::path alias = root_ / "Alias";
  fs::create_directory_symlink(recordings_, alias);
  RCSavedRecordingsModel::setSavedRecordingsDirectory(alias.string());
  insert("Only.m4a");
  fs::create_hard_link(recordingsPath("Only.m4a"), recordingsPath("Linked.m4a"));
  tone("Flaky.m4a", 1.5);
  copy("Flaky.m4a", "Flaky copy.m4a");
  testing::writeFile(recordingsPath(".Old.m4a.abcdefgh.tmp"), "old");
  testing::writeFile(recordingsPath(".New.m4a.abcdefgh.tmp"), "new");
  age(recordingsPath(".Old.m4a.abcdefgh.tmp"), 2 * 3600);
  // Probing "Flaky" fails as an I/O error does.
  RCMediaEngine::setCurrent(std::make_shared<ProbeHookEngine>([](const platform::URL& url) {
    return url.lastPathComponent().starts_with("Flaky")
               ? platform::fail(platform::posixError(EIO, "read " + url.path()))
               : platform::Status();
  }));

  run();

  expectPresent({"Only.m4a", "Linked.m4a", "Flaky.m4a", ".New.m4a.abcdefgh.tmp"});
  // The copy of the file that could not be examined still duplicates it.
  expectPresent({".Old.m4a.abcdefgh.tmp", "Flaky copy.m4a"}, false);
  EXPECT_EQ(recorded().size(), 1u);
  EXPECT_EQ(log_.count("'Only.m4a'"), 0u);
  EXPECT_EQ(log_.count("'Flaky.m4a' could not be examined"), 1u);
}

// What the run finds open, changing, or no file of its own stays, each with
// one line saying why; copies of files that stay go, be they recovered with
// their bundle or reached through a link out of the directory; a deleted
// unplayable file is matched by no later orphan.
TEST_F(OrphanHandlingTest, LeavesWhatIsOpenChangingOrNotAFileOfItsOwnAndSaysWhy) {
  ASSERT_NO_FATAL_FAILURE(makeBundle("Alpha"));
  forgetDatabase();
  tone("Alpha.m4a", 1.0, 550);
  copy("Alpha.m4a", "Beta.m4a");
  tone("Kept.m4a", 1.0);
  testing::writeFile(recordingsPath("Target.m4a"), std::string(3000, 't'));
  fs::create_symlink(recordingsPath("Target.m4a"), recordingsPath("Member.m4a"));
  ASSERT_TRUE(testing::writeTone((root_ / "outside.m4a").string(), {.frequencyHz = 660}));
  fs::create_symlink(root_ / "outside.m4a", recordingsPath("Out.m4a"));
  fs::copy_file(root_ / "outside.m4a", recordingsPath("Outside copy.m4a"));
  for (const char* name : {"Kept.m4a", "Member.m4a", "Out.m4a"}) insert(name);
  fs::create_symlink(recordingsPath("Kept.m4a"), recordingsPath("Link.m4a"));
  ASSERT_EQ(::mkfifo(recordingsPath("Pipe.m4a").c_str(), 0600), 0);
  fs::create_directory(recordingsPath("Folder.m4a"));
  const bool device = ::mknod(recordingsPath("Null.m4a").c_str(), S_IFCHR | 0600, makedev(1, 3)) ==
                      0;  // needs root
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  const std::string socketPath = recordingsPath("Socket.m4a");
  ASSERT_LT(socketPath.size(), sizeof address.sun_path);
  socketPath.copy(address.sun_path, socketPath.size());
  const int socket = ::socket(AF_UNIX, SOCK_STREAM, 0);
  ASSERT_EQ(::bind(socket, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  testing::writeFile(recordingsPath("Noise A.m4a"), std::string(3001, 'n'));
  copy("Noise A.m4a", "Noise B.m4a");
  testing::writeFile(recordingsPath("Growing.m4a"), std::string(3100, 'g'));
  testing::writeFile(recordingsPath("Replaced.m4a"), std::string(3200, 'r'));
  testing::writeFile(recordingsPath("Writing.m4a"), std::string(3300, 'w'));
  const int writer = ::open(recordingsPath("Writing.m4a").c_str(), O_WRONLY | O_APPEND);
  ASSERT_GE(writer, 0);
  // While the run reads "Growing", more of it comes in; while it reads
  // "Replaced", a sync tool renames another file over it.
  RCMediaEngine::setCurrent(std::make_shared<ProbeHookEngine>([](const platform::URL& url) {
    if (url.lastPathComponent() == "Growing.m4a")
      testing::writeFile(url.path(), testing::readFile(url.path()) + "more");
    if (url.lastPathComponent() == "Replaced.m4a") {
      testing::writeFile(url.path() + ".new", std::string(3400, 'r'));
      fs::rename(url.path() + ".new", url.path());
    }
    return platform::Status();
  }));

  run();

  // The file, whether it stays, and the line logged once about it.
  for (const auto& [name, stays, line] : std::vector<std::tuple<const char*, bool, const char*>>{
           {"Pipe.m4a", true, "Leaving 'Pipe.m4a' alone: it is not a regular file"},
           {"Socket.m4a", true, "Leaving 'Socket.m4a' alone: it is not a regular file"},
           {"Folder.m4a", true, "Leaving 'Folder.m4a' alone: it is not a regular file"},
           {"Link.m4a", true, "Leaving 'Link.m4a' alone: it is a symbolic link"},
           {"Target.m4a", true, "Leaving 'Target.m4a' alone: it is the same file as one in use"},
           {"Writing.m4a", true, "'Writing.m4a' is open in another process; leaving it"},
           {"Growing.m4a", true, "'Growing.m4a' changed during the run; leaving it"},
           {"Replaced.m4a", true, "'Replaced.m4a' changed during the run; leaving it"},
           {"Noise A.m4a", false, "'Noise A.m4a' unable to load AVURLAsset"},
           {"Noise B.m4a", false, "'Noise B.m4a' unable to load AVURLAsset"},
           {"Beta.m4a", false, "orphanPath = Beta.m4a matches existing file = Alpha.m4a"},
           {"Outside copy.m4a", false,
            "orphanPath = Outside copy.m4a matches existing file = Out.m4a"},
           {"Alpha.m4a", true, "orphaned composition (Alpha.composition) with assets"},
       }) {
    EXPECT_EQ(present(name), stays) << name;
    EXPECT_EQ(log_.count(line), 1u) << line;
  }
  EXPECT_EQ(log_.count("'Null.m4a' alone: it is not a regular file"), device ? 1u : 0u);
  EXPECT_TRUE(fs::exists(root_ / "outside.m4a"));
  EXPECT_EQ(log_.count("matches existing file = Noise A.m4a"), 0u);

  // Once the writer is done, the next run deletes what it left unplayable.
  ::close(writer);
  ::close(socket);
  run();
  EXPECT_FALSE(present("Writing.m4a"));
}

// Titles follow the preferred languages; the container's creation date is
// used only without a title; a missing file changes nothing.
TEST_F(OrphanHandlingTest, RecoveredTitlesAndDatesComeFromTheFile) {
  const auto created = platform::Date::fromISO8601("2020-01-02T03:04:05Z");
  for (const char* name : {"Tagged.m4a", "Single.m4a"}) {
    ASSERT_TRUE(testing::writeTone(recordingsPath(name),
                                   {.metadata = {{"creation_time", "2020-01-02T03:04:05Z"}}}));
  }
  auto engine = RCMediaEngine::current();
  auto url = [&](const char* name) { return platform::URL::fileURLWithPath(recordingsPath(name)); };
  ASSERT_TRUE(engine->writeTitle(url("Tagged.m4a"), "Walk", "eng"));
  ASSERT_TRUE(engine->writeTitle(url("Tagged.m4a"), "Spaziergang", "deu"));
  ASSERT_TRUE(engine->writeTitle(url("Single.m4a"), "Solo", "fra"));
  testing::ScopedEnvironment language{{"LANGUAGE", "fr:de:en"}};
  auto tagged = insert("Tagged.m4a");
  ASSERT_TRUE(RCSApplyAssetMetadataToRecording(*tagged));
  EXPECT_EQ(tagged->customLabel(), "Spaziergang");
  EXPECT_EQ(tagged->date(), RCFileCreationDate(recordingsPath("Tagged.m4a")));

  language.set("LANGUAGE", "it");  // neither title: the container's date
  ASSERT_TRUE(RCSApplyAssetMetadataToRecording(*tagged));
  EXPECT_EQ(tagged->date(), created);
  EXPECT_EQ(tagged->customLabel(), RCLocalizedRecordingDateWithOptions(*created, 3));

  auto single = insert("Single.m4a");  // one title is the title, whatever its language
  ASSERT_TRUE(RCSApplyAssetMetadataToRecording(*single));
  EXPECT_EQ(single->customLabel(), "Solo");
  EXPECT_NE(single->date(), created);

  auto missing = insert("Missing.m4a");
  const std::string before = missing->customLabel();
  EXPECT_FALSE(RCSApplyAssetMetadataToRecording(*missing));
  EXPECT_EQ(missing->customLabel(), before);
}

}  // namespace
}  // namespace quorvel
