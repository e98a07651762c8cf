// The log convention: "[tag] message", levels against the threshold, sink.
#include <gtest/gtest.h>

#include <mutex>
#include <string>
#include <vector>

#include "platform/Log.h"
#include "platform/URL.h"

namespace platform {
namespace {

struct CapturedLine {
  int level;
  std::string text;
};

class LogTest : public ::testing::Test {
 protected:
  void SetUp() override {
    setConsoleLogging(false);
    setLogSinkForTesting([this](int level, std::string_view text) {
      lines_.push_back({level, std::string(text)});
    });
  }
  void TearDown() override {
    setLogSinkForTesting(nullptr);
    setLogThreshold(kLogLevelNotice);
  }
  std::vector<CapturedLine> lines_;
};

// The tag is the file name up to its first dot.
static_assert(logTagForFile("/src/quorveld/SavedRecordingService.Connections.cpp") ==
              "SavedRecordingService");
static_assert(logTagForFile("Models/RCSavedRecordingsModel+RCSOrphanHandling.cpp") ==
              "RCSavedRecordingsModel+RCSOrphanHandling");

TEST_F(LogTest, ThresholdFiltersTracingUnlessVerboseWithoutFormattingDroppedLines) {
  int formatted = 0;
  auto count = [&formatted] { return ++formatted; };
  QV_LOG(kLogLevelDebug, "hidden {}", count());
  EXPECT_EQ(formatted, 0);
  QV_LOG(kLogLevelError, "shown");
  setLogThreshold(kLogLevelDebug);
  QV_LOG(kLogLevelDebug, "now shown {}", URL::fileURLWithPath("/a b"));
  ASSERT_EQ(lines_.size(), 2u);
  EXPECT_EQ(lines_[0].text, "[Log_test] shown");
  EXPECT_EQ(lines_[1].text, "[Log_test] now shown file:///a%20b");
}

}  // namespace
}  // namespace platform
