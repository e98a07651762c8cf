// The real quorveld with its recordings directory on a full disk: a small
// tmpfs mounted in a private mount namespace of the test (and so of the
// daemon and the media worker it starts), filled to the last byte. What
// cannot be written fails with an error the caller sees; nothing already
// there is lost, no temporary file stays, and the same request succeeds once
// there is room again. Needs root; skipped otherwise.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <map>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCMD5.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/ScopedTempDir.h"
#include "tests/support/TempDirectory.h"
#include "tests/support/TestBus.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using testing::DaemonProcess;

class FullDiskTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root to mount a small file system";
    // The namespace is the calling thread's, and so of the processes it
    // starts: the daemon, its media worker, quorvelctl.
    if (::unshare(CLONE_NEWNS) != 0 ||
        ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
      GTEST_SKIP() << "no private mount namespace: " << std::strerror(errno);
    }
    fs::create_directories(disk_);
    if (::mount("quorvel-test", disk_.c_str(), "tmpfs", 0, "size=8m,mode=0700") != 0)
      GTEST_SKIP() << "cannot mount a tmpfs: " << std::strerror(errno);
    mounted_ = true;
    fs::create_directories(recordings_);
    RCSavedRecordingsModel::setSavedRecordingsDirectory(recordings_.string());
    daemon_ = DaemonProcess::serve(bus_.address(), recordings_.string());
  }
  void TearDown() override {
    daemon_.reset();
    RCSavedRecordingsModel::setSavedRecordingsDirectory(std::nullopt);
    if (mounted_) ::umount2(disk_.c_str(), MNT_DETACH);
  }

  DaemonProcess::CommandResult quorvelctl(std::vector<std::string> arguments) {
    return DaemonProcess::quorvelctl(bus_.address(), std::move(arguments));
  }
  std::string path(const std::string& name) const { return (recordings_ / name).string(); }
  // A tone made outside the disk, so the disk holds only what is tested.
  std::string take(double seconds, double frequency) {
    const std::string file = (temp_ / "take.wav").string();
    EXPECT_TRUE(testing::writeTone(file, seconds, "wav", 44100, 1, frequency));
    return file;
  }
  // Fills the disk to its last byte.
  void fill() {
    const int fd = ::open((disk_ / "filler").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0) << std::strerror(errno);
    const std::string bytes(1 << 16, 'x');
    for (std::size_t chunk = bytes.size(); chunk > 0; chunk /= 2)
      while (::write(fd, bytes.data(), chunk) > 0) {
      }
    ::close(fd);
  }
  void makeRoom() { fs::remove(disk_ / "filler"); }
  // Every file under the recordings directory but the database's and the
  // waveforms (a finalization removes the old one first: it describes the
  // old audio), by path, with its digest; and no temporary file among them.
  std::map<std::string, std::string> contents() const {
    std::map<std::string, std::string> files;
    for (const auto& entry : fs::recursive_directory_iterator(recordings_)) {
      const std::string name = entry.path().filename();
      EXPECT_FALSE(RCIsAtomicReplaceTempName(name)) << entry.path();
      if (!entry.is_regular_file() || name.starts_with(RCSavedRecordingsModel::kDatabaseFileName) ||
          entry.path().extension() == ".waveform") {
        continue;
      }
      auto digest = RCMD5DataForPath(entry.path().string());
      files[fs::relative(entry.path(), recordings_)] = digest ? RCMD5HexString(*digest) : "";
    }
    return files;
  }

  testing::ScopedTempDir temp_{"qv-disk"};
  fs::path disk_ = temp_ / "disk";
  fs::path recordings_ = disk_ / "Recordings";
  bool mounted_ = false;
  platform::testing::TestBus bus_;
  std::unique_ptr<DaemonProcess> daemon_;
};

