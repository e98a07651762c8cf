// The sandbox applied for real. It cannot be undone, so each case forks a
// child that applies a policy, runs its checks and reports back: its exit
// status says whether every check held, and a pipe carries the sandbox's
// line and the checks that failed, so a failure names what escaped.
#include "platform/Sandbox.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <iconv.h>
#include <sched.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <iostream>
#include <stdexcept>
#include <thread>

namespace platform {
namespace {

namespace fs = std::filesystem;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define SANDBOX_TEST_SANITIZED 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define SANDBOX_TEST_SANITIZED 1
#endif
#endif

// Collects the checks that failed inside the child.
struct Checks {
  // Expects `ok`; on failure notes `what` and errno.
  void expect(bool ok, const std::string& what) {
    if (!ok) failures += what + " (" + std::strerror(errno) + ")\n";
  }
  // Expects a call to have failed (-1) with `err`.
  void expectRefused(long result, int err, const std::string& what) {
    expect(result == -1 && errno == err, what + " wanted " + std::strerror(err) + ", got");
  }
  std::string failures;
};

struct Outcome {
  int status = -1;  // waitpid status
  std::string line;
  std::string failures;
  bool passed() const { return WIFEXITED(status) && WEXITSTATUS(status) == 0; }
};

// Forks; the child runs `beforeSandbox`, applies `policy`, runs `checks` and
// exits 0 when all held.
Outcome runSandboxed(
    const SandboxPolicy& policy, const std::function<void(Checks&)>& checks,
    const std::function<void()>& beforeSandbox = [] {}) {
  int fds[2];
  if (::pipe2(fds, O_CLOEXEC) != 0) return {};
  pid_t pid = ::fork();
  if (pid == 0) {
    ::close(fds[0]);
    // Nothing may unwind out of the child into the test runner, which would
    // go on running the remaining tests inside the sandbox.
    std::string report;
    Checks c;
    try {
      beforeSandbox();
      report = applySandbox(policy) + "\n";
      checks(c);
    } catch (const std::exception& e) {
      c.expect(false, std::string("exception: ") + e.what());
    }
    report += c.failures;
    // Far below the pipe's capacity, so one write takes it all.
    bool written =
        ::write(fds[1], report.data(), report.size()) == static_cast<ssize_t>(report.size());
    ::_exit(c.failures.empty() && written ? 0 : 1);
  }
  ::close(fds[1]);
  std::string report;
  char buffer[4096];
  for (ssize_t n; (n = ::read(fds[0], buffer, sizeof buffer)) > 0;) report.append(buffer, n);
  ::close(fds[0]);
  Outcome outcome;
  ::waitpid(pid, &outcome.status, 0);
  std::size_t newline = report.find('\n');
  outcome.line = report.substr(0, newline);
  if (newline != std::string::npos) outcome.failures = report.substr(newline + 1);
  return outcome;
}

bool canOpen(const fs::path& path, int flags) {
  int fd = ::open(path.c_str(), flags | O_CLOEXEC, 0600);
  if (fd < 0) return false;
  ::close(fd);
  return true;
}

class SandboxTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "sandbox-test-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    root_ = pattern;
    fs::create_directories(root_ / "in");
    fs::create_directories(root_ / "out");
    fs::create_directories(root_ / "elsewhere");
    std::ofstream(root_ / "in" / "input") << "input";
    std::ofstream(root_ / "elsewhere" / "secret") << "secret";
    policy_.readPaths = {(root_ / "in").string()};
    policy_.writePaths = {(root_ / "out").string()};
  }
  void TearDown() override { fs::remove_all(root_); }

  fs::path root_;
  SandboxPolicy policy_;
};

TEST_F(SandboxTest, ReachingOutRunningProgramsAndNewNamespacesAreRefused) {
  Outcome outcome = runSandboxed(policy_, [](Checks& c) {
    c.expectRefused(::socket(AF_INET, SOCK_STREAM, 0), EPERM, "socket(AF_INET)");
    c.expectRefused(::socket(AF_UNIX, SOCK_STREAM, 0), EPERM, "socket(AF_UNIX)");
    int pair[2];
    c.expect(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) == 0, "socketpair");
    char* const argv[] = {const_cast<char*>("true"), nullptr};
    c.expectRefused(::execve("/bin/true", argv, environ), EPERM, "execve");
    long cloned = ::syscall(SYS_clone, CLONE_NEWUSER | SIGCHLD, nullptr, nullptr, nullptr, 0);
    if (cloned == 0) ::_exit(0);
    c.expectRefused(cloned, EPERM, "clone(CLONE_NEWUSER)");
    // Threads still start: glibc falls back from clone3 to clone.
    std::promise<int> ran;
    std::thread([&] { ran.set_value(42); }).join();
    c.expect(ran.get_future().get() == 42, "thread");
  });
  EXPECT_TRUE(outcome.passed()) << outcome.failures;
  EXPECT_EQ(outcome.line.rfind("sandbox: no_new_privs, address space unlimited, ", 0), 0u)
      << outcome.line;
  EXPECT_NE(outcome.line.find("seccomp ("), std::string::npos) << outcome.line;
  std::cout << "applied: " << outcome.line << "\n";
}

