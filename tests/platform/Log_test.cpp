// The log convention: "[tag] message", levels against the threshold, sink.
#include "platform/Log.h"

#include <gtest/gtest.h>

#include "platform/URL.h"
#include "tests/support/LogCapture.h"

namespace platform {
namespace {

// The tag is the file name up to its first dot.
static_assert(logTagForFile("/src/quorveld/SavedRecordingService.Connections.cpp") ==
              "SavedRecordingService");
static_assert(logTagForFile("Models/RCSavedRecordingsModel+RCSOrphanHandling.cpp") ==
              "RCSavedRecordingsModel+RCSOrphanHandling");

TEST(LogTest, ThresholdFiltersTracingUnlessVerboseWithoutFormattingDroppedLines) {
  quorvel::testing::LogCapture log(kLogLevelNotice);
  int formatted = 0;
  auto count = [&formatted] { return ++formatted; };
  QV_LOG(kLogLevelDebug, "hidden {}", count());
  EXPECT_EQ(formatted, 0);
  QV_LOG(kLogLevelError, "shown");
  setLogThreshold(kLogLevelDebug);
  QV_LOG(kLogLevelDebug, "now shown {}", URL::fileURLWithPath("/a b"));
  EXPECT_EQ(log.lines(), (std::vector<quorvel::testing::LogLine>{
                             {kLogLevelError, "[Log_test] shown"},
                             {kLogLevelDebug, "[Log_test] now shown file:///a%20b"}}));
}

}  // namespace
}  // namespace platform
