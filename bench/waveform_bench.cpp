// Computing and saving the waveform of 20 minutes of AAC, against decoding the
// same file with the FFmpeg tool on one thread ("-f null"), measured in the
// same run (best of three each). Target: at most 1.1 times the tool's time.
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <string>

#include "Quorvel/files/RCRecordingsDirectory.h"
#include "Quorvel/media/RCMediaWorkerClient.h"
#include "QuorvelMedia/RCFileInputWaveformDataSource.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
#include "bench/BenchTiming.h"

namespace fs = std::filesystem;

namespace {

using quorvel::bench::bestOf;
using quorvel::bench::run;

}  // namespace

int main() {
  const fs::path cache = fs::path(QUORVEL_BINARY_DIR) / "bench-cache";
  fs::create_directories(cache);
  const fs::path work =
      fs::temp_directory_path() / ("qv-waveform-bench-" + std::to_string(getpid()));
  fs::create_directories(work);
  const fs::path source = cache / "waveform-input.m4a";
  if (!fs::exists(source)) {
    const fs::path temp = cache / "making-waveform-input.m4a";
    run("ffmpeg -v error -y -f lavfi -i 'sine=f=330:d=1200:r=44100' -f lavfi -i "
        "'anoisesrc=d=1200:r=44100:a=0.05' -filter_complex amix=inputs=2 -c:a aac -b:a 128k '" +
        temp.string() + "'");
    fs::rename(temp, source);
  }
  // The recording lives in the work directory, so its waveform file goes there.
  const fs::path audio = work / "recording.m4a";
  fs::copy_file(source, audio);
  const auto url = platform::URL::fileURLWithPath(audio.string());

  std::size_t pixels = 0;
  const double ours = bestOf(3, [&] {
    quorvel::RCFileInputWaveformDataSource dataSource(url, true, 30.0);
    dataSource.beginLoading();
    if (!dataSource.waitUntilFinished()) {
      std::fprintf(stderr, "waveform failed\n");
      std::exit(1);
    }
    pixels = dataSource.waveform().length();
  });
  // The waveform job in process and through a quorvel-media worker, as the
  // daemon runs it.
  quorvel::RCSetSavedRecordingsDirectory(work.string());
  quorvel::RCMediaWorkerClient::Options options;
  options.workerPath = std::string(QUORVEL_BINARY_DIR) + "/bin/quorvel-media";
  quorvel::RCMediaWorkerClient worker(options);
  quorvel::RCInProcessMediaEngine inProcess;
  const auto destination = platform::URL::fileURLWithPath((work / "job.waveform").string());
  auto job = [&](quorvel::RCMediaEngine& engine) {
    return [&] {
      if (auto status = engine.buildWaveform(url, destination, {}); !status) {
        std::fprintf(stderr, "waveform job failed: %s\n", status.error().description().c_str());
        std::exit(1);
      }
    };
  };
  double jobInProcess = 1e9, jobViaWorker = 1e9;
  for (int round = 0; round < 3; ++round) {  // alternating: the same machine for both
    jobInProcess = std::min(jobInProcess, bestOf(1, job(inProcess)));
    jobViaWorker = std::min(jobViaWorker, bestOf(1, job(worker)));
  }
  const double tool =
      bestOf(3, [&] { run("ffmpeg -v error -threads 1 -i '" + audio.string() + "' -f null -"); });

  std::printf("waveform of 20 min AAC (saved every 30 s, %zu pixels): %.3f s\n", pixels, ours);
  std::printf("ffmpeg -threads 1 -i FILE -f null -:               %.3f s\n", tool);
  std::printf("ratio: %.3f (target <= 1.1)\n", ours / tool);
  std::printf(
      "waveform job in process: %.3f s, through the quorvel-media worker: %.3f s; "
      "worker / in-process ratio %.3f (target <= 1.1)\n",
      jobInProcess, jobViaWorker, jobViaWorker / jobInProcess);
  fs::remove_all(work);
  return 0;
}
