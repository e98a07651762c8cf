// Test support for the recordings framework's tests: a fresh saved-recordings
// directory under the test's private temporary directory, with its log lines
// captured.
#pragma once

#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "tests/support/TempDirectory.h"

namespace quorvel::testing {

class RecordingsDirectoryTest : public TempDirectoryTest {
 protected:
  void SetUp() override {
    RCSavedRecordingsModel::setSavedRecordingsDirectory(recordings_.string());
    RCSavedRecordingsModel::resetSharedModelsForTesting();
    // Asking for the directory creates it.
    ASSERT_EQ(RCSavedRecordingsModel::savedRecordingsDirectory(), recordings_.string());
  }
  void TearDown() override {
    RCSavedRecordingsModel::resetSharedModelsForTesting();
    RCSavedRecordingsModel::setSavedRecordingsDirectory(std::nullopt);
  }
  std::string recordingsPath(std::string_view name) const {
    return (recordings_ / std::string(name)).string();
  }

  std::filesystem::path root_ = dir_;
  std::filesystem::path recordings_ = root_ / "Recordings";
};

}  // namespace quorvel::testing
