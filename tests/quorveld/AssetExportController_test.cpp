// The export controller's folding of requests, with its operation queue held
// back so that every request meets the pending work of the ones before it.
// The recordings have no bundle (a finalization with nothing to do
// succeeds) and no audio (their waveform fails without an error).
#include "quorveld/AssetExportController.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "Quorvel/composition/RCCompositionEditor.h"
#include "platform/MainQueue.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/DelegatingMediaEngine.h"
#include "tests/support/RecordingsDirectoryFixture.h"

namespace quorvel {
namespace {

TEST(AssetExportControllerTest, RequestsFoldIntoThePendingWorkAndAreAnsweredInOrder) {
  platform::ManualClock clock;
  platform::MainQueue main(clock, "test main");
  platform::setMainQueueForTesting(&main);
  auto controller = std::make_shared<AssetExportController>();
  controller->setMaxConcurrentOperationCountForTesting(0);
  const platform::URL walk = platform::URL::fileURLWithPath("/nowhere/Walk.m4a");
  const platform::URL talk = platform::URL::fileURLWithPath("/nowhere/Talk.m4a");
  std::vector<std::string> answers;
  auto answer = [&](std::string name) {
    return [&answers, name](bool success, const std::optional<platform::Error>& error) {
      answers.push_back(name + (success ? " yes" : " no") + (error ? " error" : ""));
    };
  };

  controller->finalizeAssetWithCompositionAVURL(walk, false, answer("A"));
  controller->finalizeAssetWithCompositionAVURL(walk, false, answer("B"));
  EXPECT_EQ(controller->pendingOperationCountForTesting(), 1u);  // one finalization
  controller->finalizeAssetWithCompositionAVURL(walk, true, answer("C"));
  EXPECT_EQ(controller->pendingOperationCountForTesting(), 2u);  // + its waveform
  controller->finalizeAssetWithCompositionAVURL(talk, true, answer("D"));
  controller->finalizeAssetWithCompositionAVURL(talk, true, answer("E"));
  controller->finalizeAssetWithCompositionAVURL(talk, false, answer("F"));
  controller->finalizeAssetWithCompositionAVURL(talk, false, {});  // no callback: still fine
  EXPECT_EQ(controller->pendingOperationCountForTesting(), 4u);
  EXPECT_TRUE(answers.empty());

  controller->setMaxConcurrentOperationCountForTesting(2);
  controller->waitUntilAllOperationsAreFinishedForTesting();
  main.runUntilIdle();
  EXPECT_EQ(controller->pendingOperationCountForTesting(), 0u);
  // Each operation answers its own callers together, in the order they came.
  auto position = [&](const std::string& entry) {
    return std::find(answers.begin(), answers.end(), entry) - answers.begin();
  };
  ASSERT_EQ(answers.size(), 6u);
  EXPECT_EQ(position("A yes") + 1, position("B yes"));
  EXPECT_LT(position("C no"), 6);
  EXPECT_LT(position("F yes"), 6);
  EXPECT_EQ(position("D no") + 1, position("E no"));

  // Once answered, the work is gone: the next request queues anew.
  controller->setMaxConcurrentOperationCountForTesting(0);
  controller->finalizeAssetWithCompositionAVURL(walk, false, answer("G"));
  EXPECT_EQ(controller->pendingOperationCountForTesting(), 1u);
  controller->setMaxConcurrentOperationCountForTesting(2);
  controller->waitUntilAllOperationsAreFinishedForTesting();
  main.runUntilIdle();
  EXPECT_EQ(answers.back(), "G yes");
  platform::setMainQueueForTesting(nullptr);
}

// Composes and waveforms wait at a gate the test opens, counting how many
// are inside at once.
class GatedEngine : public testing::DelegatingMediaEngine {
 public:
  platform::Status compose(const std::vector<RCComposerSegment>& segments,
                           const platform::URL& destination,
                           const std::optional<platform::URL>& waveform,
                           const RCMediaProgress& progress) override {
    pass();
    return DelegatingMediaEngine::compose(segments, destination, waveform, progress);
  }
  platform::Status buildWaveform(const platform::URL& audio, const platform::URL& destination,
                                 const RCMediaProgress& progress) override {
    pass();
    return DelegatingMediaEngine::buildWaveform(audio, destination, progress);
  }
  void waitForInside(int count) {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [&] { return inside_ == count; });
  }
  void open() {
    std::lock_guard lock(mutex_);
    open_ = true;
    changed_.notify_all();
  }
  int mostInside() {
    std::lock_guard lock(mutex_);
    return mostInside_;
  }

