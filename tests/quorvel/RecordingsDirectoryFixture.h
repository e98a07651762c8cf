// Test support for the recordings framework's tests: a fresh saved-recordings
// directory under a private temporary directory for each test, and capture
// of log lines.
#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <mutex>
#include <string>
#include <vector>

#include "Quorvel/RCSavedRecordingsModel.h"
#include "platform/Log.h"

namespace quorvel::testing {

class RecordingsDirectoryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (std::filesystem::temp_directory_path() / "quorvel-h5-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    root_ = pattern;
    recordings_ = root_ / "Recordings";
    RCSavedRecordingsModel::setSavedRecordingsDirectory(recordings_.string());
    RCSavedRecordingsModel::resetSharedModelsForTesting();
    ASSERT_EQ(RCSavedRecordingsModel::savedRecordingsDirectory(), recordings_.string());
    platform::setConsoleLogging(false);
    platform::setLogThreshold(platform::kLogLevelDebug);
    platform::setLogSinkForTesting([this](int level, std::string_view text) {
      std::lock_guard lock(logMutex_);
      logLines_.push_back(std::to_string(level) + " " + std::string(text));
    });
  }

  void TearDown() override {
    platform::setLogSinkForTesting(nullptr);
    platform::setLogThreshold(platform::kLogLevelNotice);
    RCSavedRecordingsModel::resetSharedModelsForTesting();
    RCSavedRecordingsModel::setSavedRecordingsDirectory(std::nullopt);
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
  }

  std::vector<std::string> logLines() {
    std::lock_guard lock(logMutex_);
    return logLines_;
  }
  // Whether a captured line contains `text`.
  bool logged(std::string_view text) {
    for (const auto& line : logLines()) {
      if (line.find(text) != std::string::npos) return true;
    }
    return false;
  }
  std::string recordingsPath(std::string_view name) const {
    return (recordings_ / std::string(name)).string();
  }

  std::filesystem::path root_;
  std::filesystem::path recordings_;
  std::mutex logMutex_;
  std::vector<std::string> logLines_;
};

}  // namespace quorvel::testing
