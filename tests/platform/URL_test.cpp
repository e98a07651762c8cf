// The shared value types: file URLs, errors, UUIDs, dates.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <set>
#include <unordered_set>

#include "platform/Date.h"
#include "platform/Error.h"
#include "platform/URL.h"
#include "platform/UUID.h"

namespace platform {
namespace {

TEST(URLTest, FileURLOfPathEncodesAndDecodes) {
  URL url = URL::fileURLWithPath("/home/me/My Recording #1 ü.m4a");
  EXPECT_EQ(url.absoluteString(), "file:///home/me/My%20Recording%20%231%20%C3%BC.m4a");
  EXPECT_EQ(url.path(), "/home/me/My Recording #1 ü.m4a");
  EXPECT_EQ(url.lastPathComponent(), "My Recording #1 ü.m4a");
  EXPECT_EQ(url.pathExtension(), "m4a");
  auto parsed = URL::fileURLFromString(url.absoluteString());
  ASSERT_TRUE(parsed);
  EXPECT_EQ(*parsed, url);
}

TEST(URLTest, ParsingAcceptsOnlyAbsoluteFileURLs) {
  EXPECT_TRUE(URL::fileURLFromString("file:///a/b.m4a"));
  EXPECT_TRUE(URL::fileURLFromString("FILE://localhost/a/b.m4a"));
  EXPECT_EQ(URL::fileURLFromString("file://localhost/a%2Fb")->path(), "/a/b");
  for (const char* bad :
       {"", "/a/b", "http://x/a", "file:a/b", "file://host/a", "file:///a?x=1", "file:///a#frag",
        "file:///a%2", "file:///a%zz", "file:///a%00b", "file://"})
    EXPECT_FALSE(URL::fileURLFromString(bad)) << bad;
  EXPECT_EQ(URL::fromFileURLStringOrPath("/tmp/x y.wav")->absoluteString(),
            "file:///tmp/x%20y.wav");
  EXPECT_FALSE(URL::fromFileURLStringOrPath("relative/path.wav"));
  EXPECT_FALSE(URL::fromFileURLStringOrPath(""));
}

TEST(URLTest, PathOperations) {
  URL url = URL::fileURLWithPath("/r/Rec.composition/frag.m4a");
  EXPECT_EQ(url.URLByDeletingLastPathComponent().path(), "/r/Rec.composition");
  EXPECT_TRUE(url.URLByDeletingLastPathComponent().hasDirectoryPath());
  EXPECT_EQ(url.URLByReplacingPathExtension("waveform").path(), "/r/Rec.composition/frag.waveform");
  EXPECT_EQ(url.URLByDeletingPathExtension().lastPathComponent(), "frag");
  EXPECT_EQ(URL::fileURLWithPath("/r/.hidden").pathExtension(), "");
  EXPECT_EQ(URL::fileURLWithPath("/r/noext").URLByDeletingPathExtension().path(), "/r/noext");
  EXPECT_EQ(URL::fileURLWithPath("/r/").URLByAppendingPathComponent("a b").absoluteString(),
            "file:///r/a%20b");
  EXPECT_EQ(URL::fileURLWithPath("/").URLByDeletingLastPathComponent().path(), "/");
}

TEST(URLTest, StandardizingIsLexicalAndEqualityIsByString) {
  URL dotted = URL::fileURLWithPath("/r/./x/../Rec.m4a");
  URL plain = URL::fileURLWithPath("/r/Rec.m4a");
  EXPECT_NE(dotted, plain);
  EXPECT_EQ(dotted.URLByStandardizingPath(), plain);
  EXPECT_EQ(URL::fileURLWithPath("//r//Rec.m4a").URLByStandardizingPath(), plain);
  EXPECT_EQ(URL::fileURLWithPath("/../..").URLByStandardizingPath().path(), "/");
  std::unordered_set<URL> set{plain, dotted.URLByStandardizingPath()};
  EXPECT_EQ(set.size(), 1u);
}

TEST(ErrorTest, CarriesDomainCodeAndUnderlyingError) {
  Error inner(kPOSIXErrorDomain, 2, "open: No such file or directory");
  Error outer("org.quorvel.Error", 1, "compose failed", inner);
  ASSERT_NE(outer.underlyingError(), nullptr);
  EXPECT_EQ(*outer.underlyingError(), inner);
  EXPECT_EQ(outer.description(),
            "Error Domain=org.quorvel.Error Code=1 \"compose failed\" (underlying error: "
            "Error Domain=org.quorvel.POSIXError Code=2 \"open: No such file or directory\")");
  Result<int> failed = fail(outer);
  ASSERT_FALSE(failed);
  EXPECT_EQ(failed.error().code(), 1);
}

TEST(UUIDTest, RandomRoundTripsAndIsUnique) {
  std::set<std::string> seen;
  for (int i = 0; i < 1000; ++i) {
    UUID uuid = UUID::random();
    std::string text = uuid.string();
    EXPECT_EQ(text[14], '4');
    EXPECT_EQ(UUID::fromString(text), uuid);
    seen.insert(text);
  }
  EXPECT_EQ(seen.size(), 1000u);
  EXPECT_FALSE(UUID::fromString("not-a-uuid"));
  EXPECT_FALSE(UUID::fromString("E621E1F8-C36C-495A-93FC-0C247A3E6E5G"));
  EXPECT_EQ(UUID::fromString("e621e1f8-c36c-495a-93fc-0c247a3e6e5f")->string(),
            "E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
}

// UUIDs are drawn from a per-thread buffer of random bytes; a forked child
// must not hand out the identifiers its parent has buffered.
TEST(UUIDTest, AForkedChildDrawsOtherIdentifiersThanItsParent) {
  (void)UUID::random();  // fills this thread's buffer
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    std::string text = UUID::random().string();
    _exit(write(fds[1], text.data(), text.size()) == 36 ? 0 : 1);
  }
  std::string mine = UUID::random().string();
  std::string theirs(36, '\0');
  ASSERT_EQ(read(fds[0], theirs.data(), theirs.size()), 36);
  int status = 0;
  waitpid(child, &status, 0);
  close(fds[0]);
  close(fds[1]);
  EXPECT_NE(mine, theirs);
}

TEST(DateTest, ParsesAndPrintsISO8601) {
  auto date = Date::fromISO8601("2024-05-01T10:20:30.500000Z");
  ASSERT_TRUE(date);
  EXPECT_EQ(date->ISO8601String(), "2024-05-01T10:20:30.500Z");
  EXPECT_EQ(Date::fromISO8601("2024-05-01T12:20:30.5+02:00"), date);
  EXPECT_DOUBLE_EQ(Date::fromISO8601("1970-01-01 00:00:10")->timeIntervalSince1970(), 10.0);
  for (const char* bad : {"", "yesterday", "2024-13-01T00:00:00Z", "2024-05-01T10:20:30x"})
    EXPECT_FALSE(Date::fromISO8601(bad)) << bad;
}

}  // namespace
}  // namespace platform
