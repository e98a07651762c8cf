// Audio assets over real files: durations per format, damaged and odd files
// (no asset or a clear duration, never a crash, a hang or console chatter),
// and the asynchronous metadata load with its exactly-once completion.
#include "Quorvel/media/RCAudioAsset.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cmath>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <mutex>
#include <thread>

#include "Quorvel/media/RCAssetMetadataLoader.h"
#include "Quorvel/media/RCMP4Atoms.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {

void PrintTo(const RCMetadataItem& item, std::ostream* out) {
  *out << '"' << item.stringValue << "\"@" << (item.language.empty() ? "-" : item.language);
}

namespace {

namespace fs = std::filesystem;
using testing::M4ALayout;
using testing::writeTone;

class RCAudioAssetTest : public testing::TempDirectoryTest {
 protected:
  static platform::Result<RCCommonMetadata> loadAsync(const RCAudioAsset& asset) {
    std::promise<platform::Result<RCCommonMetadata>> promise;
    auto future = promise.get_future();
    asset.loadCommonMetadataAsync(
        [&promise](platform::Result<RCCommonMetadata> result) { promise.set_value(result); });
    return future.get();
  }
};

TEST_F(RCAudioAssetTest, DurationOfEveryCaptureFormat) {
  struct Case {
    std::string name, format;
    M4ALayout layout;
  };
  for (const Case& c :
       {Case{"a.m4a", "m4a", M4ALayout::MoovAtEnd}, Case{"b.m4a", "m4a", M4ALayout::MoovFirst},
        Case{"c.flac", "flac", {}}, Case{"d.wav", "wav", {}}}) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(writeTone(path(c.name), 2.5, c.format, 48000, 2, 440.0, 0.5, c.layout));
    auto asset = RCAudioAsset::assetWithURL(url(c.name));
    ASSERT_NE(asset, nullptr);
    EXPECT_NEAR(asset->duration(), 2.5, 0.05);
  }
}

