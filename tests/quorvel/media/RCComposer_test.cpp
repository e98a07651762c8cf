// The composer over real fragment files: stream copy and re-encoding, trimmed
// ranges, mixed formats, the composed waveform, and damaged input that must
// fail without leaving a half file. Decoded audio is compared within
// tolerances (tone frequencies per section, durations), never encoder bytes.
#include "QuorvelMedia/RCComposer.h"

#include <gtest/gtest.h>
#include <sys/resource.h>

#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

extern "C" {
#include <libavformat/avformat.h>
}

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "Quorvel/waveform/RCWaveformFile.h"
#include "QuorvelMedia/RCFileInputWaveformDataSource.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using testing::DecodedPCM;
using testing::decodeToPCM;
using testing::estimatedFrequencyHz;
using testing::writeTone;

// The duration the container declares, read the way players do.
double containerSeconds(const std::string& path) {
  AVFormatContext* format = nullptr;
  if (avformat_open_input(&format, path.c_str(), nullptr, nullptr) < 0) return -1;
  avformat_find_stream_info(format, nullptr);
  double seconds = -1;
  for (unsigned i = 0; i < format->nb_streams; ++i) {
    AVStream* s = format->streams[i];
    if (s->codecpar->codec_type == AVMEDIA_TYPE_AUDIO && s->duration > 0)
      seconds = double(s->duration) * av_q2d(s->time_base);
  }
  if (seconds < 0 && format->duration > 0) seconds = double(format->duration) / AV_TIME_BASE;
  avformat_close_input(&format);
  return seconds;
}

using ComposerTest = testing::TempDirectoryTest;

constexpr double kAACFrame = 1024.0 / 44100.0;

// The frequency heard over [from, to) seconds of `pcm`.
double toneAt(const DecodedPCM& pcm, double from, double to) {
  return estimatedFrequencyHz(pcm, std::size_t(from * pcm.sampleRate),
                              std::size_t(to * pcm.sampleRate));
}

