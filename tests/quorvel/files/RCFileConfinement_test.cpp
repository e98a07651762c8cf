// The one removal function: never outside the recordings directory, never
// through or along a symbolic link; and atomic manifest replacement.
#include <gtest/gtest.h>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCDurableFile.h"
#include "Quorvel/files/RCFileConfinement.h"
#include "tests/support/RecordingsDirectoryFixture.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using FileConfinementTest = testing::RecordingsDirectoryTest;

void touch(const fs::path& path) { testing::writeFile(path, "data"); }
platform::URL urlOf(const fs::path& path) { return platform::URL::fileURLWithPath(path.string()); }

TEST_F(FileConfinementTest, RefusesEverythingOutsideTheDirectoryAndTheDirectoryItself) {
  touch(root_ / "victim.m4a");
  touch(root_ / "RecordingsTwin/also.m4a");  // shares the directory's name as a prefix
  for (const std::string& path :
       {(root_ / "victim.m4a").string(), recordings_.string() + "/../victim.m4a",
        recordings_.string() + "/./", recordings_.string(),
        (root_ / "RecordingsTwin/also.m4a").string(), std::string("/")}) {
    auto status = RCRemoveItemInSavedRecordingsDirectory(platform::URL::fileURLWithPath(path));
    EXPECT_TRUE(!status && status.error() == RCError(RCErrorCodeNotConfined, "")) << path;
  }
  EXPECT_TRUE(fs::exists(root_ / "victim.m4a"));
  EXPECT_TRUE(fs::exists(root_ / "RecordingsTwin/also.m4a"));
  EXPECT_TRUE(fs::is_directory(recordings_));
}

TEST_F(FileConfinementTest, NeverFollowsASymbolicLink) {
  touch(root_ / "outside/keep.m4a");
  touch(root_ / "outside/deep/keep2.m4a");
  // A bundle that is a link to a directory outside: removing something "in"
  // it is refused; removing the bundle removes only the link.
  fs::create_directory_symlink(root_ / "outside", recordings_ / "Linked.composition");
  auto through =
      RCRemoveItemInSavedRecordingsDirectory(urlOf(recordings_ / "Linked.composition/keep.m4a"));
  EXPECT_TRUE(!through && through.error() == RCError(RCErrorCodeNotConfined, ""));
  EXPECT_TRUE(fs::exists(root_ / "outside/keep.m4a"));
  ASSERT_TRUE(RCRemoveItemInSavedRecordingsDirectory(urlOf(recordings_ / "Linked.composition")));
  EXPECT_FALSE(fs::exists(fs::symlink_status(recordings_ / "Linked.composition")));
  EXPECT_TRUE(fs::exists(root_ / "outside/keep.m4a"));

  // A real bundle holding links to a file and a directory outside: removing
  // the bundle unlinks them and leaves their targets.
  touch(recordings_ / "Real.composition/frag.m4a");
  fs::create_symlink(root_ / "outside/keep.m4a", recordings_ / "Real.composition/link.m4a");
  fs::create_directory_symlink(root_ / "outside/deep", recordings_ / "Real.composition/sub");
  touch(recordings_ / "Real.composition/nested/deeper/x.wav");
  ASSERT_TRUE(RCRemoveItemInSavedRecordingsDirectory(urlOf(recordings_ / "Real.composition")));
  EXPECT_FALSE(fs::exists(recordings_ / "Real.composition"));
  EXPECT_TRUE(fs::exists(root_ / "outside/keep.m4a"));
  EXPECT_TRUE(fs::exists(root_ / "outside/deep/keep2.m4a"));

  // A link to a file directly in the directory: the link goes, the target stays.
  fs::create_symlink(root_ / "outside/keep.m4a", recordings_ / "Alias.m4a");
  ASSERT_TRUE(RCRemoveItemInSavedRecordingsDirectory(urlOf(recordings_ / "Alias.m4a")));
  EXPECT_TRUE(fs::exists(root_ / "outside/keep.m4a"));
}

TEST_F(FileConfinementTest, RemovesFilesAndReportsMissingOnes) {
  touch(recordings_ / "Walk.composition/a.m4a");
  ASSERT_TRUE(
      RCRemoveItemInSavedRecordingsDirectory(urlOf(recordings_ / "Walk.composition/a.m4a")));
  EXPECT_FALSE(fs::exists(recordings_ / "Walk.composition/a.m4a"));
  auto missing = RCRemoveItemInSavedRecordingsDirectory(urlOf(recordings_ / "gone.m4a"));
  EXPECT_TRUE(!missing && missing.error() == platform::posixError(ENOENT, ""));
  // A file where a directory is expected on the way is refused too.
  touch(recordings_ / "plain.m4a");
  EXPECT_FALSE(RCRemoveItemInSavedRecordingsDirectory(urlOf(recordings_ / "plain.m4a/x")));
  EXPECT_TRUE(fs::exists(recordings_ / "plain.m4a"));
}

TEST_F(FileConfinementTest, PathChecksAreLexicalAndOneLevelForDirectlyInside) {
  // What is directly inside loads in the composition controller's test.
  std::string dir = recordings_.string();
  EXPECT_FALSE(RCIsURLDirectlyInsideDirectory(urlOf(recordings_ / "b.composition/a.m4a"), dir));
  EXPECT_FALSE(RCIsURLDirectlyInsideDirectory(platform::URL::fileURLWithPath(dir + "/.."), dir));
  EXPECT_FALSE(RCIsURLDirectlyInsideDirectory(urlOf(recordings_), dir));
  EXPECT_EQ(RCPathRelativeToDirectory(urlOf(recordings_ / "b.composition/a.m4a"), dir + "/"),
            "b.composition/a.m4a");
  for (const char* bad : {"", ".", "..", "a/b", "/a"}) EXPECT_FALSE(RCIsPlainFileName(bad)) << bad;
  EXPECT_FALSE(RCIsPlainFileName(std::string_view("a\0b", 3)));
  EXPECT_TRUE(RCIsPlainFileName("..a.m4a"));
}

TEST_F(FileConfinementTest, AtomicWriteReplacesWholeAndRefusesLinkedDirectories) {
  fs::create_directories(recordings_ / "W.composition");
  std::string dir = (recordings_ / "W.composition").string();
  ASSERT_TRUE(RCWriteFileAtomically(dir, "manifest.json", "old"));
  ASSERT_TRUE(RCWriteFileAtomically(dir, "manifest.json", "new contents"));
  EXPECT_EQ(*RCReadFileNoFollow(dir, "manifest.json", 100), "new contents");
  // No temporary files are left behind.
  EXPECT_EQ(std::distance(fs::directory_iterator(dir), fs::directory_iterator()), 1);
  EXPECT_FALSE(RCReadFileNoFollow(dir, "manifest.json", 5));

  fs::create_directory_symlink(root_, recordings_ / "L.composition");
  EXPECT_FALSE(RCWriteFileAtomically((recordings_ / "L.composition").string(), "m.json", "x"));
  EXPECT_FALSE(fs::exists(root_ / "m.json"));
  fs::create_symlink(root_ / "secret", recordings_ / "W.composition/link.json");
  touch(root_ / "secret");
  EXPECT_FALSE(RCReadFileNoFollow(dir, "link.json", 100));
  EXPECT_FALSE(RCWriteFileAtomically(dir, "../escape.json", "x"));
}

}  // namespace
}  // namespace quorvel
