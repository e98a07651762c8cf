// The file layer: an atomic replacement that fails leaves the old file and no
// temporary file behind; the temporary names are recognisable for a sweep;
// the full-transfer helpers survive short transfers and EINTR.
#include "Quorvel/files/RCFile.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <string>
#include <thread>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCDurableFile.h"
#include "Quorvel/files/RCReplacementFile.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using RCFileTest = testing::TempDirectoryTest;

TEST_F(RCFileTest, AFailedReplacementLeavesTheOldFileAndNoTemporaryFile) {
  const fs::path target = dir_ / "waveform.bin";
  testing::writeFile(target, "old");
  const auto url = platform::URL::fileURLWithPath(target.string());

  // The write itself fails: the file size limit turns it into EFBIG.
  {
    struct rlimit saved {};
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &saved), 0);
    auto previous = ::signal(SIGXFSZ, SIG_IGN);
    struct rlimit small = saved;
    small.rlim_cur = 4096;
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
    auto written = RCReplacementFile::replace(url, std::string(64 * 1024, 'x'));
    ::setrlimit(RLIMIT_FSIZE, &saved);
    ::signal(SIGXFSZ, previous);
    ASSERT_FALSE(written);
    EXPECT_EQ(written.error().code(), EFBIG);
  }
  EXPECT_EQ(testing::readFile(target), "old");
  EXPECT_TRUE(hiddenFiles().empty());

  // The rename fails: the destination is a directory now.
  fs::create_directories(dir_ / "manifest.json" / "inside");
  EXPECT_FALSE(RCWriteFileAtomically(dir_.string(), "manifest.json", "new"));
  EXPECT_TRUE(fs::is_directory(dir_ / "manifest.json" / "inside"));
  EXPECT_TRUE(hiddenFiles().empty());

  // An abandoned replacement removes its temporary file; a committed one
  // leaves only the destination.
  {
    auto file = RCReplacementFile::create(url);
    ASSERT_TRUE(file);
    const auto hidden = hiddenFiles();
    EXPECT_TRUE(hidden.size() == 1 && RCIsAtomicReplaceTempName(hidden[0]));
  }
  EXPECT_TRUE(hiddenFiles().empty());
  ASSERT_TRUE(RCReplacementFile::replace(url, "new"));
  EXPECT_EQ(testing::readFile(target), "new");
  EXPECT_TRUE(hiddenFiles().empty());
}

// Two writers of one file (a compose and a title write): the one that
// rewrote a file that was replaced meanwhile does not undo the other.
TEST_F(RCFileTest, AGuardedReplacementNeverUndoesAnotherWriter) {
  const fs::path target = dir_ / "Walk.m4a";
  testing::writeFile(target, "old audio");
  const auto url = platform::URL::fileURLWithPath(target.string());
  auto identity = [&] {
    struct stat info {};
    EXPECT_EQ(::stat(target.c_str(), &info), 0);
    return RCReplacementFile::Identity{info.st_dev, info.st_ino};
  };
  const auto readFrom = identity();
  auto titled = RCReplacementFile::create(url);
  ASSERT_TRUE(titled && titled->write("old audio, new title"));
  ASSERT_TRUE(RCReplacementFile::replace(url, "new audio"));  // the other writer

  auto refused = titled->commitReplacing(readFrom);
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code(), RCErrorCodeChangedMeanwhile);
  EXPECT_EQ(testing::readFile(target), "new audio");
  ASSERT_TRUE(titled->write("new audio, new title"));
  ASSERT_TRUE(titled->commitReplacing(identity()));
  EXPECT_EQ(testing::readFile(target), "new audio, new title");
  EXPECT_TRUE(hiddenFiles().empty());
}

TEST(RCFileNamesTest, TemporaryNamesAreRecognisedAndNothingElseIs) {
  for (const char* name : {"manifest.json", "a.m4a", "Recording 3.composition", "x.waveform"}) {
    const std::string temp = RCAtomicReplaceTempName(name);
    EXPECT_TRUE(RCIsAtomicReplaceTempName(temp)) << temp;
    EXPECT_NE(temp, RCAtomicReplaceTempName(name));
    EXPECT_FALSE(RCIsAtomicReplaceTempName(name));
  }
  for (const char* name :
       {"", ".tmp", "..abcd1234.tmp", "a.abcd1234.tmp", ".a.ABCD1234.tmp", ".a.abcd123.tmp",
        ".a-abcd1234.tmp", ".a.abcd1234.tmpx", ".a.abcd-234.tmp", ".hidden.m4a"}) {
    EXPECT_FALSE(RCIsAtomicReplaceTempName(name)) << name;
  }
}

std::atomic<int> gInterruptions{0};
void countInterruption(int) { gInterruptions.fetch_add(1, std::memory_order_relaxed); }

// A blocked pipe write interrupted by a signal handler installed without
// SA_RESTART returns short or fails with EINTR; both helpers must carry on.
TEST(RCFileTransferTest, WholeBuffersCrossAPipeDespiteSignalsAndShortTransfers) {
  struct sigaction action {};
  action.sa_handler = countInterruption;
  sigemptyset(&action.sa_mask);
  struct sigaction previous {};
  ASSERT_EQ(::sigaction(SIGUSR2, &action, &previous), 0);
  sigset_t unblock;
  sigemptyset(&unblock);
  sigaddset(&unblock, SIGUSR2);
  sigset_t savedMask;
  ASSERT_EQ(::pthread_sigmask(SIG_UNBLOCK, &unblock, &savedMask), 0);

  int fds[2];
  ASSERT_EQ(::pipe(fds), 0);
  RCScopedFd readEnd(fds[0]), writeEnd(fds[1]);
  std::string sent(4 << 20, '\0');
  for (std::size_t i = 0; i < sent.size(); ++i) sent[i] = char(i * 131 + i / 4096);

  const pthread_t writer = ::pthread_self();
  std::string received(sent.size(), '\0');
  std::thread reader([&] {
    std::size_t done = 0;
    while (done < received.size()) {
      // Interrupt the writer while it is (most likely) blocked on a full pipe.
      ::pthread_kill(writer, SIGUSR2);
      const std::size_t chunk = std::min<std::size_t>(3000, received.size() - done);
      auto got = RCReadFully(readEnd.get(), received.data() + done, chunk, "pipe");
      if (!got || *got != chunk) {
        readEnd.reset();  // fail the writer rather than leave it blocked
        return;
      }
      done += *got;
    }
  });
  auto written = RCWriteFully(writeEnd.get(), sent, "pipe");
  // A writer that gave up early ends the reader with an end of file.
  const bool closed = bool(writeEnd.close());
  reader.join();
  ::pthread_sigmask(SIG_SETMASK, &savedMask, nullptr);
  ::sigaction(SIGUSR2, &previous, nullptr);

  ASSERT_TRUE(written) << written.error();
  EXPECT_GT(gInterruptions.load(), 0);
  EXPECT_TRUE(received == sent);

  // Reading past the end reports how much there was.
  ASSERT_TRUE(closed);
  char rest[16];
  auto tail = RCReadFully(readEnd.get(), rest, sizeof rest, "pipe");
  ASSERT_TRUE(tail);
  EXPECT_EQ(*tail, 0u);
}

}  // namespace
}  // namespace quorvel
