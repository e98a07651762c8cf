// LogCapture: the log lines written while it exists, with their levels,
// instead of the console or the journal. It lowers the threshold to `level`
// (tracing by default) and puts the threshold and the sink back when it goes.
// One at a time per process. Owned by the test; lines may be written from any
// thread, and waitFor() waits for one without sleeping.
#pragma once

#include <algorithm>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Log.h"
#include "tests/support/Gate.h"

namespace quorvel::testing {

struct LogLine {
  int level;
  std::string text;
  bool operator==(const LogLine&) const = default;
};

class LogCapture {
 public:
  explicit LogCapture(int level = platform::kLogLevelDebug) {
    platform::setConsoleLogging(false);
    platform::setLogThreshold(level);
    platform::setLogSinkForTesting([this](int lineLevel, std::string_view text) {
      gate_.update([&] { lines_.push_back({lineLevel, std::string(text)}); });
    });
  }
  ~LogCapture() {
    platform::setLogSinkForTesting(nullptr);
    platform::setLogThreshold(platform::kLogLevelNotice);
  }
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<LogLine> lines() { return platform::testing::readLocked(gate_.mutex(), lines_); }
  // How many lines contain `text` (of `level`, when given).
  std::size_t count(std::string_view text, int level = -1) {
    std::lock_guard lock(gate_.mutex());
    return countLocked(text, level);
  }
  bool contains(std::string_view text, int level = -1) { return count(text, level) > 0; }
  // Waits (up to Gate's bound) until a line contains `text`.
  bool waitFor(std::string_view text, int level = -1) {
    return gate_.waitUntil([&] { return countLocked(text, level) > 0; });
  }
  // Waits (up to Gate's bound) until `count` lines contain `text`.
  bool waitForCount(std::string_view text, std::size_t count) {
    return gate_.waitUntil([&] { return countLocked(text, -1) >= count; });
  }

 private:
  std::size_t countLocked(std::string_view text, int level) const {
    return std::ranges::count_if(lines_, [&](const LogLine& line) {
      return (level < 0 || line.level == level) && line.text.find(text) != std::string::npos;
    });
  }
  platform::testing::Gate gate_;
  std::vector<LogLine> lines_;
};

}  // namespace quorvel::testing