TEST_F(RCAudioAssetTest, BadFilesGiveNoAssetOrAClearDurationAndStayOffTheConsole) {
  ASSERT_TRUE(testing::writeDamagedAudio(dir_.string()));
  ASSERT_TRUE(writeTone(path("header.wav"), 1.0, "wav"));
  fs::resize_file(path("header.wav"), 30);  // inside the header
  ASSERT_EQ(::mkfifo(path("fifo.m4a").c_str(), 0600), 0);

  // Nothing FFmpeg says may reach stderr: watch the descriptor itself.
  fflush(stderr);
  const int savedStderr = ::dup(2);
  const std::string stderrPath = path("stderr.txt");
  const int capture = ::open(stderrPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
  ::dup2(capture, 2);

  std::map<std::string, std::shared_ptr<RCAudioAsset>> assets;
  for (const char* name : {"empty.m4a", "text.m4a", "cut.m4a", "cut.wav", "cutdata.m4a",
                           "header.wav", "fifo.m4a", "video.m4a", "missing.m4a"}) {
    assets[name] = RCAudioAsset::assetWithURL(url(name));
  }
  assets["directory"] = RCAudioAsset::assetWithURL(platform::URL::fileURLWithPath(dir_.string()));

  fflush(stderr);
  ::dup2(savedStderr, 2);
  ::close(savedStderr);
  ::close(capture);
  EXPECT_EQ(fs::file_size(stderrPath), 0u);

  for (const char* none : {"empty.m4a", "text.m4a", "cut.m4a", "fifo.m4a", "video.m4a",
                           "missing.m4a", "directory", "header.wav"}) {
    EXPECT_EQ(assets[none], nullptr) << none;
  }
  // Cut-off files whose headers survive still play what is there.
  for (const char* playable : {"cut.wav", "cutdata.m4a"}) {
    ASSERT_NE(assets[playable], nullptr) << playable;
    const double duration = assets[playable]->duration();
    EXPECT_TRUE(std::isnan(duration) || (duration >= 0.0 && duration <= 2.1))
        << playable << " " << duration;
  }
  EXPECT_TRUE(logged("7 [RCFFmpegLogging] ffmpeg: ", /*prefix=*/true))
      << "FFmpeg's complaints go to the log at level 7";
}

TEST_F(RCAudioAssetTest, TitleItemsAreTheFilesOwn) {
  // m4a: one tagged title only, then two languages and an untagged one.
  ASSERT_TRUE(writeTone(path("one.m4a"), 0.5, "m4a"));
  ASSERT_TRUE(RCMP4WriteTitle(path("one.m4a"), "Bonjour", "fra"));
  auto asset = RCAudioAsset::assetWithURL(url("one.m4a"));
  ASSERT_NE(asset, nullptr);
  auto metadata = loadAsync(*asset);
  ASSERT_TRUE(metadata) << metadata.error();
  EXPECT_EQ(metadata->titleItems, (std::vector<RCMetadataItem>{{"Bonjour", "fra"}}));

  testing::ToneOptions tone;
  tone.seconds = 0.5;
  tone.metadata = {{"title", "Plain"}, {"creation_time", "2021-06-07T08:09:10.000000Z"}};
  ASSERT_TRUE(writeTone(path("many.m4a"), tone));
  ASSERT_TRUE(RCMP4WriteTitle(path("many.m4a"), "Hallo", "ger"));
  ASSERT_TRUE(RCMP4WriteTitle(path("many.m4a"), "Hello", "eng"));
  asset = RCAudioAsset::assetWithURL(url("many.m4a"));
  ASSERT_NE(asset, nullptr);
  metadata = loadAsync(*asset);
  ASSERT_TRUE(metadata);
  EXPECT_EQ(metadata->titleItems.size(), 3u);
  EXPECT_EQ(RCMetadataItemsWithLocale(metadata->titleItems, "de-CH"),
            (std::vector<RCMetadataItem>{{"Hallo", "deu"}}));
  ASSERT_TRUE(metadata->creationDate);
  EXPECT_EQ(metadata->creationDate->ISO8601String(), "2021-06-07T08:09:10.000Z");

  // FLAC keeps whatever keys it is given; the CLI writes them as comments.
  const std::string command =
      "ffmpeg -nostdin -hide_banner -loglevel error -y -f lavfi -i sine=d=0.3 "
      "-metadata title-deu=Hallo -metadata title-ger=Servus -metadata TITLE=Plain '" +
      path("cli.flac") + "'";
  ASSERT_EQ(std::system(command.c_str()), 0);
  asset = RCAudioAsset::assetWithURL(url("cli.flac"));
  ASSERT_NE(asset, nullptr);
  metadata = asset->loadCommonMetadata();
  ASSERT_TRUE(metadata);
  EXPECT_EQ(metadata->titleItems.size(), 3u);
  EXPECT_EQ(RCMetadataItemsWithLocale(metadata->titleItems, "de").size(), 2u);
  EXPECT_FALSE(metadata->creationDate);

  // No metadata at all.
  ASSERT_TRUE(writeTone(path("bare.wav"), 0.3, "wav"));
  asset = RCAudioAsset::assetWithURL(url("bare.wav"));
  ASSERT_NE(asset, nullptr);
  metadata = loadAsync(*asset);
  ASSERT_TRUE(metadata);
  EXPECT_TRUE(metadata->titleItems.empty());
  EXPECT_FALSE(metadata->creationDate);
}

TEST_F(RCAudioAssetTest, AVanishedFileFailsTheLoadOnceAndOffTheCallersThread) {
  ASSERT_TRUE(writeTone(path("gone.m4a"), 0.3, "m4a"));
  auto asset = RCAudioAsset::assetWithURL(url("gone.m4a"));
  ASSERT_NE(asset, nullptr);
  fs::remove(path("gone.m4a"));
  std::promise<std::pair<bool, std::thread::id>> promise;
  asset->loadCommonMetadataAsync([&promise](platform::Result<RCCommonMetadata> result) {
    promise.set_value({result.has_value(), std::this_thread::get_id()});
  });
  asset.reset();  // the load does not need the asset any more
  auto [succeeded, thread] = promise.get_future().get();
  EXPECT_FALSE(succeeded);
  EXPECT_NE(thread, std::this_thread::get_id());
}

TEST_F(RCAudioAssetTest, ManyConcurrentLoadsEachCompleteExactlyOnce) {
  ASSERT_TRUE(writeTone(path("a.m4a"), 0.2, "m4a"));
  ASSERT_TRUE(RCMP4WriteTitle(path("a.m4a"), "A", "eng"));
  ASSERT_TRUE(writeTone(path("b.flac"), 0.2, "flac"));
  auto a = RCAudioAsset::assetWithURL(url("a.m4a"));
  auto b = RCAudioAsset::assetWithURL(url("b.flac"));
  ASSERT_TRUE(a && b);

  constexpr int kThreads = 4, kPerThread = 50;
  std::vector<std::atomic<int>> calls(kThreads * kPerThread);
  std::atomic<int> done{0}, failures{0};
  std::mutex mutex;
  std::condition_variable allDone;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kPerThread; ++i) {
        const int index = t * kPerThread + i;
        const RCAudioAsset& asset = (index % 2) ? *a : *b;
        asset.loadCommonMetadataAsync([&, index](platform::Result<RCCommonMetadata> result) {
          if (!result || (index % 2 && result->titleItems.size() != 1)) ++failures;
          EXPECT_TRUE(RCAssetMetadataLoader::shared().isCurrent());
          calls[index].fetch_add(1);
          if (done.fetch_add(1) + 1 == kThreads * kPerThread) {
            std::lock_guard lock(mutex);
            allDone.notify_all();
          }
        });
      }
    });
  }
  for (auto& thread : threads) thread.join();
  std::unique_lock lock(mutex);
  allDone.wait(lock, [&] { return done.load() == kThreads * kPerThread; });
  EXPECT_EQ(failures.load(), 0);
  for (auto& count : calls) EXPECT_EQ(count.load(), 1);
}

}  // namespace
}  // namespace quorvel
