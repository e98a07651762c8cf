#include "tests/support/DaemonProcess.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <functional>
#include <initializer_list>
#include <stdexcept>

extern char** environ;

namespace quorvel::testing {
namespace {

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

// Starts `arguments` (looked up in PATH) with stdin on /dev/null and
// `outputs` (stdout, stderr or both) on a pipe; the pipe's read end is `fd`.
platform::Result<platform::Subprocess> spawn(const std::vector<std::string>& arguments,
                                             std::optional<std::vector<std::string>> environment,
                                             std::initializer_list<int> outputs, int& fd) {
  int pipeFds[2];
  if (pipe2(pipeFds, O_CLOEXEC) != 0) throw std::runtime_error("pipe failed");
  platform::SpawnOptions options{.arguments = arguments,
                                 .searchPath = true,
                                 .environment = std::move(environment),
                                 .descriptors = {{STDIN_FILENO, platform::Subprocess::kDevNull}}};
  for (int output : outputs) options.descriptors[output] = pipeFds[1];
  auto child = platform::Subprocess::spawn(options);
  close(pipeFds[1]);
  fd = pipeFds[0];
  if (!child) close(fd);
  return child;
}

// Hands what `fd` yields to `chunk` until its end, then closes it.
void readToEnd(int fd, const std::function<void(std::string_view)>& chunk) {
  char buffer[4096];
  for (ssize_t n; (n = read(fd, buffer, sizeof buffer)) != 0;) {
    if (n > 0) chunk({buffer, std::size_t(n)});
    if (n < 0 && errno != EINTR) break;
  }
  close(fd);
}

}  // namespace

std::string DaemonProcess::programPath(const std::string& name) {
  return std::string(QUORVEL_BINARY_DIR) + "/bin/" + name;
}

DaemonProcess::DaemonProcess(std::vector<std::string> arguments)
    : DaemonProcess(programPath("quorveld"), std::move(arguments)) {}

DaemonProcess::DaemonProcess(const std::string& program, std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), program);
  int fd = -1;
  auto child = spawn(arguments, daemonEnvironment(), {STDERR_FILENO}, fd);
  if (!child)
    throw std::runtime_error("cannot start " + program + ": " + child.error().description());
  process_ = std::move(*child);
  pid_ = process_->pid();
  reader_ = std::thread([this, fd] { capture(fd); });
}

DaemonProcess::~DaemonProcess() {
  if (!exitStatus_) {
    process_->kill(SIGKILL);
    waitForExit();
  }
  if (reader_.joinable()) reader_.join();
}

void DaemonProcess::capture(int fd) {
  std::string pending;
  readToEnd(fd, [&](std::string_view chunk) {
    pending.append(chunk);
    std::lock_guard lock(mutex_);
    for (std::size_t newline; (newline = pending.find('\n')) != std::string::npos;) {
      lines_.push_back(pending.substr(0, newline));
      pending.erase(0, newline + 1);
    }
    changed_.notify_all();
  });
  std::lock_guard lock(mutex_);
  if (!pending.empty()) lines_.push_back(pending);
  closed_ = true;
  changed_.notify_all();
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
  const int status = process_->wait();
  exitStatus_ = WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
  return exitStatus_;
}

void DaemonProcess::sendSignal(int signo) const { process_->kill(signo); }

DaemonProcess::CommandResult DaemonProcess::run(const std::vector<std::string>& argv) {
  int fd = -1;
  auto child = spawn(argv, std::nullopt, {STDOUT_FILENO, STDERR_FILENO}, fd);
  if (!child)
    return {127, std::string("cannot run ") + argv[0] + ": " + child.error().description()};
  std::string output;
  readToEnd(fd, [&](std::string_view chunk) { output.append(chunk); });
  return {platform::Subprocess::exitCode(child->wait()), output};
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
