// Waveform files (against hand-made bytes and round trips) and the file-input
// data source over real audio: its flushes are observed as replacements of the
// waveform file (inotify), its failures over damaged input.
#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <atomic>
#include <cmath>
#include <filesystem>
#include <fstream>
#include <memory>
#include <thread>
#include <vector>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/waveform/RCFileInputWaveformDataSource.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "Quorvel/waveform/RCWaveformFile.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {
namespace {

using testing::writeTone;
namespace fs = std::filesystem;

std::vector<std::uint8_t> le32(std::initializer_list<std::int64_t> words) {
  std::vector<std::uint8_t> out;
  for (std::int64_t w : words)
    for (int s = 0; s < 32; s += 8) out.push_back(std::uint8_t((std::uint64_t(w) >> s) & 0xff));
  return out;
}
void append16(std::vector<std::uint8_t>& out, std::initializer_list<int> values) {
  for (int v : values) {
    out.push_back(std::uint8_t(v & 0xff));
    out.push_back(std::uint8_t((v >> 8) & 0xff));
  }
}

TEST(RCWaveformFileTest, ReadsHandMadeFilesOfEveryVariant) {
  // Version 2, 16-bit, two channels, two pixels: values cover sign and byte order.
  auto v2 = le32({2, 0, 44100, 256, 2, 2});
  append16(v2, {-32768, 32767, -2, 258, -1, 0, 0, 1});
  auto parsed = RCDecodeWaveformFile(v2);
  ASSERT_TRUE(parsed) << parsed.error();
  EXPECT_EQ(parsed->sampleRate(), 44100);
  EXPECT_EQ(parsed->samplesPerPixel(), 256);
  EXPECT_EQ(parsed->channels(), 2);
  EXPECT_EQ(parsed->bits(), 16);
  ASSERT_EQ(parsed->length(), 2u);
  EXPECT_EQ(parsed->min(0, 0), -32768);
  EXPECT_EQ(parsed->max(0, 0), 32767);
  EXPECT_EQ(parsed->min(0, 1), -2);
  EXPECT_EQ(parsed->max(0, 1), 258);
  EXPECT_EQ(parsed->max(1, 1), 1);
  EXPECT_EQ(RCEncodeWaveformFile(*parsed), std::string(v2.begin(), v2.end()));

  // Version 2, 8-bit (flag bit 0).
  auto v8 = le32({2, 1, 8000, 64, 1, 1});
  v8.push_back(0x80);  // -128
  v8.push_back(0x7f);  // 127
  parsed = RCDecodeWaveformFile(v8);
  ASSERT_TRUE(parsed) << parsed.error();
  EXPECT_EQ(parsed->bits(), 8);
  EXPECT_EQ(parsed->min(0, 0), -128);
  EXPECT_EQ(parsed->max(0, 0), 127);
  EXPECT_EQ(RCEncodeWaveformFile(*parsed), std::string(v8.begin(), v8.end()));

  // Version 1: no channel count, one channel.
  auto v1 = le32({1, 0, 48000, 512, 1});
  append16(v1, {-5, 5});
  parsed = RCDecodeWaveformFile(v1);
  ASSERT_TRUE(parsed) << parsed.error();
  EXPECT_EQ(parsed->channels(), 1);
  EXPECT_EQ(parsed->max(0, 0), 5);

  // An empty waveform is valid.
  EXPECT_TRUE(RCDecodeWaveformFile(le32({2, 0, 44100, 256, 0, 1})));
}

TEST(RCWaveformFileTest, RejectsDamagedHeadersAndSizesWithoutAllocating) {
  auto valid = le32({2, 0, 44100, 256, 1, 1});
  append16(valid, {-3, 3});
  struct Case {
    const char* what;
    std::vector<std::uint8_t> bytes;
  };
  auto with = [&](std::size_t offset, std::int64_t word) {
    auto bytes = valid;
    auto w = le32({word});
    std::copy(w.begin(), w.end(), bytes.begin() + offset);
    return bytes;
  };
  std::vector<Case> cases = {
      {"empty", {}},
      {"half a header", std::vector<std::uint8_t>(valid.begin(), valid.begin() + 10)},
      {"v2 header cut before channels",
       std::vector<std::uint8_t>(valid.begin(), valid.begin() + 22)},
      {"data one byte short", std::vector<std::uint8_t>(valid.begin(), valid.end() - 1)},
      {"one byte too many",
       [&] {
         auto b = valid;
         b.push_back(0);
         return b;
       }()},
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
      {"minimum above maximum",
       [&] {
         auto b = le32({2, 0, 44100, 256, 1, 1});
         append16(b, {3, -3});
         return b;
       }()},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    auto parsed = RCDecodeWaveformFile(c.bytes);
    ASSERT_FALSE(parsed);
    EXPECT_EQ(parsed.error().domain(), kRCMediaErrorDomain);
    EXPECT_EQ(parsed.error().code(), long(RCMediaErrorCodeCorruptWaveform));
  }
}

using RCWaveformFilesTest = testing::TempDirectoryTest;

TEST_F(RCWaveformFilesTest, RoundTripsThroughFilesAndNamesThemAfterTheAudio) {
  RCWaveform waveform(48000, 128, 3, 16);
  for (int p = 0; p < 1000; ++p) {
    std::vector<std::int16_t> pixel;
    for (int c = 0; c < 3; ++c) {
      pixel.push_back(std::int16_t(-p * (c + 1)));
      pixel.push_back(std::int16_t(p * (c + 1)));
    }
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

  using platform::URL;
  EXPECT_EQ(RCWaveform::waveformURLForAVURL(URL::fileURLWithPath("/r/My Talk.m4a")).path(),
            "/r/My Talk.waveform");
  EXPECT_EQ(RCWaveform::waveformURLForAVURL(URL::fileURLWithPath("/r/a.b.flac")).path(),
            "/r/a.b.waveform");
  EXPECT_EQ(RCWaveform::waveformURLForAVURL(URL::fileURLWithPath("/r/plain")).path(),
            "/r/plain.waveform");
}

// --- The data source ---------------------------------------------------------

using WaveformDataSourceTest = testing::TempDirectoryTest;

// Watches a directory for replacements of the file `name`: a hidden temporary
// file is created and then renamed onto `name`. Writing `name` in place would
// show up as a modification of it.
class ReplacementWatch {
 public:
  ReplacementWatch(const fs::path& dir, std::string name) : name_(std::move(name)) {
    fd_ = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    inotify_add_watch(fd_, dir.c_str(), IN_MOVED_TO | IN_CREATE | IN_MODIFY);
  }
  ~ReplacementWatch() { ::close(fd_); }
  // Reads what the kernel queued so far (a rename is queued before rename()
  // returns, so nothing is missed once the work has finished).
  void drain() {
    alignas(inotify_event) char buffer[16384];
    for (;;) {
      const ssize_t n = ::read(fd_, buffer, sizeof buffer);
      if (n <= 0) return;
      for (char* p = buffer; p < buffer + n;) {
        auto* event = reinterpret_cast<inotify_event*>(p);
        const std::string file = event->len ? event->name : "";
        if (event->mask & IN_CREATE) tempCreated_ = tempCreated_ || file.starts_with(".");
        if ((event->mask & IN_MOVED_TO) && file == name_) {
          if (tempCreated_) ++replacements_;
          tempCreated_ = false;
        }
        if ((event->mask & IN_MODIFY) && file == name_) ++inPlaceWrites_;
        p += sizeof(inotify_event) + event->len;
      }
    }
  }
  int replacements() { return drain(), replacements_; }
  int inPlaceWrites() { return drain(), inPlaceWrites_; }

 private:
  int fd_ = -1;
  std::string name_;
  bool tempCreated_ = false;
  int replacements_ = 0;
  int inPlaceWrites_ = 0;
};

// Intermediate saves go to the side file (here after every decoded frame);
// the waveform file itself is written once, whole, and the side file is gone.
TEST_F(WaveformDataSourceTest, FlushesToASideFileAndWritesTheWaveformOnceAtTheEnd) {
  ASSERT_TRUE(writeTone(path("tone.m4a"), 3.0, "m4a", 44100, 1, 441.0, 0.5));
  ReplacementWatch watch(dir_, "tone.waveform");
  RCFileInputWaveformDataSource source(url("tone.m4a"), true, 0);
  std::vector<double> flushedSeconds;
  bool sideFilesMatched = true;
  source.setFlushHandler([&](const RCWaveform& saved) {
    flushedSeconds.push_back(saved.durationSeconds());
    auto onDisk = RCReadWaveformFile(source.partialWaveformURL());
    sideFilesMatched = sideFilesMatched && onDisk && *onDisk == saved;
    sideFilesMatched = sideFilesMatched && !fs::exists(source.waveformURL().path());
  });
  source.beginLoading();
  ASSERT_TRUE(source.waitUntilFinished());
  EXPECT_FALSE(source.error());

  ASSERT_GT(flushedSeconds.size(), 10u);
  EXPECT_TRUE(std::is_sorted(flushedSeconds.begin(), flushedSeconds.end()));
  EXPECT_TRUE(sideFilesMatched);
  EXPECT_EQ(watch.replacements(), 1);
  EXPECT_EQ(watch.inPlaceWrites(), 0);
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
  std::atomic<bool> done{false};
  int reads = 0, torn = 0;
  std::thread reader([&] {
    const platform::URL waveformURL = RCWaveform::waveformURLForAVURL(url("shared.m4a"));
    // Until the sources are done and at least one read saw a whole file: on
    // a loaded machine the sources may all finish before the first read.
    int late = 0;  // reads after the sources were done
    while (!done || (reads == 0 && ++late < 1000)) {
      auto read = RCReadWaveformFile(waveformURL);
      if (read)
        ++reads;
      else if (read.error().domain() == kRCMediaErrorDomain)
        ++torn;
    }
  });
  for (auto& source : sources) EXPECT_TRUE(source->waitUntilFinished());
  done = true;
  reader.join();
  EXPECT_EQ(torn, 0);
  EXPECT_GT(reads, 0);
  auto final = RCReadWaveformFile(RCWaveform::waveformURLForAVURL(url("shared.m4a")));
  ASSERT_TRUE(final);
  EXPECT_EQ(*final, sources.front()->waveform());
  EXPECT_TRUE(hiddenFiles().empty());
}

TEST_F(WaveformDataSourceTest, ComputesEveryFormatAndKeepsItInMemoryWhenNotSaving) {
  struct Case {
    std::string name;
    std::string format;
    int rate;
    int channels;
  };
  for (const Case& c : {Case{"a.flac", "flac", 48000, 2}, Case{"b.wav", "wav", 22050, 1},
                        Case{"c.m4a", "m4a", 48000, 2}}) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(writeTone(path(c.name), 1.25, c.format, c.rate, c.channels, 300, 0.25));
    RCFileInputWaveformDataSource source(url(c.name), false, 0.1);
    int flushes = 0;
    source.setFlushHandler([&](const RCWaveform&) { ++flushes; });
    source.beginLoading();
    ASSERT_TRUE(source.waitUntilFinished());
    EXPECT_EQ(flushes, 0);
    EXPECT_FALSE(fs::exists(RCWaveform::waveformURLForAVURL(url(c.name)).path()));
    EXPECT_EQ(source.waveform().sampleRate(), c.rate);
    EXPECT_EQ(source.waveform().channels(), 1);
    EXPECT_NEAR(source.waveform().durationSeconds(), 1.25, 0.03);
    const std::size_t middle = source.waveform().length() / 2;
    EXPECT_NEAR(source.waveform().max(middle, 0), 8192, 1300);
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
