// DaemonProcess: a real quorveld (build/bin/quorveld) started by a test on a
// given bus, with its log lines (level 7 included) captured from stderr.
// Tests wait on lines and on the process's exit, never on time; the
// timeouts here are only a safety net against a hung daemon.
//
// Owned by the test; destruction kills a daemon that is still running. Its
// members may be called from the test's thread; the capture runs on a thread
// of its own.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/Subprocess.h"

namespace quorvel::testing {

class DaemonProcess {
 public:
  // Starts quorveld with `arguments` after the program name.
  explicit DaemonProcess(std::vector<std::string> arguments);
  // Starts `program` (a path) the same way: a client held in the background.
  DaemonProcess(const std::string& program, std::vector<std::string> arguments);
  ~DaemonProcess();
  DaemonProcess(const DaemonProcess&) = delete;
  DaemonProcess& operator=(const DaemonProcess&) = delete;

  pid_t pid() const { return pid_; }
  // Waits until `count` stderr lines contain `text`; false on timeout or when
  // the process's stderr closed first.
  bool waitForLines(const std::string& text, std::size_t count,
                    std::chrono::milliseconds timeout = std::chrono::seconds(30));
  bool waitForLine(const std::string& text) { return waitForLines(text, 1); }
  // Every line so far that contains `text`.
  std::vector<std::string> linesContaining(const std::string& text) const;
  std::string output() const;
  // Waits for the process to exit; its exit status, or nullopt on timeout
  // (or -signal when a signal ended it).
  std::optional<int> waitForExit(std::chrono::milliseconds timeout = std::chrono::seconds(30));
  void sendSignal(int signo) const;

  // Runs a command to completion; its exit status and combined output.
  struct CommandResult {
    int status;
    std::string output;
  };
  static CommandResult run(const std::vector<std::string>& argv);
  // quorveld serving `recordings` on the bus at `address`, once it owns its
  // name (the test fails when it does not).
  static std::unique_ptr<DaemonProcess> serve(const std::string& address,
                                              const std::string& recordings,
                                              const std::string& idleExitAfter = "0");
  // Runs quorvelctl on the bus at `address`.
  static CommandResult quorvelctl(const std::string& address, std::vector<std::string> arguments);
  // The path of a built program, "quorveld" or "quorvelctl".
  static std::string programPath(const std::string& name);

 private:
  void capture(int fd);

  std::optional<platform::Subprocess> process_;
  pid_t pid_ = -1;
  std::optional<int> exitStatus_;
  std::thread reader_;
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::string> lines_;
  bool closed_ = false;
};

}  // namespace quorvel::testing
