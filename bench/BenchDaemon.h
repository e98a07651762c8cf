// BenchDaemon: the real build/bin/quorveld, started for a benchmark on a
// private bus with its own recordings directory, logging only warnings, and
// never exiting for idleness. Destruction stops it (SIGTERM) and reaps it.
// Also reads what the benchmarks report of a process from /proc.
//
// Owned by the benchmark's main(); not thread-safe.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "platform/Subprocess.h"

namespace quorvel::bench {

class BenchDaemon {
 public:
  // Starts the daemon; check started() before using it.
  BenchDaemon(const std::string& busAddress, const std::string& recordingsDirectory);
  ~BenchDaemon();
  BenchDaemon(const BenchDaemon&) = delete;
  BenchDaemon& operator=(const BenchDaemon&) = delete;

  bool started() const { return process_.has_value(); }
  pid_t pid() const { return process_ ? process_->pid() : -1; }
  const std::string& program() const { return program_; }

 private:
  std::string program_;
  std::optional<platform::Subprocess> process_;
};

// VmRSS of `pid` in kilobytes; -1 when it cannot be read.
long residentKilobytes(pid_t pid);
// The number of threads of process `pid`, or -1.
int threadCount(pid_t pid);
// User plus system CPU time `pid` has used so far, in microseconds.
double cpuMicroseconds(pid_t pid);
// How many distinct shared libraries `pid` has mapped.
int mappedLibraryCount(pid_t pid);

}  // namespace quorvel::bench
