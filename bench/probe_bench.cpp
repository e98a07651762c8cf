// Probing many small files (what the orphan recovery and repair do over a
// recordings directory) through the quorvel-media worker against the same
// probes in process: the worker's cost is one round trip per file on top of
// the parsing. Target: ratio <= 1.3.
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "Quorvel/files/RCRecordingsDirectory.h"
#include "Quorvel/media/RCInProcessMediaEngine.h"
#include "Quorvel/media/RCMediaWorkerClient.h"
#include "bench/BenchTiming.h"
#include "tests/support/AudioFixtures.h"

namespace fs = std::filesystem;

namespace {

using quorvel::bench::bestOf;

}  // namespace

int main(int argc, char** argv) {
  const int count = argc > 1 ? std::atoi(argv[1]) : 1000;
  const fs::path work = fs::temp_directory_path() / ("qv-probe-bench-" + std::to_string(getpid()));
  fs::create_directories(work);
  const fs::path first = work / "file0.m4a";
  if (auto written = quorvel::testing::writeTone(first.string(), 0.5, "m4a"); !written) {
    std::fprintf(stderr, "cannot write %s\n", first.c_str());
    return 1;
  }
  std::vector<platform::URL> files{platform::URL::fileURLWithPath(first.string())};
  for (int i = 1; i < count; ++i) {
    const fs::path copy = work / ("file" + std::to_string(i) + ".m4a");
    fs::copy_file(first, copy);
    files.push_back(platform::URL::fileURLWithPath(copy.string()));
  }

  quorvel::RCSetSavedRecordingsDirectory(work.string());
  quorvel::RCMediaWorkerClient::Options options;
  options.workerPath = std::string(QUORVEL_BINARY_DIR) + "/bin/quorvel-media";
  quorvel::RCMediaWorkerClient worker(options);
  quorvel::RCInProcessMediaEngine inProcess;
  auto probeAll = [&](quorvel::RCMediaEngine& engine) {
    return [&] {
      for (const platform::URL& file : files) {
        auto probe = engine.probe(file);
        if (!probe || !probe->playable) {
          std::fprintf(stderr, "probing %s failed\n", file.path().c_str());
          std::exit(1);
        }
      }
    };
  };
  // Alternating rounds, best of each, so both see the same machine.
  double ours = 1e9, viaWorker = 1e9;
  for (int round = 0; round < 5; ++round) {
    ours = std::min(ours, bestOf(1, probeAll(inProcess)));
    viaWorker = std::min(viaWorker, bestOf(1, probeAll(worker)));
  }
  std::printf("probe %d small m4a files in process:             %.3f s (%.1f us each)\n", count,
              ours, ours / count * 1e6);
  std::printf("probe %d small m4a files through quorvel-media: %.3f s (%.1f us each)\n", count,
              viaWorker, viaWorker / count * 1e6);
  std::printf("worker / in-process ratio: %.3f (target <= 1.3)\n", viaWorker / ours);
  fs::remove_all(work);
  return 0;
}
