// Every write, fsync, rename and unlink that a writing operation makes in the
// recordings directory, failed (EIO, ENOSPC) or killed (SIGKILL before the
// call), one at a time: each operation runs once under strace to list its
// calls in the directory, then once more per call and fault, from a fresh
// copy of the same directory, with strace injecting the fault into that call
// alone (strace counts the calls of each system call per thread, and each
// replay's log shows the call the fault went into, so a count that drifted
// fails the test instead of testing another call). quorvel-fault-driver
// performs the operation and checks what it left (see there).
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <map>
#include <mutex>
#include <optional>
#include <sstream>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "tests/support/DaemonProcess.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using testing::DaemonProcess;

constexpr const char* kSyscalls =
    "write,pwrite64,writev,fsync,fdatasync,rename,renameat,renameat2,unlink,unlinkat";

// One call in the recordings directory: the `index`th call of `syscall` made
// by its thread.
struct Point {
  std::string syscall;
  int index = 0;
  std::string line;
};

// The faults, as strace's inject= actions.
constexpr std::string_view kKill = "signal=SIGKILL";
constexpr std::string_view kFaults[] = {kKill, "error=EIO", "error=ENOSPC"};

// A strace log line "PID name(args...": the name and whether the call works
// on `dir` (its file descriptor, as -y shows it, or its path does).
struct Call {
  std::string syscall;
  bool inDirectory = false;
};
std::optional<Call> parseCall(const std::string& line, const std::string& dir) {
  // strace pads the process id to a width.
  const std::size_t name = line.find_first_not_of(' ', line.find(' '));
  const std::size_t paren = line.find('(');
  if (name == std::string::npos || paren == std::string::npos || paren < name) return {};
  if (line.compare(name, 4, "<...") == 0 || line.compare(name, 3, "+++") == 0 ||
      line.compare(name, 3, "---") == 0) {
    return {};  // a resumed call (counted at its start), an exit, a signal
  }
  Call call{line.substr(name, paren - name)};
  // The first argument, or the second after AT_FDCWD.
  const std::string arguments = line.substr(paren + 1);
  std::size_t end = arguments.find(", ");
  std::string first = arguments.substr(0, end);
  if (first.starts_with("AT_FDCWD") && end != std::string::npos) {
    first = arguments.substr(end + 2, arguments.find(", ", end + 2) - end - 2);
  }
  call.inDirectory =
      first.find(dir + "/") != std::string::npos || first.find(dir + ">") != std::string::npos;
  return call;
}

std::string driver() { return DaemonProcess::programPath("quorvel-fault-driver"); }

class FaultPointsTest : public ::testing::TestWithParam<const char*> {
 protected:
  void SetUp() override {
    if (DaemonProcess::run({"strace", "-qq", "-o", "/dev/null", "true"}).status != 0)
      GTEST_SKIP() << "strace cannot trace here (not installed, or ptrace is not allowed)";
    root_ = fs::temp_directory_path() /
            ("qvf-" + std::to_string(getpid()) + "-" + std::string(GetParam()));
    fs::remove_all(root_);
    fs::create_directories(root_);
  }
  void TearDown() override {
    if (!HasFailure()) fs::remove_all(root_);
  }

  // The recordings directory of run `n`: all of one length, so no run's
  // calls differ from another's by the length of a path.
  fs::path directoryOf(int n) const {
    char name[16];
    std::snprintf(name, sizeof name, "r%05d", n);
    return root_ / name / "Recordings";
  }
  // Copies the prepared directory, times included; false with the output.
  std::optional<std::string> copyTemplate(const fs::path& to) {
    fs::create_directories(to.parent_path());
    auto copied = DaemonProcess::run({"cp", "-a", directoryOf(0).string(), to.string()});
    if (copied.status != 0) return "cannot copy the prepared directory: " + copied.output;
    return std::nullopt;
  }
  DaemonProcess::CommandResult traced(const fs::path& dir, const fs::path& log,
                                      const std::string& syscalls,
                                      std::vector<std::string> inject = {}) {
    std::vector<std::string> argv{"strace", "-f",         "-qq", "-y",
                                  "-o",     log.string(), "-e",  "trace=" + syscalls};
    argv.insert(argv.end(), inject.begin(), inject.end());
    argv.insert(argv.end(), {driver(), "run", GetParam(), dir.string()});
    return DaemonProcess::run(argv);
  }

