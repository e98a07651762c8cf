#include "tests/support/DaemonProcess.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <initializer_list>
#include <stdexcept>

extern char** environ;

namespace quorvel::testing {
namespace {

std::vector<char*> argvOf(const std::vector<std::string>& arguments) {
  std::vector<char*> argv;
  for (const auto& argument : arguments) argv.push_back(const_cast<char*>(argument.c_str()));
  argv.push_back(nullptr);
  return argv;
}

// The daemon's environment: ours, with the log on stderr at level 7 and
// without the console format.
std::vector<std::string> daemonEnvironment() {
  std::vector<std::string> environment;
  for (char** entry = environ; *entry; ++entry) {
    std::string_view text(*entry);
    if (text.starts_with("QUORVEL_LOG_")) continue;
    environment.emplace_back(text);
  }
  environment.emplace_back("QUORVEL_LOG_LEVEL=7");
  environment.emplace_back("QUORVEL_LOG_CONSOLE=0");
  environment.emplace_back("QUORVEL_LOG_STDERR=1");
  return environment;
}

// Starts `argv` with stdin on /dev/null and `outputs` (stdout, stderr or both)
// on a pipe; the pipe's read end, or -1 with the spawn error in `error`.
int spawn(pid_t& pid, const std::vector<std::string>& arguments, char* const* envp,
          std::initializer_list<int> outputs, int& error) {
  int pipeFds[2];
  if (pipe2(pipeFds, O_CLOEXEC) != 0) throw std::runtime_error("pipe failed");
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  for (int fd : outputs) posix_spawn_file_actions_adddup2(&actions, pipeFds[1], fd);
  posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  auto argv = argvOf(arguments);
  error = posix_spawnp(&pid, argv[0], &actions, nullptr, argv.data(), envp);
  posix_spawn_file_actions_destroy(&actions);
  close(pipeFds[1]);
  if (error == 0) return pipeFds[0];
  close(pipeFds[0]);
  return -1;
}

}  // namespace

std::string DaemonProcess::programPath(const std::string& name) {
  return std::string(QUORVEL_BINARY_DIR) + "/bin/" + name;
}

DaemonProcess::DaemonProcess(std::vector<std::string> arguments)
    : DaemonProcess(programPath("quorveld"), std::move(arguments)) {}

DaemonProcess::DaemonProcess(const std::string& program, std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), program);
  auto environment = daemonEnvironment();
  int error = 0;
  int fd = spawn(pid_, arguments, argvOf(environment).data(), {STDERR_FILENO}, error);
  if (fd < 0) throw std::runtime_error("cannot start " + program + ": " + std::strerror(error));
  reader_ = std::thread([this, fd] { capture(fd); });
}

DaemonProcess::~DaemonProcess() {
  if (!exitStatus_) {
    ::kill(pid_, SIGKILL);
    waitForExit();
  }
  if (reader_.joinable()) reader_.join();
}

void DaemonProcess::capture(int fd) {
  std::string pending;
  char buffer[4096];
  while (true) {
    ssize_t n = read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    pending.append(buffer, static_cast<std::size_t>(n));
    std::size_t newline;
    std::lock_guard lock(mutex_);
    while ((newline = pending.find('\n')) != std::string::npos) {
      lines_.push_back(pending.substr(0, newline));
      pending.erase(0, newline + 1);
    }
    changed_.notify_all();
  }
  close(fd);
  std::lock_guard lock(mutex_);
  if (!pending.empty()) lines_.push_back(pending);
  closed_ = true;
  changed_.notify_all();
}

bool DaemonProcess::waitForLine(const std::string& text, std::chrono::milliseconds timeout) {
  return waitForLines(text, 1, timeout);
}

bool DaemonProcess::waitForLines(const std::string& text, std::size_t count,
                                 std::chrono::milliseconds timeout) {
  std::unique_lock lock(mutex_);
  std::size_t checked = 0;
  std::size_t found = 0;
  changed_.wait_for(lock, timeout, [&] {
    for (; checked < lines_.size(); ++checked) {
      if (lines_[checked].find(text) != std::string::npos) ++found;
    }
    return found >= count || closed_;
  });
  return found >= count;
}

std::vector<std::string> DaemonProcess::linesContaining(const std::string& text) const {
  std::lock_guard lock(mutex_);
  std::vector<std::string> found;
  for (const auto& line : lines_) {
    if (line.find(text) != std::string::npos) found.push_back(line);
  }
  return found;
}

std::string DaemonProcess::output() const {
  std::lock_guard lock(mutex_);
  std::string text;
  for (const auto& line : lines_) text += line + "\n";
  return text;
}

std::optional<int> DaemonProcess::waitForExit(std::chrono::milliseconds timeout) {
  if (exitStatus_) return exitStatus_;
  // The capture thread sees stderr close when the process ends.
  {
    std::unique_lock lock(mutex_);
    if (!changed_.wait_for(lock, timeout, [this] { return closed_; })) return std::nullopt;
  }
  int status = 0;
  while (waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
  }
  exitStatus_ = WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
  return exitStatus_;
}

void DaemonProcess::sendSignal(int signo) const { ::kill(pid_, signo); }

DaemonProcess::CommandResult DaemonProcess::run(const std::vector<std::string>& argv) {
  pid_t pid = -1;
  int error = 0;
  int fd = spawn(pid, argv, environ, {STDOUT_FILENO, STDERR_FILENO}, error);
  if (fd < 0) return {127, std::string("cannot run ") + argv[0] + ": " + std::strerror(error)};
  std::string output;
  char buffer[4096];
  for (ssize_t n; (n = read(fd, buffer, sizeof buffer)) != 0;) {
    if (n > 0) output.append(buffer, static_cast<std::size_t>(n));
    if (n < 0 && errno != EINTR) break;
  }
  close(fd);
  int status = 0;
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  return {WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status), output};
}

std::unique_ptr<DaemonProcess> DaemonProcess::serve(const std::string& address,
                                                    const std::string& recordings,
                                                    const std::string& idleExitAfter) {
  auto daemon = std::make_unique<DaemonProcess>(
      std::vector<std::string>{"--bus-address", address, "--recordings-dir", recordings,
                               "--idle-exit-after", idleExitAfter});
  EXPECT_TRUE(daemon->waitForLine("[BusListener] listening as")) << daemon->output();
  return daemon;
}

DaemonProcess::CommandResult DaemonProcess::quorvelctl(const std::string& address,
                                                       std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), {programPath("quorvelctl"), "--bus-address", address});
  return run(arguments);
}

}  // namespace quorvel::testing