// AAC fragments are copied when they match the first one and re-encoded
// otherwise; either way each used range sounds in its place, the length is
// what was asked (give or take a frame per join) and the container says so.
TEST_F(ComposerTest, ComposesAACByCopyWhenTheFragmentsMatchAndByReencodingOtherwise) {
  // clang-format off
  for (const auto& [name, seconds, format, rate, channels, hz] : {
           std::tuple{"a.m4a", 1.0, "m4a", 44100, 1, 300}, {"b.m4a", 1.5, "m4a", 44100, 1, 600},
           {"c.m4a", 0.7, "m4a", 44100, 1, 1200},          {"rec.m4a", 1.0, "m4a", 44100, 1, 300},
           {"s1.m4a", 2.0, "m4a", 44100, 2, 400},          {"s2.m4a", 2.0, "m4a", 44100, 2, 800},
           {"x.flac", 1.0, "flac", 48000, 2, 600},         {"x.wav", 1.0, "wav", 22050, 1, 900},
           {"x.m4a", 1.0, "m4a", 32000, 1, 1200} /* same codec, other rate: not copyable */}) {
    // clang-format on
    ASSERT_TRUE(writeTone(path(name), seconds, format, rate, channels, hz));
  }
  const std::string cli = "ffmpeg -v error -y -f lavfi -i 'sine=f=600:d=1:r=44100' -c:a aac '";
  ASSERT_EQ(std::system((cli + path("cli.m4a") + "'").c_str()), 0);
  struct Section {
    double from, to, hz, tolerance;
  };
  struct Expected {
    const char* method;
    int channels;
    double minSeconds, maxSeconds;  // decoded
    int joins;
  };
  struct Case {
    std::string destination;
    std::vector<RCComposerSegment> segments;
    Expected expected;
    std::vector<Section> sections;
  };
  const double f = kAACFrame;
  for (const Case& c : std::vector<Case>{
           // Each later fragment brings one pre-roll frame; each range ends on a frame.
           {"copy.m4a",
            {{url("a.m4a"), 0.0, 1.0}, {url("b.m4a"), 0.0, 1.5}, {url("c.m4a"), 0.0, 0.7}},
            {"stream copy", 1, 3.2 + 2 * f - 1e-6, 3.2 + 5 * f, 2},
            {{0.1, 0.9, 300, 3}, {1.2, 2.4, 600, 3}, {2.7, 3.2, 1200, 5}}},
           // The first range starts exactly; the others on a frame, after a pre-roll frame.
           {"trim.m4a",
            {{url("s1.m4a"), 0.5, 0.8}, {url("s2.m4a"), 1.1, 0.6}, {url("s1.m4a"), 1.5, 0.5}},
            {"stream copy", 2, 1.9 + 2 * f - 1e-6, 1.9 + 7 * f, 2},
            {{0.05, 0.75, 400, 4}, {0.9, 1.35, 800, 6}, {1.5, 1.9, 400, 6}}},
           // clang-format off
           {"mixed.m4a",
            {{url("a.m4a"), 0.0, 1.0}, {url("x.flac"), 0.25, 0.5}, {url("x.wav"), 0.0, 1.0}, {url("x.m4a"), 0.5, 0.5}},
            {"re-encoding", 1, 3.0 - f - 0.002, 3.0 + f + 0.002, 3},
            {{0.1, 0.9, 300, 3}, {1.1, 1.4, 600, 6}, {1.6, 2.4, 900, 4}, {2.6, 2.95, 1200, 8}}},
           // clang-format on
           // The composed file is itself the first fragment, and the FFmpeg
           // tool made the second.
           {"rec.m4a",
            {{url("rec.m4a"), 0.0, 1.0}, {url("cli.m4a"), 0.0, 1.0}},
            {"stream copy", 1, 2.0 - 3 * f, 2.0 + 3 * f, 1},
            {{0.1, 0.9, 300, 3}, {1.2, 1.9, 600, 3}}},
       }) {
    SCOPED_TRACE(c.destination);
    const std::string waveform = fs::path(c.destination).replace_extension("waveform");
    auto status =
        RCComposeAudio(c.segments, url(c.destination),
                       c.expected.channels == 1 ? std::optional(url(waveform)) : std::nullopt);
    ASSERT_TRUE(status) << status.error();
    EXPECT_TRUE(logged("into " + c.destination + " by " + c.expected.method));
    auto pcm = decodeToPCM(path(c.destination));
    ASSERT_TRUE(pcm) << pcm.error();
    EXPECT_EQ(pcm->sampleRate, 44100);
    EXPECT_EQ(pcm->channels, c.expected.channels);
    EXPECT_GE(pcm->seconds(), c.expected.minSeconds);
    EXPECT_LE(pcm->seconds(), c.expected.maxSeconds);
    EXPECT_NEAR(containerSeconds(path(c.destination)), pcm->seconds(), (c.expected.joins + 1) * f);
    for (const Section& section : c.sections) {
      EXPECT_NEAR(toneAt(*pcm, section.from, section.to), section.hz, section.tolerance)
          << section.from;
    }
    if (c.expected.channels == 1) {
      auto written = RCReadWaveformFile(url(waveform));
      ASSERT_TRUE(written) << written.error();
      EXPECT_EQ(written->sampleRate(), 44100);
      EXPECT_NEAR(written->durationSeconds(), containerSeconds(path(c.destination)), 0.01);
    } else {
      EXPECT_FALSE(fs::exists(path(waveform)));
    }
  }
  EXPECT_TRUE(hiddenFiles().empty());

  // After its pre-roll frame, each later fragment copied sounds exactly as it
  // does on its own (up to the codec's noise filling, which draws fresh
  // random noise): the decoder's overlap starts from the fragment's own
  // audio, so the join does not click. Fragment b follows a's 44 frames and
  // its pre-roll.
  auto copied = decodeToPCM(path("copy.m4a"));
  ASSERT_TRUE(copied);
  for (const auto& [name, start] : {std::pair{"b.m4a", 45 * 1024}, {"c.m4a", (45 + 66) * 1024}}) {
    SCOPED_TRACE(name);
    auto own = decodeToPCM(path(name));
    ASSERT_TRUE(own);
    double worst = 0;
    for (std::size_t i = 0; i < 20000; ++i)
      worst = std::max(worst, double(std::fabs(own->samples[i] - copied->samples[start + i])));
    EXPECT_LT(worst, 5e-3);
  }
  // The composed waveform is the composed file's own: the data source decodes
  // the last frame whole, the composed waveform ends where the container
  // does, less than a frame earlier.
  auto waveform = RCReadWaveformFile(url("copy.waveform"));
  ASSERT_TRUE(waveform) << waveform.error();
  RCFileInputWaveformDataSource source(url("copy.m4a"), false, 30.0);
  source.beginLoading();
  ASSERT_TRUE(source.waitUntilFinished());
  const RCWaveform& reference = source.waveform();
  EXPECT_LE(waveform->length(), reference.length());
  EXPECT_GE(waveform->length() + 1024 / 256 + 1, reference.length());
  int mismatched = 0;
  for (std::size_t p = 0; p < std::min(waveform->length(), reference.length()); ++p)
    mismatched +=
        waveform->max(p, 0) != reference.max(p, 0) || waveform->min(p, 0) != reference.min(p, 0);
  EXPECT_EQ(mismatched, 0);
  // The result interoperates with the FFmpeg tool.
  EXPECT_EQ(std::system(("ffmpeg -v error -i '" + path("copy.m4a") + "' -f null -").c_str()), 0);
}