 private:
  void pass() {
    std::unique_lock lock(mutex_);
    mostInside_ = std::max(mostInside_, ++inside_);
    changed_.notify_all();
    changed_.wait(lock, [&] { return open_; });
    --inside_;
  }
  std::mutex mutex_;
  std::condition_variable changed_;
  int inside_ = 0;
  int mostInside_ = 0;
  bool open_ = false;
};

class GatedExportTest : public testing::RecordingsDirectoryTest {
 protected:
  void SetUp() override {
    RecordingsDirectoryTest::SetUp();
    platform::setMainQueueForTesting(&main_);
    RCMediaEngine::setCurrent(engine_);
  }
  void TearDown() override {
    engine_->open();
    controller_->waitUntilAllOperationsAreFinishedForTesting();
    RCUseInProcessMediaEngine();
    platform::setMainQueueForTesting(nullptr);
    RecordingsDirectoryTest::TearDown();
  }
  // A recording with one fragment not composed yet.
  platform::URL makeRecording(const std::string& name) {
    auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
    const std::string take = (root_ / (name + ".wav")).string();
    EXPECT_TRUE(testing::writeTone(take, 0.5, "wav"));
    auto editor = RCCompositionEditor::createCompositionForNewRecording(**model, name);
    EXPECT_TRUE(editor &&
                editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(take)));
    return editor->composedAVURL();
  }
  AssetExportController::CompletionBlock record(const std::string& name) {
    return [this, name](bool success, const std::optional<platform::Error>&) {
      std::lock_guard lock(answersMutex_);
      answers_.push_back(name + (success ? " yes" : " no"));
      answered_.notify_all();
    };
  }
  std::vector<std::string> answers() {
    std::lock_guard lock(answersMutex_);
    return answers_;
  }

  platform::ManualClock clock_;
  platform::MainQueue main_{clock_, "test main"};
  std::shared_ptr<GatedEngine> engine_ = std::make_shared<GatedEngine>();
  std::shared_ptr<AssetExportController> controller_ = std::make_shared<AssetExportController>();
  std::mutex answersMutex_;
  std::condition_variable answered_;
  std::vector<std::string> answers_;
};

// Three finalizations at once: two compose, the third waits its turn.
TEST_F(GatedExportTest, ThreeFinalizationsRunTwoAtATime) {
  for (const char* name : {"One", "Two", "Three"})
    controller_->finalizeAssetWithCompositionAVURL(makeRecording(name), false, record(name));
  engine_->waitForInside(2);
  EXPECT_EQ(controller_->pendingOperationCountForTesting(), 3u);
  engine_->open();
  controller_->waitUntilAllOperationsAreFinishedForTesting();
  main_.runUntilIdle();
  EXPECT_EQ(engine_->mostInside(), 2);
  auto answered = answers();
  std::sort(answered.begin(), answered.end());
  EXPECT_EQ(answered, (std::vector<std::string>{"One yes", "Three yes", "Two yes"}));
}

// A finalization asked for while only the recording's waveform is still
// pending (its finalization answered) is answered before the call returns.
TEST_F(GatedExportTest, OnlyAWaveformPendingAnswersAtOnce) {
  // Audio without a bundle: nothing to compose, a waveform to build.
  ASSERT_TRUE(testing::writeTone(recordingsPath("Bare.m4a"), 0.5, "m4a"));
  const platform::URL bare = platform::URL::fileURLWithPath(recordingsPath("Bare.m4a"));
  std::thread loop([&] { main_.run(); });
  controller_->setMaxConcurrentOperationCountForTesting(0);
  controller_->finalizeAssetWithCompositionAVURL(bare, false, record("finalized"));
  controller_->finalizeAssetWithCompositionAVURL(bare, true, record("with waveform"));
  controller_->setMaxConcurrentOperationCountForTesting(2);
  engine_->waitForInside(1);  // the waveform is being built
  {
    std::unique_lock lock(answersMutex_);
    answered_.wait(lock, [&] { return !answers_.empty(); });  // the finalization's answer
  }
  controller_->finalizeAssetWithCompositionAVURL(bare, false, record("at once"));
  EXPECT_EQ(answers(), (std::vector<std::string>{"finalized yes", "at once yes"}));
  engine_->open();
  main_.stop();
  loop.join();
}

}  // namespace
}  // namespace quorvel
