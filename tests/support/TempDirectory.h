// A private temporary directory per test, whole-file reads and writes, and
// captured log lines ("<level> <text>") while the test runs.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <string>
#include <vector>

#include "platform/Log.h"
#include "platform/URL.h"

namespace quorvel::testing {

inline std::string readFile(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

inline void writeFile(const std::filesystem::path& path, const std::string& contents) {
  std::filesystem::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary) << contents;
}

class TempDirectoryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = std::filesystem::temp_directory_path() /
           ("qv-" + std::to_string(::getpid()) + "-" +
            ::testing::UnitTest::GetInstance()->current_test_info()->name());
    std::filesystem::remove_all(dir_);
    std::filesystem::create_directories(dir_);
    platform::setLogThreshold(7);
    platform::setLogSinkForTesting([this](int level, std::string_view text) {
      std::lock_guard lock(logMutex_);
      log_.push_back(std::to_string(level) + " " + std::string(text));
    });
  }
  void TearDown() override {
    platform::setLogSinkForTesting(nullptr);
    platform::setLogThreshold(6);
    std::filesystem::remove_all(dir_);
  }
  std::string path(const std::string& name) const { return (dir_ / name).string(); }
  platform::URL url(const std::string& name) const {
    return platform::URL::fileURLWithPath(path(name));
  }
  // Whether a captured line contains (or, with `prefix`, starts with) `text`.
  bool logged(std::string_view text, bool prefix = false) {
    std::lock_guard lock(logMutex_);
    for (const auto& line : log_)
      if (prefix ? line.starts_with(text) : line.find(text) != std::string::npos) return true;
    return false;
  }
  // How many captured lines of log level `level` contain `text`.
  std::size_t loggedCount(std::string_view text, int level) {
    std::lock_guard lock(logMutex_);
    const std::string levelPrefix = std::to_string(level) + " ";
    std::size_t count = 0;
    for (const auto& line : log_)
      count += line.starts_with(levelPrefix) && line.find(text) != std::string::npos;
    return count;
  }
  // Names of the hidden (temporary) files left in the directory.
  std::vector<std::string> hiddenFiles() const {
    std::vector<std::string> names;
    for (auto& entry : std::filesystem::directory_iterator(dir_))
      if (entry.path().filename().string().starts_with("."))
        names.push_back(entry.path().filename());
    return names;
  }

  std::filesystem::path dir_;
  std::mutex logMutex_;
  std::vector<std::string> log_;
};

}  // namespace quorvel::testing