// Fragments are opened one at a time: 300 of them compose under a limit of
// 64 open files.
TEST_F(ComposerTest, HundredsOfFragmentsNeedOneOpenFileAtATime) {
  ASSERT_TRUE(writeTone(path("take.m4a"), 0.5, "m4a", 44100, 1, 440));
  std::vector<RCComposerSegment> segments(300, RCComposerSegment{url("take.m4a"), 0.0, 0.1});
  struct rlimit saved {};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &saved), 0);
  struct rlimit low = saved;
  low.rlim_cur = 64;
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &low), 0);
  auto status = RCComposeAudio(segments, url("out.m4a"));
  ::setrlimit(RLIMIT_NOFILE, &saved);
  ASSERT_TRUE(status) << status.error();
  EXPECT_NEAR(containerSeconds(path("out.m4a")), 30.0, 300 * 2 * kAACFrame);
}

TEST_F(ComposerTest, LosslessTargetsAreSampleExact) {
  ASSERT_TRUE(writeTone(path("a.flac"), 1.0, "flac", 48000, 2, 500));
  ASSERT_TRUE(writeTone(path("b.flac"), 1.0, "flac", 48000, 2, 1000));
  ASSERT_TRUE(writeTone(path("c.wav"), 1.0, "wav", 48000, 1, 700));
  ASSERT_TRUE(writeTone(path("d.m4a"), 1.0, "m4a", 48000, 2, 250));
  struct Case {
    std::string destination;
    std::vector<RCComposerSegment> segments;
    std::size_t frames;
  };
  for (const Case& c : {
           Case{"out.flac", {{url("a.flac"), 0.0, 1.0}, {url("b.flac"), 0.0, 1.0}}, 96000},
           Case{"trim.flac", {{url("a.flac"), 0.1, 0.25}, {url("b.flac"), 0.5, 0.125}}, 18000},
           Case{"out.wav", {{url("c.wav"), 0.5, 0.5}, {url("a.flac"), 0.0, 0.25}}, 36000},
           Case{"mixed.flac", {{url("d.m4a"), 0.25, 0.5}, {url("c.wav"), 0.0, 0.5}}, 48000},
       }) {
    SCOPED_TRACE(c.destination);
    auto status = RCComposeAudio(c.segments, url(c.destination));
    ASSERT_TRUE(status) << status.error();
    auto pcm = decodeToPCM(path(c.destination));
    ASSERT_TRUE(pcm) << pcm.error();
    EXPECT_EQ(pcm->sampleRate, 48000);
    EXPECT_EQ(pcm->frames(), c.frames);
    EXPECT_NEAR(containerSeconds(path(c.destination)), pcm->seconds(), 1e-6);
  }
  // Lossless all the way: the composed samples are the fragment's samples.
  auto a = decodeToPCM(path("a.flac"));
  auto out = decodeToPCM(path("trim.flac"));
  ASSERT_TRUE(a && out);
  const std::size_t offset = 4800 * 2;  // 0.1 s, two channels
  double worst = 0;
  for (std::size_t i = 0; i < 12000 * 2; ++i)
    worst = std::max(worst, double(std::fabs(a->samples[offset + i] - out->samples[i])));
  EXPECT_LT(worst, 1e-6);
}

