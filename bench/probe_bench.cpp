// Probing many small files (what the orphan recovery does over a recordings
// directory) through the quorvel-media worker in batches (probeMany) against
// the same probes in process, one by one: batching leaves the worker about
// one round trip per request of up to 64 files on top of the parsing.
// Target: ratio <= 1.1.
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
#include "Quorvel/media/RCMediaWorkerClient.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
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
  auto check = [](const platform::URL& file, const platform::Result<quorvel::RCMediaProbe>& probe) {
    if (!probe || !probe->playable) {
      std::fprintf(stderr, "probing %s failed\n", file.path().c_str());
      std::exit(1);
    }
  };
  auto oneByOne = [&] {
    for (const platform::URL& file : files) check(file, inProcess.probe(file));
  };
  auto batched = [&] {
    auto probes = worker.probeMany(files);
    for (std::size_t i = 0; i < files.size(); ++i) check(files[i], probes.at(i));
  };
  // Alternating rounds, best of each, so both see the same machine.
  double ours = 1e9, viaWorker = 1e9;
  for (int round = 0; round < 5; ++round) {
    ours = std::min(ours, bestOf(1, oneByOne));
    viaWorker = std::min(viaWorker, bestOf(1, batched));
  }
  std::printf("probe %d small m4a files in process, one by one:        %.3f s (%.1f us each)\n",
              count, ours, ours / count * 1e6);
  std::printf("probe %d small m4a files through quorvel-media, batched: %.3f s (%.1f us each)\n",
              count, viaWorker, viaWorker / count * 1e6);
  std::printf("worker / in-process ratio: %.3f (target <= 1.1)\n", viaWorker / ours);
  fs::remove_all(work);
  return 0;
}
