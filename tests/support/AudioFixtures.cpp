// The fixtures are made and read back by the ffmpeg and ffprobe programs, not
// by the FFmpeg code under test: a fault of the framework's media code cannot
// hide in fixtures that share it.
#include "tests/support/AudioFixtures.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <limits>
#include <ranges>
#include <string_view>
#include <tuple>

#include <fmt/format.h>

#include "Quorvel/composition/RCCompositionManifest.h"
#include "platform/Subprocess.h"

namespace quorvel::testing {
namespace {

constexpr const char* kDomain = "org.quorvel.tests.AudioFixtures";

platform::Error fixtureError(const std::string& what) { return platform::Error(kDomain, -1, what); }

// Runs `arguments` (a program from PATH) with its stdout collected; its
// stderr, ffmpeg's error lines, goes to the test's.
platform::Result<std::string> run(std::vector<std::string> arguments) {
  int fds[2];
  if (::pipe2(fds, O_CLOEXEC) != 0) return platform::fail(fixtureError("pipe"));
  auto child = platform::Subprocess::spawn(
      {.arguments = arguments,
       .searchPath = true,
       .descriptors = {{STDIN_FILENO, platform::Subprocess::kDevNull}, {STDOUT_FILENO, fds[1]}}});
  ::close(fds[1]);
  std::string output;
  char buffer[65536];
  for (ssize_t n; child && (n = ::read(fds[0], buffer, sizeof buffer)) != 0;) {
    if (n > 0) output.append(buffer, std::size_t(n));
    if (n < 0 && errno != EINTR) break;
  }
  ::close(fds[0]);
  if (!child) return platform::fail(child.error());
  if (const int status = child->wait(); status != 0)
    return platform::fail(
        fixtureError(arguments.front() + " " + platform::Subprocess::describeStatus(status)));
  return output;
}

// The words of `text`, split at blanks.
std::vector<std::string> words(std::string_view text) {
  std::vector<std::string> split;
  for (auto word : std::views::split(text, ' ')) split.emplace_back(word.begin(), word.end());
  return split;
}

}  // namespace

platform::Status writeTone(const std::string& path, double seconds, const std::string& format,
                           int sampleRate, int channels, double frequencyHz, double amplitude,
                           M4ALayout layout) {
  return writeTone(
      path, ToneOptions{seconds, format, sampleRate, channels, frequencyHz, amplitude, layout, {}});
}

platform::Status writeTone(const std::string& path, const ToneOptions& tone) {
  std::vector<std::string> codec;
  if (tone.format == "m4a") {
    codec = {"-c:a", "aac", "-b:a", std::to_string(64000 * tone.channels), "-f", "ipod"};
    if (tone.layout == M4ALayout::MoovFirst) codec.insert(codec.end(), {"-movflags", "+faststart"});
  } else if (tone.format == "flac") {
    codec = {"-c:a", "flac", "-sample_fmt", "s16", "-f", "flac"};
  } else if (tone.format == "wav") {
    codec = {"-c:a", "pcm_s16le", "-f", "wav"};
  } else {
    return platform::fail(fixtureError("unknown tone format " + tone.format));
  }
  // The same sine on every channel.
  std::string expression = fmt::format("{}*sin(2*PI*{}*t)", tone.amplitude, tone.frequencyHz);
  std::string channels = expression;
  for (int c = 1; c < tone.channels; ++c) channels += "|" + expression;
  // Only the container is bit-exact: AAC's bit-exact mode spoils the sine.
  auto arguments = words("ffmpeg -nostdin -v error -y -f lavfi -i");
  arguments.push_back(
      fmt::format("aevalsrc={}:s={}:d={}", channels, tone.sampleRate, tone.seconds));
  arguments.insert(arguments.end(), {"-fflags", "+bitexact"});
  for (const auto& [key, value] : tone.metadata)
    arguments.insert(arguments.end(), {"-metadata", key + "=" + value});
  arguments.insert(arguments.end(), codec.begin(), codec.end());
  arguments.push_back(path);
  auto ran = run(std::move(arguments));
  if (!ran) return platform::fail(ran.error());
  return {};
}

platform::Status writeDamagedAudio(const std::string& dir) {
  namespace fs = std::filesystem;
  const fs::path at(dir);
  auto cut = [&](const char* from, const char* to, double keep) {
    std::ifstream in(at / from, std::ios::binary);
    const std::string bytes(std::istreambuf_iterator<char>(in), {});
    std::ofstream(at / to, std::ios::binary) << bytes.substr(0, std::size_t(bytes.size() * keep));
    fs::remove(at / from);
  };
  std::ofstream(at / "empty.m4a").flush();
  std::ofstream(at / "text.m4a") << "a shopping list renamed to look like audio\n";
  for (auto [name, format, layout] : {std::tuple{"whole.m4a", "m4a", M4ALayout::MoovAtEnd},
                                      std::tuple{"first.m4a", "m4a", M4ALayout::MoovFirst},
                                      std::tuple{"whole.wav", "wav", M4ALayout::MoovAtEnd}}) {
    if (auto written = writeTone((at / name).string(), 2.0, format, 44100, 1, 440, 0.5, layout);
        !written)
      return written;
  }
  cut("whole.m4a", "cut.m4a", 2.0 / 3);
  cut("first.m4a", "cutdata.m4a", 0.5);
  cut("whole.wav", "cut.wav", 0.5);
  auto video = words("ffmpeg -nostdin -v error -y -f lavfi -i color=s=32x32:d=0.5 -c:v mpeg4");
  video.insert(video.end(), {"-f", "mp4", (at / "video.m4a").string()});
  if (auto made = run(std::move(video)); !made) return platform::fail(made.error());
  return {};
}

platform::Status writeOrphans(const std::string& dir) {
  const std::filesystem::path at(dir);
  std::filesystem::create_directories(at / "Lost.composition");
  if (auto written = writeTone((at / "Lost.composition/Lost-1.wav").string(), 1.0, "wav"); !written)
    return written;
  RCCompositionManifest manifest;
  manifest.composedName = "Lost.m4a";
  manifest.fragments.push_back({.file = "Lost-1.wav", .contentDuration = 1.0});
  manifest.recomputeTimeRanges();
  std::ofstream(at / "Lost.composition/manifest.json") << manifest.serialize();
  ToneOptions found{.frequencyHz = 660, .metadata = {{"title", "Found on a card"}}};
  if (auto written = writeTone((at / "Found.m4a").string(), found); !written) return written;
  std::filesystem::copy_file(at / "Found.m4a", at / "Found again.m4a");
  std::ofstream(at / "Noise.wav") << std::string(4096, 'x');
  return {};
}

platform::Result<DecodedPCM> decodeToPCM(const std::string& path) {
  auto probe = words(
      "ffprobe -v error -select_streams a:0 -show_entries "
      "stream=sample_rate,channels -of csv=p=0");
  probe.push_back(path);
  auto shape = run(std::move(probe));
  if (!shape) return platform::fail(shape.error());
  DecodedPCM pcm;
  if (std::sscanf(shape->c_str(), "%d,%d", &pcm.sampleRate, &pcm.channels) != 2)
    return platform::fail(fixtureError("no audio stream in " + path));
  // A damaged packet is skipped, as a player would: ffmpeg goes on after one.
  auto decode = words("ffmpeg -nostdin -v quiet -i");
  decode.push_back(path);
  for (auto& word : words("-map 0:a:0 -f f32le -c:a pcm_f32le -"))
    decode.push_back(std::move(word));
  auto samples = run(std::move(decode));
  if (!samples) return platform::fail(samples.error());
  pcm.samples.resize(samples->size() / sizeof(float));
  std::memcpy(pcm.samples.data(), samples->data(), pcm.samples.size() * sizeof(float));
  return pcm;
}

double estimatedFrequencyHz(const DecodedPCM& pcm, std::size_t begin, std::size_t end) {
  if (end == 0 || end > pcm.frames()) end = pcm.frames();
  if (end <= begin + 1 || pcm.sampleRate <= 0) return 0.0;
  std::size_t first = 0, last = 0, crossings = 0;
  for (std::size_t i = begin + 1; i < end; ++i) {
    if (pcm.samples[(i - 1) * pcm.channels] < 0.0f && pcm.samples[i * pcm.channels] >= 0.0f) {
      if (crossings == 0) first = i;
      last = i;
      ++crossings;
    }
  }
  if (crossings < 2) return 0.0;
  return double(crossings - 1) * pcm.sampleRate / double(last - first);
}

double maxAbsDifference(const DecodedPCM& a, const DecodedPCM& b) {
  if (a.channels != b.channels || a.sampleRate != b.sampleRate) {
    return std::numeric_limits<double>::infinity();
  }
  const std::size_t count = std::min(a.samples.size(), b.samples.size());
  double worst = 0.0;
  for (std::size_t i = 0; i < count; ++i) {
    worst = std::max(worst, std::fabs(double(a.samples[i]) - b.samples[i]));
  }
  return worst;
}

}  // namespace quorvel::testing