  // The calls of one run in the recordings directory.
  std::vector<Point> enumerate() {
    const fs::path dir = directoryOf(1);
    if (auto failed = copyTemplate(dir)) ADD_FAILURE() << *failed;
    auto ran = traced(dir, root_ / "calls.log", kSyscalls);
    EXPECT_EQ(ran.status, 0) << ran.output;
    std::vector<Point> points;
    std::map<std::pair<std::string, std::string>, int> counts;  // (thread, syscall)
    std::istringstream log(testing::readFile(root_ / "calls.log"));
    for (std::string line; std::getline(log, line);) {
      auto call = parseCall(line, dir.string());
      if (!call) continue;
      const int index = ++counts[{line.substr(0, line.find(' ')), call->syscall}];
      if (call->inDirectory) points.push_back({call->syscall, index, line});
    }
    return points;
  }

  // Replays `point` with `fault`; the problems found, empty when none.
  std::string replay(int n, const Point& point, std::string_view fault) {
    const fs::path dir = directoryOf(n);
    if (auto failed = copyTemplate(dir)) return *failed;
    const fs::path log = dir.parent_path() / "strace.log";
    auto ran = traced(dir, log, point.syscall,
                      {"-e", "inject=" + point.syscall + ":" + std::string(fault) +
                                 ":when=" + std::to_string(point.index)});
    const char* outcome = ran.status == 0     ? "succeeded"
                          : ran.status == 1   ? "failed"
                          : ran.status == 137 ? "killed"
                                              : nullptr;
    if (!outcome) return "ended with status " + std::to_string(ran.status) + ": " + ran.output;
    // The call the fault went into: the first one marked injected, or the
    // one the process was killed in.
    std::istringstream lines(testing::readFile(log));
    std::string hit, previous;
    for (std::string line; std::getline(lines, line) && hit.empty(); previous = line) {
      if (line.find("(INJECTED)") != std::string::npos) hit = line;
      if (line.find("+++ killed by SIGKILL") != std::string::npos) hit = previous;
    }
    auto call = parseCall(hit, dir.string());
    if (!call || !call->inDirectory || call->syscall != point.syscall)
      return std::string("the fault went into another call than ") + point.line + ": '" + hit +
             "' (the calls are not counted the same in every run)";
    if (fault == kKill && std::string(outcome) != "killed") return "not killed";
    std::vector<std::string> after{driver(), "after", GetParam(), dir.string(), outcome};
    if (point.syscall.starts_with("unlink")) after.push_back("unlink");
    auto checked = DaemonProcess::run(after);
    if (checked.status != 0) return std::string(outcome) + ", then: " + checked.output;
    fs::remove_all(dir.parent_path());
    return {};
  }

  fs::path root_;
};

TEST_P(FaultPointsTest, EveryCallFailedOrKilledLeavesTheRecordingsIntact) {
  auto prepared = DaemonProcess::run({driver(), "prepare", GetParam(), directoryOf(0).string()});
  ASSERT_EQ(prepared.status, 0) << prepared.output;
  const std::vector<Point> points = enumerate();
  ASSERT_FALSE(points.empty());
  std::printf("%s: %zu points\n", GetParam(), points.size());

  // Every (point, fault) pair, on as many threads as there are cores.
  const std::size_t jobs = points.size() * std::size(kFaults);
  std::atomic<std::size_t> next{0};
  std::mutex mutex;
  std::vector<std::string> failures;
  auto worker = [&] {
    for (std::size_t job; (job = next++) < jobs;) {
      const Point& point = points[job / std::size(kFaults)];
      const std::string_view fault = kFaults[job % std::size(kFaults)];
      std::string problems = replay(int(job) + 2, point, fault);
      if (problems.empty()) continue;
      std::lock_guard lock(mutex);
      failures.push_back(std::string(fault) + " at " + point.syscall + " #" +
                         std::to_string(point.index) + " " + point.line + "\n  " + problems);
    }
  };
  std::vector<std::thread> threads(std::max(2u, std::thread::hardware_concurrency()));
  for (auto& thread : threads) thread = std::thread(worker);
  for (auto& thread : threads) thread.join();
  for (const std::string& failure : failures) ADD_FAILURE() << failure;
}

INSTANTIATE_TEST_SUITE_P(Operations, FaultPointsTest,
                         ::testing::Values("compose", "title", "recovery", "cleanup", "waveform"),
                         [](const auto& info) { return std::string(info.param); });

}  // namespace
}  // namespace quorvel
