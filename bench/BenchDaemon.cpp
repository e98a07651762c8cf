#include "bench/BenchDaemon.h"

#include <signal.h>
#include <unistd.h>

#include <fstream>
#include <iterator>
#include <set>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

namespace quorvel::bench {

BenchDaemon::BenchDaemon(const std::string& busAddress, const std::string& recordingsDirectory)
    : program_(std::string(QUORVEL_BINARY_DIR) + "/bin/quorveld") {
  auto spawned = platform::Subprocess::spawn(
      {.arguments = {program_, "--bus-address", busAddress, "--recordings-dir", recordingsDirectory,
                     "--idle-exit-after", "0"},
       .environment = std::vector<std::string>{"QUORVEL_LOG_CONSOLE=0", "QUORVEL_LOG_STDERR=1",
                                               "QUORVEL_LOG_LEVEL=4"},
       .descriptors = {{STDERR_FILENO, platform::Subprocess::kDevNull}}});
  if (spawned) process_ = std::move(*spawned);
}

BenchDaemon::~BenchDaemon() {
  if (!process_) return;
  process_->kill(SIGTERM);
  process_->wait();
}

namespace {

// The number after `field` ("VmRSS:", "Threads:") in /proc/PID/status, or -1.
long statusField(pid_t pid, std::string_view field) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.starts_with(field)) return std::stol(line.substr(field.size()));
  }
  return -1;
}

}  // namespace

long residentKilobytes(pid_t pid) { return statusField(pid, "VmRSS:"); }

int threadCount(pid_t pid) { return static_cast<int>(statusField(pid, "Threads:")); }

double cpuMicroseconds(pid_t pid) {
  std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(stat)), {});
  // Fields after the command name, which may hold spaces; utime and stime
  // are the 12th and 13th of them.
  std::istringstream fields(text.substr(text.rfind(')') + 2));
  std::string skipped;
  for (int i = 0; i < 11; ++i) fields >> skipped;
  long user = 0, system = 0;
  fields >> user >> system;
  return static_cast<double>(user + system) * 1e6 / static_cast<double>(sysconf(_SC_CLK_TCK));
}

int mappedLibraryCount(pid_t pid) {
  std::ifstream maps("/proc/" + std::to_string(pid) + "/maps");
  std::set<std::string> libraries;
  std::string line;
  while (std::getline(maps, line)) {
    auto slash = line.find('/');
    if (slash == std::string::npos) continue;
    std::string path = line.substr(slash);
    if (path.find(".so", path.rfind('/')) != std::string::npos) libraries.insert(path);
  }
  return static_cast<int>(libraries.size());
}

}  // namespace quorvel::bench