// A recording composed once and then given a second take is exported on a
// full disk: the export fails with the disk's error, the old composed file
// and the fragments stay as they were, and once there is room the export
// composes both takes.
TEST_F(FullDiskTest, AnExportThatCannotBeWrittenFailsAndKeepsTheRecording) {
  auto made = quorvelctl({"new", "--recordings-dir", recordings_.string(), "Walk", take(2.0, 440)});
  ASSERT_EQ(made.status, 0) << made.output;
  const std::string audio = path("Walk.m4a");
  auto exported = quorvelctl({"export", audio, "--", "true"});
  ASSERT_EQ(exported.status, 0) << exported.output << daemon_->output();
  auto editor = RCCompositionEditor::editorForComposedAVURL(platform::URL::fileURLWithPath(audio));
  ASSERT_TRUE(editor) << editor.error();
  auto appended =
      editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(take(20.0, 660)));
  ASSERT_TRUE(appended) << appended.error();
  const auto before = contents();

  ASSERT_NO_FATAL_FAILURE(fill());
  auto failed = quorvelctl({"export", audio, "--", "true"});
  EXPECT_NE(failed.status, 0) << failed.output;
  // The reply carries no token (and no error); the daemon logs why.
  EXPECT_NE(failed.output.find("could not be finalized"), std::string::npos) << failed.output;
  EXPECT_FALSE(daemon_->linesContaining("No space left on device").empty()) << daemon_->output();
  EXPECT_EQ(contents(), before);

  makeRoom();
  auto again = quorvelctl({"export", audio, "--", "true"});
  ASSERT_EQ(again.status, 0) << again.output << daemon_->output();
  auto pcm = testing::decodeToPCM(audio);
  ASSERT_TRUE(pcm) << pcm.error();
  EXPECT_NEAR(pcm->seconds(), 22.0, 0.1);
  contents();  // no temporary file stays
}

// The orphan run on a full disk, over a bundle and a file the database
// lacks, a copy of that file and a file without audio: the database cannot
// take the recovered recordings, so the run stops and deletes nothing; with
// room again the next run recovers them and deletes the copy and the junk.
TEST_F(FullDiskTest, AnOrphanRunThatCannotSaveTheDatabaseDeletesNothing) {
  // The daemon opens (and so makes) the database in a run over the empty
  // directory, and keeps it open; the orphans come once its start-up run
  // is over and orphan handling is off.
  ASSERT_TRUE(daemon_->waitForLines("Keep-alive for orphan handling", 2)) << daemon_->output();
  ASSERT_EQ(quorvelctl({"enable-orphan-handling"}).status, 0);
  ASSERT_EQ(quorvelctl({"disable-orphan-handling"}).status, 0);
  RCCompositionManifest manifest;
  manifest.composedName = "Lost.m4a";
  manifest.fragments.push_back({.file = "Lost-1.wav", .contentDuration = 1.0});
  manifest.recomputeTimeRanges();
  testing::writeFile(path("Lost.composition/manifest.json"), manifest.serialize());
  ASSERT_TRUE(testing::writeTone(path("Lost.composition/Lost-1.wav"), 1.0, "wav"));
  testing::ToneOptions found;
  found.frequencyHz = 660;
  found.metadata = {{"title", "Found on a card"}};
  ASSERT_TRUE(testing::writeTone(path("Found.m4a"), found));
  fs::copy_file(path("Found.m4a"), path("Found again.m4a"));
  testing::writeFile(path("Noise.wav"), std::string(4096, 'x'));
  const auto before = contents();

  ASSERT_NO_FATAL_FAILURE(fill());
  auto enabled = quorvelctl({"enable-orphan-handling"});
  EXPECT_EQ(enabled.status, 0) << enabled.output;
  EXPECT_FALSE(daemon_->linesContaining("cannot save the recordings database").empty())
      << daemon_->output();
  EXPECT_EQ(contents(), before) << daemon_->output();

  makeRoom();
  ASSERT_EQ(quorvelctl({"disable-orphan-handling"}).status, 0);
  ASSERT_EQ(quorvelctl({"enable-orphan-handling"}).status, 0);
  auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
  ASSERT_TRUE(model) << model.error();
  auto lost = (*model)->recordingWithURL(platform::URL::fileURLWithPath(path("Lost.m4a")));
  EXPECT_TRUE(lost && *lost) << daemon_->output();
  EXPECT_NE(fs::exists(path("Found.m4a")), fs::exists(path("Found again.m4a")));
  EXPECT_FALSE(fs::exists(path("Noise.wav")));
}

}  // namespace
}  // namespace quorvel
