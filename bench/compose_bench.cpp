// Composing three 20-minute AAC fragments by stream copy, against the FFmpeg
// tool's concat demuxer with "-c copy" doing the same join, measured in the
// same run (best of three each). Target: at most half the tool's time.
// Also prints the composed file's container duration against its decoded one.
#include <sys/wait.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <vector>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
}

#include "Quorvel/files/RCRecordingsDirectory.h"
#include "Quorvel/media/RCMediaWorkerClient.h"
#include "QuorvelMedia/RCAudioDecoder.h"
#include "QuorvelMedia/RCComposer.h"
#include "bench/BenchTiming.h"

namespace fs = std::filesystem;

namespace {

using quorvel::bench::bestOf;
using quorvel::bench::run;

// 20 minutes of AAC (a sweep over noise, so the encoder works as on speech).
std::string input(const fs::path& cache, int index) {
  const fs::path path = cache / ("fragment" + std::to_string(index) + ".m4a");
  if (!fs::exists(path)) {
    const fs::path temp = cache / ("making-" + path.filename().string());
    run("ffmpeg -v error -y -f lavfi -i 'sine=f=" + std::to_string(220 * (index + 1)) +
        ":d=1200:r=44100' -f lavfi -i 'anoisesrc=d=1200:r=44100:a=0.05:s=" +
        std::to_string(index + 1) + "' -filter_complex amix=inputs=2 -c:a aac -b:a 128k '" +
        temp.string() + "'");
    fs::rename(temp, path);
  }
  return path.string();
}

std::pair<double, double> containerAndDecodedSeconds(const std::string& path) {
  auto decoder = quorvel::RCAudioDecoder::open(platform::URL::fileURLWithPath(path));
  if (!decoder) return {-1, -1};
  AVFormatContext* format = nullptr;
  double container = -1;
  if (avformat_open_input(&format, path.c_str(), nullptr, nullptr) == 0) {
    avformat_find_stream_info(format, nullptr);
    AVStream* s = format->streams[0];
    container = double(s->duration) * av_q2d(s->time_base);
    avformat_close_input(&format);
  }
  std::int64_t frames = 0;
  int rate = 0;
  auto decoded = (*decoder)->decodeAll([&](AVFrame* frame) -> platform::Status {
    frames += frame->nb_samples;
    rate = frame->sample_rate;
    return {};
  });
  return {container, decoded && rate ? double(frames) / rate : -1};
}

}  // namespace

int main() {
  const fs::path cache = fs::path(QUORVEL_BINARY_DIR) / "bench-cache";
  fs::create_directories(cache);
  const fs::path work =
      fs::temp_directory_path() / ("qv-compose-bench-" + std::to_string(getpid()));
  fs::create_directories(work);
  std::vector<std::string> inputs = {input(cache, 0), input(cache, 1), input(cache, 2)};

  std::vector<quorvel::RCComposerSegment> segments;
  std::ofstream list(work / "list.txt");
  for (const std::string& path : inputs) {
    segments.push_back({platform::URL::fileURLWithPath(path), 0.0, 1200.0});
    list << "file '" << path << "'\n";
  }
  list.close();

  const auto composed = platform::URL::fileURLWithPath((work / "composed.m4a").string());
  // In process, and the same job as the daemon runs it: through a
  // quorvel-media worker; alternating rounds, so both see the same machine
  // and page cache.
  quorvel::RCSetSavedRecordingsDirectory(work.string());
  quorvel::RCMediaWorkerClient::Options options;
  options.workerPath = std::string(QUORVEL_BINARY_DIR) + "/bin/quorvel-media";
  options.extraSandboxDirectories = {cache.string()};
  quorvel::RCMediaWorkerClient worker(options);
  double ours = 1e9, viaWorker = 1e9;
  for (int round = 0; round < 3; ++round) {
    ours = std::min(ours, bestOf(1, [&] {
                      if (auto status = quorvel::RCComposeAudio(segments, composed); !status) {
                        std::fprintf(stderr, "compose failed: %s\n",
                                     status.error().description().c_str());
                        std::exit(1);
                      }
                    }));
    viaWorker = std::min(viaWorker, bestOf(1, [&] {
                           if (auto status = worker.compose(segments, composed, std::nullopt, {});
                               !status) {
                             std::fprintf(stderr, "compose through the worker failed: %s\n",
                                          status.error().description().c_str());
                             std::exit(1);
                           }
                         }));
  }
  const double tool = bestOf(3, [&] {
    run("ffmpeg -v error -y -f concat -safe 0 -i '" + (work / "list.txt").string() + "' -c copy '" +
        (work / "tool.m4a").string() + "'");
  });
  const auto [container, decoded] = containerAndDecodedSeconds(composed.path());

  std::printf("compose 3 x 20 min AAC, stream copy: %.3f s\n", ours);
  std::printf("ffmpeg -f concat -c copy:              %.3f s\n", tool);
  std::printf("ratio: %.3f (target <= 0.5)\n", ours / tool);
  std::printf(
      "the same through the quorvel-media worker: %.3f s; worker / in-process ratio %.3f "
      "(target <= 1.1)\n",
      viaWorker, viaWorker / ours);
  std::printf(
      "composed container duration %.4f s, decoded %.4f s, difference %.1f ms "
      "(one AAC frame = %.1f ms; 2 joins)\n",
      container, decoded, (decoded - container) * 1000, 1024 * 1000.0 / 44100);
  fs::remove_all(work);
  return 0;
}
