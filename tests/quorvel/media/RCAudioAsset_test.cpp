// Audio assets over real files: durations per format, damaged and odd files
// (no asset or a clear duration, never a crash, a hang or console chatter),
// and the asynchronous metadata load with its exactly-once completion.
#include "Quorvel/media/RCAudioAsset.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cmath>
#include <filesystem>
#include <future>
#include <thread>

#include "Quorvel/media/RCAssetMetadataLoader.h"
#include "QuorvelMedia/RCMP4Atoms.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/Gate.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using testing::M4ALayout;
using testing::writeTone;
using RCAudioAssetTest = testing::TempDirectoryTest;

TEST_F(RCAudioAssetTest, DurationOfEveryCaptureFormat) {
  for (const auto& [name, format, layout] : {std::tuple{"a.m4a", "m4a", M4ALayout::MoovAtEnd},
                                             {"b.m4a", "m4a", M4ALayout::MoovFirst},
                                             {"c.flac", "flac", M4ALayout{}},
                                             {"d.wav", "wav", M4ALayout{}}}) {
    SCOPED_TRACE(name);
    ASSERT_TRUE(writeTone(path(name), 2.5, format, 48000, 2, 440.0, 0.5, layout));
    auto asset = RCAudioAsset::assetWithURL(url(name));
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
  const int capture = ::open(path("stderr.txt").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
  ::dup2(capture, 2);
  std::vector<std::shared_ptr<RCAudioAsset>> none, playable;
  for (const char* name : {"empty.m4a", "text.m4a", "cut.m4a", "fifo.m4a", "video.m4a",
                           "missing.m4a", "header.wav", "."}) {
    none.push_back(RCAudioAsset::assetWithURL(url(name)));
  }
  // Cut-off files whose headers survive still play what is there.
  for (const char* name : {"cut.wav", "cutdata.m4a"})
    playable.push_back(RCAudioAsset::assetWithURL(url(name)));
  fflush(stderr);
  ::dup2(savedStderr, 2);
  ::close(savedStderr);
  ::close(capture);

  EXPECT_EQ(fs::file_size(path("stderr.txt")), 0u);
  EXPECT_EQ(std::ranges::count(none, nullptr), 8);
  for (const auto& asset : playable) {
    ASSERT_NE(asset, nullptr);
    EXPECT_TRUE(std::isnan(asset->duration()) ||
                (asset->duration() >= 0.0 && asset->duration() <= 2.1))
        << asset->url().lastPathComponent() << " " << asset->duration();
  }
  EXPECT_TRUE(logged("7 [RCFFmpegLogging] ffmpeg: ", /*prefix=*/true))
      << "FFmpeg's complaints go to the log at level 7";
}

TEST_F(RCAudioAssetTest, TitleItemsAndTheCaptureDateAreTheFilesOwn) {
  // m4a: one tagged title only; two languages beside the muxer's untagged one.
  ASSERT_TRUE(writeTone(path("one.m4a"), 0.5, "m4a"));
  ASSERT_TRUE(RCMP4WriteTitle(path("one.m4a"), "Bonjour", "fra"));
  ASSERT_TRUE(writeTone(
      path("many.m4a"),
      {.seconds = 0.5,
       .metadata = {{"title", "Plain"}, {"creation_time", "2021-06-07T08:09:10.000000Z"}}}));
  ASSERT_TRUE(RCMP4WriteTitle(path("many.m4a"), "Hallo", "ger"));
  ASSERT_TRUE(RCMP4WriteTitle(path("many.m4a"), "Hello", "eng"));
  // FLAC keeps whatever keys it is given; the CLI writes them as comments.
  ASSERT_EQ(std::system(("ffmpeg -nostdin -hide_banner -loglevel error -y -f lavfi -i sine=d=0.3 "
                         "-metadata title-deu=Hallo -metadata title-ger=Servus -metadata "
                         "TITLE=Plain '" +
                         path("cli.flac") + "'")
                            .c_str()),
            0);
  ASSERT_TRUE(writeTone(path("bare.wav"), 0.3, "wav"));
  struct Case {
    const char* name;
    std::vector<RCMetadataItem> titles;
    std::size_t german;
    const char* created;
  };
  for (const Case& c : std::vector<Case>{
           {"one.m4a", {{"Bonjour", "fra"}}, 0, nullptr},
           // clang-format off
           {"many.m4a", {{"Plain", ""}, {"Hallo", "deu"}, {"Hello", "eng"}}, 1, "2021-06-07T08:09:10.000Z"},
           // clang-format on
           {"cli.flac", {{"Hallo", "deu"}, {"Servus", "ger"}, {"Plain", ""}}, 2, nullptr},
           {"bare.wav", {}, 0, nullptr},
       }) {
    SCOPED_TRACE(c.name);
    auto asset = RCAudioAsset::assetWithURL(url(c.name));
    ASSERT_NE(asset, nullptr);
    auto metadata = asset->loadCommonMetadata();
    ASSERT_TRUE(metadata) << metadata.error();
    EXPECT_THAT(metadata->titleItems, ::testing::UnorderedElementsAreArray(c.titles));
    EXPECT_EQ(RCMetadataItemsWithLocale(metadata->titleItems, "de-CH").size(), c.german);
    EXPECT_EQ(metadata->creationDate ? metadata->creationDate->ISO8601String() : "",
              c.created ? c.created : "");
  }
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
  auto a = RCAudioAsset::assetWithURL(url("a.m4a")), b = RCAudioAsset::assetWithURL(url("b.flac"));
  ASSERT_TRUE(a && b);

  constexpr int kThreads = 4, kPerThread = 50, kLoads = kThreads * kPerThread;
  std::vector<std::atomic<int>> calls(kLoads);
  std::atomic<int> failures{0};
  int done = 0;  // guarded by gate
  // Shared with the callbacks: the last one may still be notifying when the
  // wait below returns.
  auto gate = std::make_shared<platform::testing::Gate>();
  std::vector<std::jthread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int index = t * kPerThread; index < (t + 1) * kPerThread; ++index) {
        (index % 2 ? a : b)->loadCommonMetadataAsync([&, gate, index](auto result) {
          if (!result || (index % 2 && result->titleItems.size() != 1)) ++failures;
          if (!RCAssetMetadataLoader::shared().isCurrent()) ++failures;
          calls[index].fetch_add(1);
          gate->update([&] { ++done; });
        });
      }
    });
  }
  threads.clear();
  ASSERT_TRUE(gate->waitUntil([&] { return done == kLoads; }));
  EXPECT_EQ(failures.load(), 0);
  for (auto& count : calls) EXPECT_EQ(count.load(), 1);
}

}  // namespace
}  // namespace quorvel
