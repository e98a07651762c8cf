// Waveform files (against hand-made bytes and round trips) and the file-input
// data source over real audio: its flushes are observed as replacements of the
// waveform file (inotify), its failures over damaged input.
#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <memory>
#include <thread>
#include <vector>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "Quorvel/waveform/RCWaveformFile.h"
#include "QuorvelMedia/RCFileInputWaveformDataSource.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/DirectoryWatch.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {
namespace {

using testing::writeTone;
namespace fs = std::filesystem;

// Little-endian 32-bit words, then 16-bit values.
std::vector<std::uint8_t> le(std::initializer_list<std::int64_t> words,
                             const std::vector<int>& values = {}) {
  std::vector<std::uint8_t> out;
  for (std::int64_t w : words)
    for (int s = 0; s < 32; s += 8) out.push_back(std::uint8_t(std::uint64_t(w) >> s));
  for (int v : values) out.insert(out.end(), {std::uint8_t(v), std::uint8_t(v >> 8)});
  return out;
}

TEST(RCWaveformFileTest, ReadsHandMadeFilesOfEveryVariant) {
  struct Case {
    const char* what;
    std::vector<std::uint8_t> bytes;
    int sampleRate, channels, bits;
    std::vector<int> data;
    bool reencodes;  // to the same bytes: version 1 is written as version 2
  };
  // Values cover sign and byte order; the 8-bit variant is flag bit 0.
  const std::vector<int> signs = {-32768, 32767, -2, 258, -1, 0, 0, 1};
  auto eightBit = le({2, 1, 8000, 64, 1, 1});
  eightBit.insert(eightBit.end(), {0x80, 0x7f});
  // clang-format off
  for (const Case& c : std::vector<Case>{
           {"v2",         le({2, 0, 44100, 256, 2, 2}, signs), 44100, 2, 16, signs,       true},
           {"8-bit",      eightBit,                            8000,  1, 8,  {-128, 127}, true},
           {"v1, no channels",le({1, 0, 48000, 512, 1}, {-5, 5}),  48000, 1, 16, {-5, 5},     false},
           {"empty",      le({2, 0, 44100, 256, 0, 1}),        44100, 1, 16, {},          true},
       }) {
    // clang-format on
    SCOPED_TRACE(c.what);
    auto parsed = RCDecodeWaveformFile(c.bytes);
    ASSERT_TRUE(parsed) << parsed.error();
    EXPECT_EQ(std::tuple(parsed->sampleRate(), parsed->channels(), parsed->bits()),
              std::tuple(c.sampleRate, c.channels, c.bits));
    EXPECT_TRUE(std::ranges::equal(parsed->data(), c.data));
    if (c.reencodes) {
      EXPECT_EQ(RCEncodeWaveformFile(*parsed), std::string(c.bytes.begin(), c.bytes.end()));
    }
  }
}

TEST(RCWaveformFileTest, RejectsDamagedHeadersAndSizesWithoutAllocating) {
  const auto valid = le({2, 0, 44100, 256, 1, 1}, {-3, 3});
  auto with = [&](std::size_t offset, std::int64_t word) {
    auto bytes = valid, w = le({word});
    std::copy(w.begin(), w.end(), bytes.begin() + offset);
    return bytes;
  };
  auto longer = valid;
  longer.push_back(0);
  for (const auto& [what, bytes] : std::vector<std::pair<const char*, std::vector<std::uint8_t>>>{
           {"empty", {}},
           {"half a header", {valid.begin(), valid.begin() + 10}},
           {"v2 header cut before channels", {valid.begin(), valid.begin() + 22}},
           {"data one byte short", {valid.begin(), valid.end() - 1}},
           {"one byte too many", longer},
           {"version 0", with(0, 0)},
           {"version 3", with(0, 3)},
           {"negative version", with(0, -2)},
           {"unknown flag", with(4, 2)},
           {"zero sample rate", with(8, 0)},
           {"negative sample rate", with(8, -44100)},
           {"zero samples per pixel", with(12, 0)},
           {"length far beyond the data", with(16, 0xffffffff)},
           {"zero channels", with(20, 0)},
           {"25 channels", with(20, 25)},
           {"negative channels", with(20, -1)},
           {"minimum above maximum", le({2, 0, 44100, 256, 1, 1}, {3, -3})},
       }) {
    SCOPED_TRACE(what);
    auto parsed = RCDecodeWaveformFile(bytes);
    ASSERT_FALSE(parsed);
    EXPECT_EQ(parsed.error(), RCMediaError(RCMediaErrorCodeCorruptWaveform, ""));
  }
}

using RCWaveformFilesTest = testing::TempDirectoryTest;

TEST_F(RCWaveformFilesTest, RoundTripsThroughFilesAndNamesThemAfterTheAudio) {
  RCWaveform waveform(48000, 128, 3, 16);
  for (int p = 0; p < 1000; ++p) {
    std::vector<std::int16_t> pixel;
    for (int c = 1; c <= 3; ++c)
      pixel.insert(pixel.end(), {std::int16_t(-p * c), std::int16_t(p * c)});
    waveform.appendPixel(pixel);
  }
  ASSERT_TRUE(RCWriteWaveformFile(waveform, url("w.waveform")));
  auto read = RCReadWaveformFile(url("w.waveform"));
  ASSERT_TRUE(read) << read.error();
  EXPECT_EQ(*read, waveform);
  EXPECT_NEAR(read->durationSeconds(), 1000.0 * 128 / 48000, 1e-9);
  EXPECT_FALSE(RCReadWaveformFile(url("missing")));
  EXPECT_FALSE(RCReadWaveformFile(platform::URL::fileURLWithPath(dir_.string())));
  // Nothing but the file itself is left beside it.
  EXPECT_EQ(std::distance(fs::directory_iterator(dir_), fs::directory_iterator()), 1);

  for (const auto& [audio, expected] : {std::pair{"/r/My Talk.m4a", "/r/My Talk.waveform"},
                                        {"/r/a.b.flac", "/r/a.b.waveform"},
                                        {"/r/plain", "/r/plain.waveform"}}) {
    EXPECT_EQ(RCWaveform::waveformURLForAVURL(platform::URL::fileURLWithPath(audio)).path(),
              expected);
  }
}

using WaveformDataSourceTest = testing::TempDirectoryTest;

// Intermediate saves go to the side file (here after every decoded frame);
// the waveform file itself is written once, whole (a hidden temporary file
// renamed onto it, never written in place), and the side file is gone.
TEST_F(WaveformDataSourceTest, FlushesToASideFileAndWritesTheWaveformOnceAtTheEnd) {
  ASSERT_TRUE(writeTone(path("tone.m4a"), 3.0, "m4a", 44100, 1, 441.0, 0.5));
  testing::DirectoryWatch watch(dir_);
  RCFileInputWaveformDataSource source(url("tone.m4a"), true, 0);
  std::vector<double> flushedSeconds;
  bool sideFilesMatched = true;
  source.setFlushHandler([&](const RCWaveform& saved) {
    flushedSeconds.push_back(saved.durationSeconds());
    auto onDisk = RCReadWaveformFile(source.partialWaveformURL());
    sideFilesMatched =
        sideFilesMatched && onDisk && *onDisk == saved && !fs::exists(source.waveformURL().path());
  });
  source.beginLoading();
  ASSERT_TRUE(source.waitUntilFinished());
  EXPECT_FALSE(source.error());

  ASSERT_GT(flushedSeconds.size(), 10u);
  EXPECT_TRUE(std::ranges::is_sorted(flushedSeconds));
  EXPECT_TRUE(sideFilesMatched);
  int replacements = 0, inPlaceWrites = 0;
  for (const auto& event : watch.events()) {
    if (event.name != "tone.waveform") continue;
    replacements += bool(event.mask & IN_MOVED_TO);
    inPlaceWrites += bool(event.mask & (IN_CREATE | IN_MODIFY));
  }
  EXPECT_EQ(replacements, 1);
  EXPECT_EQ(inPlaceWrites, 0);
  EXPECT_FALSE(fs::exists(source.partialWaveformURL().path()));
  auto final = RCReadWaveformFile(source.waveformURL());
  ASSERT_TRUE(final) << final.error();
  EXPECT_EQ(*final, source.waveform());
  EXPECT_EQ(final->sampleRate(), 44100);
  EXPECT_EQ(final->samplesPerPixel(), RCWaveform::kDefaultSamplesPerPixel);
  EXPECT_NEAR(final->durationSeconds(), 3.0, 0.03);
  // A 0.5-amplitude sine (give or take the codec's error): every pixel of
  // the steady part spans about +-0.5.
  for (std::size_t p = 20; p + 20 < final->length(); ++p) {
    ASSERT_NEAR(final->max(p, 0), 16384, 2500) << p;
    ASSERT_NEAR(final->min(p, 0), -16384, 2500) << p;
  }
  EXPECT_TRUE(hiddenFiles().empty());
}

TEST_F(WaveformDataSourceTest, ConcurrentSourcesOfOneRecordingNeverExposeAHalfFile) {
  ASSERT_TRUE(writeTone(path("shared.m4a"), 2.0, "m4a", 44100, 2, 500, 0.5));
  std::vector<std::unique_ptr<RCFileInputWaveformDataSource>> sources;
  for (int i = 0; i < 6; ++i)
    sources.push_back(
        std::make_unique<RCFileInputWaveformDataSource>(url("shared.m4a"), true, 0.05));
  for (auto& source : sources) source->beginLoading();
  // Read the file while the sources replace it over and over: every read
  // sees a whole waveform (or no file yet), never a torn one.
  const platform::URL waveformURL = RCWaveform::waveformURLForAVURL(url("shared.m4a"));
  std::atomic<bool> done{false};
  int reads = 0, torn = 0;
  std::thread reader([&] {
    // Until the sources are done and at least one read saw a whole file: on
    // a loaded machine the sources may all finish before the first read.
    for (int late = 0; !done || (reads == 0 && ++late < 1000);) {
      auto read = RCReadWaveformFile(waveformURL);
      reads += bool(read);
      torn += !read && read.error().domain() == kRCMediaErrorDomain;
    }
  });
  for (auto& source : sources) EXPECT_TRUE(source->waitUntilFinished());
  done = true;
  reader.join();
  EXPECT_EQ(torn, 0);
  EXPECT_GT(reads, 0);
  auto final = RCReadWaveformFile(waveformURL);
  ASSERT_TRUE(final);
  EXPECT_EQ(*final, sources.front()->waveform());
  EXPECT_TRUE(hiddenFiles().empty());
}

TEST_F(WaveformDataSourceTest, ComputesEveryFormatAndKeepsItInMemoryWhenNotSaving) {
  for (const auto& [name, rate, channels] :
       {std::tuple{"a.flac", 48000, 2}, {"b.wav", 22050, 1}, {"c.m4a", 48000, 2}}) {
    SCOPED_TRACE(name);
    ASSERT_TRUE(writeTone(path(name), 1.25, fs::path(name).extension().string().substr(1), rate,
                          channels, 300, 0.25));
    RCFileInputWaveformDataSource source(url(name), false, 0.1);
    int flushes = 0;
    source.setFlushHandler([&](const RCWaveform&) { ++flushes; });
    source.beginLoading();
    ASSERT_TRUE(source.waitUntilFinished());
    EXPECT_EQ(flushes, 0);
    EXPECT_FALSE(fs::exists(source.waveformURL().path()));
    EXPECT_EQ(source.waveform().sampleRate(), rate);
    EXPECT_EQ(source.waveform().channels(), 1);
    EXPECT_NEAR(source.waveform().durationSeconds(), 1.25, 0.03);
    EXPECT_NEAR(source.waveform().max(source.waveform().length() / 2, 0), 8192, 1300);
  }
}

TEST_F(WaveformDataSourceTest, DamagedOrMissingAudioFailsCleanly) {
  ASSERT_TRUE(testing::writeDamagedAudio(dir_.string()));
  ASSERT_TRUE(writeTone(path("good.wav"), 2.0, "wav"));
  ASSERT_TRUE(writeTone(path("good.m4a"), 2.0, "m4a"));
  fs::create_directories(dir_ / "folder.m4a");
  for (const char* name :
       {"missing.m4a", "text.m4a", "cut.wav", "cutdata.m4a", "video.m4a", "folder.m4a"}) {
    SCOPED_TRACE(name);
    RCFileInputWaveformDataSource source(url(name), true, 0.1);
    source.beginLoading();
    EXPECT_FALSE(source.waitUntilFinished());
    ASSERT_TRUE(source.error());
    EXPECT_FALSE(fs::exists(source.waveformURL().path()));
  }
  EXPECT_TRUE(hiddenFiles().empty());

  // Waiting without loading, and dropping a source mid-load, neither hang nor crash.
  RCFileInputWaveformDataSource idle(url("good.wav"), true, 0.1);
  EXPECT_FALSE(idle.waitUntilFinished());
  for (int i = 0; i < 20; ++i) {
    RCFileInputWaveformDataSource dropped(url("good.m4a"), true, 0.01);
    dropped.beginLoading();
  }
}

}  // namespace
}  // namespace quorvel
