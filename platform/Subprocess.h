// Subprocess: a child process started with posix_spawn, and the one place
// that kills it, reaps it and says how it ended.
//
// The child gets the argument vector, the environment (this process's unless
// given), the descriptors the caller maps (child fd <- fd of this process, or
// /dev/null), and nothing else of ours from `closeFrom` up; its signal mask is
// empty and the usual signals have their default actions, whatever this
// process blocks or ignores.
//
// A child that must not outlive this process sets PR_SET_PDEATHSIG itself
// (only the program knows it wants to). Linux sends that signal when the
// *thread* that spawned the child ends, not the process, so such children are
// spawned with `outlivesSpawningThread` from a thread of Subprocess's own that
// stays while any of them has not been reaped.
//
// Owned by one user; a Subprocess still running when it goes is killed
// (SIGKILL) and reaped, so no child is left behind as a zombie. Members may
// be called from any thread, one at a time.
#pragma once

#include <sys/types.h>

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/Error.h"

namespace platform {

struct SpawnOptions {
  // arguments[0] is the program: a path, or a name looked up in PATH when
  // `searchPath`.
  std::vector<std::string> arguments;
  bool searchPath = false;
  std::optional<std::vector<std::string>> environment;  // "NAME=value" entries
  // Child descriptor -> this process's descriptor moved there (dup2); the
  // value kDevNull opens /dev/null (read-only for 0, write-only otherwise).
  std::map<int, int> descriptors;
  // Descriptors from here up are closed in the child (after the map is
  // applied); nullopt keeps whatever is not close-on-exec.
  std::optional<int> closeFrom = 3;
  // See above: spawn from a thread that lives as long as the child.
  bool outlivesSpawningThread = false;
};

class Subprocess {
 public:
  static constexpr int kDevNull = -1;

  // Starts the child; an error when posix_spawn fails (a program that cannot
  // be executed is reported by the child exiting with status 127).
  static Result<Subprocess> spawn(const SpawnOptions& options);

  Subprocess(Subprocess&& other) noexcept;
  Subprocess& operator=(Subprocess&& other) noexcept;
  Subprocess(const Subprocess&) = delete;
  Subprocess& operator=(const Subprocess&) = delete;
  ~Subprocess();

  pid_t pid() const { return pid_; }
  // Sends `signal`; nothing once the child has been reaped.
  void kill(int signal) const;
  // Waits for the child to end (retrying after EINTR) and reaps it; its
  // wait status. Once reaped, returns the same status at once.
  int wait();
  // The wait status when the child has ended (and reaps it), else nullopt.
  std::optional<int> poll();
  bool reaped() const { return reaped_; }

  // "exited with status 3", "died with SIGKILL".
  static std::string describeStatus(int status);
  // "SIGKILL", or "signal 64" for one without a name.
  static std::string signalName(int signal);
  // The shell's convention: the exit status, or 128 + the signal.
  static int exitCode(int status);

 private:
  explicit Subprocess(pid_t pid, bool counted) : pid_(pid), counted_(counted) {}
  void markReaped(int status);

  pid_t pid_ = -1;
  bool counted_ = false;  // spawned from the long-lived thread, not yet reaped
  bool reaped_ = false;
  int status_ = 0;
};

}  // namespace platform
