// A private temporary directory per test, whole-file reads and writes, and
// the log lines written while the test runs.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "platform/URL.h"
#include "tests/support/LogCapture.h"
#include "tests/support/ScopedTempDir.h"

namespace quorvel::testing {

inline std::string readFile(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), {}};
}

inline void writeFile(const std::filesystem::path& path, const std::string& contents) {
  std::filesystem::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary) << contents;
}

class TempDirectoryTest : public ::testing::Test {
 protected:
  std::string path(const std::string& name) const { return (dir_ / name).string(); }
  platform::URL url(const std::string& name) const {
    return platform::URL::fileURLWithPath(path(name));
  }
  // The captured lines, each as "<level> <text>".
  std::vector<std::string> logLines() {
    std::vector<std::string> lines;
    for (const LogLine& line : log_.lines())
      lines.push_back(std::to_string(line.level) + " " + line.text);
    return lines;
  }
  // Whether a captured line contains (or, with `prefix`, its "<level> <text>"
  // starts with) `text`.
  bool logged(std::string_view text, bool prefix = false) {
    if (!prefix) return log_.contains(text);
    return std::ranges::any_of(logLines(),
                               [&](const auto& line) { return line.starts_with(text); });
  }
  // How many captured lines of log level `level` contain `text`.
  std::size_t loggedCount(std::string_view text, int level) { return log_.count(text, level); }
  // Names of the hidden (temporary) files left in the directory.
  std::vector<std::string> hiddenFiles() const {
    std::vector<std::string> names;
    for (auto& entry : std::filesystem::directory_iterator(dir_))
      if (entry.path().filename().string().starts_with("."))
        names.push_back(entry.path().filename());
    return names;
  }

  ScopedTempDir temp_;
  std::filesystem::path dir_ = temp_.path();
  LogCapture log_;
};

}  // namespace quorvel::testing
