// What the benchmarks time their work and run their reference tools with.
// Header-only; used from each benchmark's main thread.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>

namespace quorvel::bench {

// Wall-clock seconds `work` took.
inline double seconds(const std::function<void()>& work) {
  const auto start = std::chrono::steady_clock::now();
  work();
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

// The fastest of `runs` runs of `work`, in seconds.
inline double bestOf(int runs, const std::function<void()>& work) {
  double best = 1e9;
  for (int i = 0; i < runs; ++i) best = std::min(best, seconds(work));
  return best;
}

// Runs a shell command (a reference tool); a failure ends the benchmark.
inline void run(const std::string& command) {
  if (std::system(command.c_str()) != 0) {
    std::fprintf(stderr, "failed: %s\n", command.c_str());
    std::exit(1);
  }
}

}  // namespace quorvel::bench
