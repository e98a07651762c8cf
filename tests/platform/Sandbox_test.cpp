// The sandbox applied for real. It cannot be undone, so the test forks a
// child that applies a policy, runs its checks and reports back: its exit
// status says whether every check held, and a pipe carries the sandbox's
// line and the checks that failed, so a failure names what escaped.
#include "platform/Sandbox.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "tests/support/ScopedTempDir.h"

namespace platform {
namespace {

namespace fs = std::filesystem;

// The checks that failed inside the child, each with errno.
struct Checks {
  void expect(bool ok, const std::string& what) {
    if (!ok) failures += what + " (" + std::strerror(errno) + ")\n";
  }
  // Expects a call to have failed (-1) with `err`.
  void expectRefused(long result, int err, const std::string& what) {
    expect(result == -1 && errno == err, what + " wanted " + std::strerror(err) + ", got");
  }
  std::string failures;
};

long openResult(const fs::path& path, int flags) {
  int fd = ::open(path.c_str(), flags | O_CLOEXEC, 0600);
  if (fd >= 0) ::close(fd);
  return fd < 0 ? -1 : 0;
}

// One confined child checks every layer: the filter refuses reaching out on
// every thread, even one started before it; a confined process keeps what it
// needs to run; the filesystem rules confine reads and writes; allocations
// beyond the limit fail.
TEST(SandboxTest, EveryLayerConfinesAndTheProcessKeepsRunning) {
  quorvel::testing::ScopedTempDir root("sandbox-test");
  const fs::path in = root / "in", out = root / "out", other = root / "other";
  for (const fs::path& dir : {in, out, other}) fs::create_directories(dir);
  std::ofstream(in / "input") << "input";
  std::ofstream(other / "secret") << "secret";
  std::ofstream(other / "single") << "a file of its own";
  SandboxPolicy policy;
  policy.readPaths = {in.string(), (root / "absent").string(), (other / "single").string()};
  policy.writePaths = {out.string()};
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
  policy.addressSpaceLimitBytes = 512ull << 20;  // sanitizer runtimes reserve more than that
#endif
  const int abi = landlockABI();
  int fds[2];
  ASSERT_EQ(::pipe2(fds, O_CLOEXEC), 0);
  pid_t pid = ::fork();
  if (pid == 0) {
    // Nothing may unwind out of the child into the test runner, which would
    // go on running the remaining tests inside the sandbox.
    Checks c;
    std::string report;
    std::promise<void> go;
    std::promise<int> err;
    std::thread worker;  // left to _exit() if a check throws
    try {
      worker = std::thread([&] {
        go.get_future().wait();
        err.set_value(::socket(AF_INET, SOCK_DGRAM, 0) == -1 ? errno : 0);
      });
      report = applySandbox(policy) + "\n";
      c.expectRefused(::socket(AF_UNIX, SOCK_STREAM, 0), EPERM, "socket(AF_UNIX)");
      int pair[2];
      c.expect(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) == 0, "socketpair");
      char* const argv[] = {const_cast<char*>("true"), nullptr};
      c.expectRefused(::execve("/bin/true", argv, environ), EPERM, "execve");
      long cloned = ::syscall(SYS_clone, CLONE_NEWUSER | SIGCHLD, nullptr, nullptr, nullptr, 0);
      if (cloned == 0) ::_exit(0);
      c.expectRefused(cloned, EPERM, "clone(CLONE_NEWUSER)");
      go.set_value();
      c.expect(err.get_future().get() == EPERM, "socket on a thread started before");
      worker.join();
      // Threads still start: glibc falls back from clone3 to clone.
      std::promise<int> ran;
      std::thread([&] { ran.set_value(42); }).join();
      c.expect(ran.get_future().get() == 42, "thread");
      // A library loaded late; iconv modules and the like share its rule.
      c.expect(::dlopen("libsqlite3.so.0", RTLD_NOW) != nullptr, "dlopen");
      for (const char* path : {"/dev/urandom", "/proc/self/maps", "/sys/devices/system/cpu/online"})
        c.expect(openResult(path, O_RDONLY) == 0, path);
      c.expect(openResult("/dev/null", O_RDWR) == 0, "/dev/null");
      if (policy.addressSpaceLimitBytes != 0) {
        void* (*volatile allocate)(std::size_t) = &std::malloc;
        void* huge = allocate(std::size_t{1} << 30);
        c.expect(huge == nullptr, "a 1 GiB allocation");
        std::free(huge);
        rlimit limit{};
        c.expect(::getrlimit(RLIMIT_AS, &limit) == 0 && limit.rlim_max == (512ull << 20),
                 "the hard limit, so that it cannot be raised again");
      }
      if (abi != 0) {
        c.expect(openResult(in / "input", O_RDONLY) == 0, "read inside readPaths");
        c.expect(openResult(other / "single", O_RDONLY) == 0, "read a single file in readPaths");
        c.expectRefused(openResult(other / "secret", O_RDONLY), EACCES, "read outside");
        c.expectRefused(openResult(in / "new", O_WRONLY | O_CREAT), EACCES,
                        "create in a read-only path");
        // The worker's way of writing: a temp file renamed into place, also
        // across directories inside the write path.
        c.expect(openResult(out / "result", O_WRONLY | O_CREAT | O_TRUNC) == 0, "create inside");
        c.expect(::mkdir((out / "sub").c_str(), 0700) == 0, "mkdir inside");
        c.expect(::rename((out / "result").c_str(), (out / "sub" / "result").c_str()) == 0,
                 "rename into a subdirectory");
        c.expect(::unlink((out / "sub" / "result").c_str()) == 0, "unlink inside");
        c.expectRefused(::symlink("/etc/passwd", (out / "link").c_str()), EACCES, "symlink");
        c.expectRefused(::rename((in / "input").c_str(), (out / "input").c_str()), EACCES,
                        "moving a read-only file into the write path");
      }
    } catch (const std::exception& e) {
      c.expect(false, std::string("exception: ") + e.what());
    }
    report += c.failures;  // far below the pipe's capacity: one write takes it all
    bool written = ::write(fds[1], report.data(), report.size()) == ssize_t(report.size());
    ::_exit(c.failures.empty() && written ? 0 : 1);
  }
  ::close(fds[1]);
  std::string line;  // the sandbox's report, then the failures
  char buffer[4096];
  for (ssize_t n; (n = ::read(fds[0], buffer, sizeof buffer)) > 0;) line.append(buffer, n);
  ::close(fds[0]);
  int status = -1;
  ::waitpid(pid, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << line;
  std::string expected = "sandbox: no_new_privs, address space ";
  expected += policy.addressSpaceLimitBytes != 0 ? "512 MiB, " : "unlimited, ";
  if (abi != 0) expected += "landlock ABI " + std::to_string(abi) + " (1 policy path missing), ";
  EXPECT_EQ(line.rfind(expected, 0), 0u) << line;
  EXPECT_NE(line.find(", seccomp ("), std::string::npos) << line;
}

}  // namespace
}  // namespace platform
