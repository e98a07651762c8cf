// File digests against the known answer and against md5sum, around the read
// chunk boundaries, and for files that cannot be digested.
#include "Quorvel/files/RCMD5.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdio>
#include <filesystem>
#include <random>

#include "tests/support/TempDirectory.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;

std::string md5sum(const std::string& path) {
  const std::string command = "md5sum '" + path + "'";
  FILE* pipe = ::popen(command.c_str(), "r");
  char buffer[64] = {};
  const std::size_t got = std::fread(buffer, 1, 32, pipe);
  ::pclose(pipe);
  return std::string(buffer, got);
}

class RCMD5Test : public testing::TempDirectoryTest {
 protected:
  std::string write(const std::string& name, const std::string& bytes) {
    testing::writeFile(dir_ / name, bytes);
    return path(name);
  }
};

TEST_F(RCMD5Test, KnownAnswerAndAgreementWithMd5sumAcrossChunkBoundaries) {
  auto abc = RCMD5DataForPath(write("abc", "abc"));
  ASSERT_TRUE(abc);
  EXPECT_EQ(RCMD5HexString(*abc), "900150983cd24fb0d6963f7d28e17f72");
  EXPECT_EQ(RCMD5HexString(RCMD5DigestOfBytes("abc")), "900150983cd24fb0d6963f7d28e17f72");

  std::mt19937 random(7);
  const std::size_t chunk = 1 << 20;
  for (std::size_t size : {std::size_t(1), chunk - 1, chunk, chunk + 1, 3 * chunk + 12345}) {
    SCOPED_TRACE(size);
    std::string bytes(size, '\0');
    for (char& c : bytes) c = char(random());
    const std::string path = write(fmt::format("f{}", size), bytes);
    auto digest = RCMD5DigestOfFile(path);
    ASSERT_TRUE(digest);
    ASSERT_TRUE(*digest);
    EXPECT_EQ(RCMD5HexString(**digest), md5sum(path));
  }
}

TEST_F(RCMD5Test, NothingToDigestVersusCannotRead) {
  // Missing or empty: no digest, and no error to report.
  for (const std::string& path : {(dir_ / "missing").string(), write("empty", "")}) {
    auto digest = RCMD5DigestOfFile(path);
    ASSERT_TRUE(digest) << path;
    EXPECT_FALSE(*digest);
    EXPECT_FALSE(RCMD5DataForPath(path));
  }
  // There but unreadable: an error (a directory, a FIFO that must not block).
  const std::string fifo = (dir_ / "fifo").string();
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
  for (const std::string& path : {dir_.string(), fifo}) {
    EXPECT_FALSE(RCMD5DigestOfFile(path)) << path;
    EXPECT_FALSE(RCMD5DataForPath(path));
  }
  if (::geteuid() != 0) {
    const std::string locked = write("locked", "secret");
    fs::permissions(locked, fs::perms::none);
    EXPECT_FALSE(RCMD5DigestOfFile(locked));
  }
}

}  // namespace
}  // namespace quorvel