TEST_F(ComposerTest, BadInputFailsWithoutTouchingTheDestination) {
  ASSERT_TRUE(testing::writeDamagedAudio(dir_.string()));
  ASSERT_TRUE(writeTone(path("good.m4a"), 1.0, "m4a"));
  ASSERT_TRUE(writeTone(path("good.wav"), 1.0, "wav"));
  ASSERT_TRUE(writeTone(path("old.m4a"), 0.5, "m4a", 44100, 1, 100));
  const std::string before = testing::readFile(path("old.m4a"));
  const double nan = std::nan("");
  // `blamed`: the segment a failure of the fragment's own audio names, so
  // the caller can leave it out; none where the failure says nothing about a
  // fragment (a file that could not be looked at, a bad request, the output).
  struct Case {
    const char* what;
    std::vector<RCComposerSegment> segments;
    platform::URL destination;
    std::optional<std::size_t> blamed;
  };
  const platform::URL old = url("old.m4a");
  const std::nullopt_t none = std::nullopt;
  for (const Case& c : std::vector<Case>{
           {"no fragments", {}, old, none},
           {"missing fragment", {{url("good.m4a"), 0, 1}, {url("gone.m4a"), 0, 1}}, old, none},
           {"text renamed", {{url("good.m4a"), 0, 1}, {url("text.m4a"), 0, 1}}, old, 1},
           {"truncated data", {{url("good.wav"), 0, 1}, {url("cut.wav"), 0, 2}}, old, 1},
           {"truncated audio", {{url("good.m4a"), 0, 1}, {url("cutdata.m4a"), 0, 2}}, old, 1},
           {"movie header cut off", {{url("cut.m4a"), 0, 1}, {url("good.m4a"), 0, 1}}, old, 0},
           {"range past the end (copy)", {{url("good.m4a"), 0.5, 1.5}}, old, 0},
           {"range past the end (re-encode)", {{url("good.wav"), 0, 2}}, old, 0},
           {"no audio stream", {{url("video.m4a"), 0, 0.5}}, old, 0},
           {"negative start", {{url("good.m4a"), -1, 1}}, old, none},
           {"empty range", {{url("good.m4a"), 0, 0}}, old, none},
           {"NaN range", {{url("good.m4a"), nan, 1}}, old, none},
           {"unknown container", {{url("good.m4a"), 0, 1}}, url("out.mp3"), none},
           {"missing directory", {{url("good.m4a"), 0, 1}}, url("nowhere/out.m4a"), none},
       }) {
    SCOPED_TRACE(c.what);
    auto status = RCComposeAudio(c.segments, c.destination, url("old.waveform"));
    ASSERT_FALSE(status);
    EXPECT_FALSE(status.error().localizedDescription().empty());
    EXPECT_EQ(RCComposerFailedSegment(status.error()), c.blamed) << status.error();
    if (c.blamed) {
      ASSERT_NE(status.error().underlyingError(), nullptr);
      EXPECT_TRUE(RCIsAudioDataError(*status.error().underlyingError()));
    } else {
      EXPECT_FALSE(RCIsAudioDataError(status.error())) << status.error();
    }
    EXPECT_EQ(testing::readFile(path("old.m4a")), before);
    EXPECT_FALSE(fs::exists(path("old.waveform")) || fs::exists(path("out.mp3")));
    EXPECT_TRUE(hiddenFiles().empty()) << hiddenFiles().front();
  }
  EXPECT_TRUE(logged("ERROR: Composing old.m4a failed: "));
}

}  // namespace
}  // namespace quorvel