TEST_F(SandboxTest, TheFilterReachesThreadsThatAlreadyRun) {
  std::promise<void> go;
  std::promise<int> err;
  std::thread worker;
  Outcome outcome = runSandboxed(
      policy_,
      [&](Checks& c) {
        go.set_value();
        c.expect(err.get_future().get() == EPERM, "socket on an older thread");
        worker.join();
      },
      [&] {
        worker = std::thread([&] {
          go.get_future().wait();
          err.set_value(::socket(AF_INET, SOCK_DGRAM, 0) == -1 ? errno : 0);
        });
      });
  EXPECT_TRUE(outcome.passed()) << outcome.failures;
}

TEST_F(SandboxTest, FilesystemRulesConfineReadsAndWrites) {
  if (landlockABI() == 0) GTEST_SKIP() << "the kernel offers no Landlock; nothing to test";
  fs::path in = root_ / "in", out = root_ / "out", elsewhere = root_ / "elsewhere";
  std::ofstream(elsewhere / "single") << "a file of its own";
  policy_.readPaths.push_back((root_ / "absent").string());
  policy_.readPaths.push_back((elsewhere / "single").string());
  Outcome outcome = runSandboxed(policy_, [&](Checks& c) {
    c.expect(canOpen(in / "input", O_RDONLY), "read inside readPaths");
    c.expect(canOpen(elsewhere / "single", O_RDONLY), "read a single file in readPaths");
    c.expectRefused(canOpen(elsewhere / "secret", O_RDONLY) ? 0 : -1, EACCES, "read outside");
    c.expectRefused(canOpen(in / "new", O_WRONLY | O_CREAT) ? 0 : -1, EACCES,
                    "create in a read-only path");
    c.expectRefused(canOpen(elsewhere / "new", O_WRONLY | O_CREAT) ? 0 : -1, EACCES,
                    "create outside");
    // The worker's way of writing: a temp file, renamed over the result,
    // also across directories inside the write path.
    c.expect(canOpen(out / "result.tmp", O_WRONLY | O_CREAT | O_TRUNC), "create inside");
    c.expect(::rename((out / "result.tmp").c_str(), (out / "result").c_str()) == 0, "rename");
    c.expect(::mkdir((out / "sub").c_str(), 0700) == 0, "mkdir inside");
    c.expect(::rename((out / "result").c_str(), (out / "sub" / "result").c_str()) == 0,
             "rename into a subdirectory");
    c.expect(::unlink((out / "sub" / "result").c_str()) == 0, "unlink inside");
    c.expectRefused(::symlink("/etc/passwd", (out / "link").c_str()), EACCES, "symlink");
    c.expectRefused(::rename((in / "input").c_str(), (out / "input").c_str()), EACCES,
                    "moving a read-only file into the write path");
  });
  EXPECT_TRUE(outcome.passed()) << outcome.failures;
  EXPECT_NE(outcome.line.find("landlock ABI " + std::to_string(landlockABI()) +
                              " (1 policy path missing)"),
            std::string::npos)
      << outcome.line;
  EXPECT_TRUE(fs::exists(in / "input"));
}

TEST_F(SandboxTest, AConfinedProcessStillLoadsLibrariesAndSystemData) {
  Outcome outcome = runSandboxed(policy_, [](Checks& c) {
    c.expect(::dlopen("libsqlite3.so.0", RTLD_NOW) != nullptr, "dlopen");
    iconv_t converter = ::iconv_open("ISO-8859-15", "UTF-8");  // a loadable module
    c.expect(converter != reinterpret_cast<iconv_t>(-1), "iconv_open");
    c.expect(canOpen("/dev/null", O_RDWR), "/dev/null");
    c.expect(canOpen("/dev/urandom", O_RDONLY), "/dev/urandom");
    c.expect(canOpen("/proc/self/maps", O_RDONLY), "/proc/self/maps");
    c.expect(canOpen("/sys/devices/system/cpu/online", O_RDONLY), "the CPU list");
  });
  EXPECT_TRUE(outcome.passed()) << outcome.failures;
}

TEST_F(SandboxTest, AllocationsBeyondTheAddressSpaceLimitFail) {
#ifdef SANDBOX_TEST_SANITIZED
  GTEST_SKIP() << "sanitizer runtimes reserve more than any useful limit";
#endif
  policy_.addressSpaceLimitBytes = 512ull << 20;
  Outcome outcome = runSandboxed(policy_, [](Checks& c) {
    void* (*volatile allocate)(std::size_t) = &std::malloc;
    void* small = allocate(1 << 20);
    c.expect(small != nullptr, "a small allocation");
    std::free(small);
    void* huge = allocate(std::size_t{1} << 30);
    c.expect(huge == nullptr, "a 1 GiB allocation");
    std::free(huge);
    rlimit limit{};
    c.expect(::getrlimit(RLIMIT_AS, &limit) == 0 && limit.rlim_max == (512ull << 20),
             "the hard limit, so that it cannot be raised again");
  });
  EXPECT_TRUE(outcome.passed()) << outcome.failures;
  EXPECT_NE(outcome.line.find("address space 512 MiB"), std::string::npos) << outcome.line;
}

}  // namespace
}  // namespace platform
