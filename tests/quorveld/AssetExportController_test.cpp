// The export controller: requests folding into the pending work of the ones
// before them (its operation queue held back), and its operations running
// two at a time (the media work held at a gate).
#include "quorveld/AssetExportController.h"

#include <gtest/gtest.h>

#include <thread>

#include "Quorvel/composition/RCCompositionEditor.h"
#include "platform/MainQueue.h"
#include "quorveld/RCSXPCTransactionController.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/HeldMediaEngine.h"
#include "tests/support/RecordingsDirectoryFixture.h"

namespace quorvel {
namespace {

class ExportControllerTest : public testing::RecordingsDirectoryTest {
 public:
  void SetUp() override {
    RecordingsDirectoryTest::SetUp();
    platform::setMainQueueForTesting(&main_);
    engine_->holds = [](std::string_view job, const std::string&) { return job != "probe"; };
    RCMediaEngine::setCurrent(engine_);
  }
  void TearDown() override {
    engine_->open();
    controller_->waitUntilAllOperationsAreFinishedForTesting();
    RCUseInProcessMediaEngine();
    platform::setMainQueueForTesting(nullptr);
    RecordingsDirectoryTest::TearDown();
  }
  AssetExportController::CompletionBlock record(const std::string& name) {
    return [this, name](bool success, const std::optional<platform::Error>& error) {
      answers_.update(
          [&] { answers.push_back(name + (success ? " yes" : " no") + (error ? " error" : "")); });
    };
  }
  std::vector<std::string> answered() {
    std::lock_guard lock(answers_.mutex());
    return answers;
  }
  void runAll() {
    controller_->setMaxConcurrentOperationCountForTesting(2);
    controller_->waitUntilAllOperationsAreFinishedForTesting();
    main_.runUntilIdle();
  }

  platform::ManualClock clock_;
  platform::MainQueue main_{clock_, "test main"};
  std::shared_ptr<testing::HeldMediaEngine> engine_ = std::make_shared<testing::HeldMediaEngine>();
  std::shared_ptr<AssetExportController> controller_ = std::make_shared<AssetExportController>();
  platform::testing::Gate answers_;
  std::vector<std::string> answers;  // guarded by answers_
};

// The recordings have no bundle (a finalization with nothing to do
// succeeds) and no audio (their waveform fails without an error).
TEST_F(ExportControllerTest, RequestsFoldIntoThePendingWorkAndAreAnsweredInOrder) {
  engine_->open();
  controller_->setMaxConcurrentOperationCountForTesting(0);
  const platform::URL walk = platform::URL::fileURLWithPath("/nowhere/Walk.m4a");
  const platform::URL talk = platform::URL::fileURLWithPath("/nowhere/Talk.m4a");
  const std::tuple<const platform::URL*, bool, const char*, std::size_t> requests[] = {
      {&walk, false, "A", 1},                         // one finalization
      {&walk, false, "B", 1}, {&walk, true, "C", 2},  // and its waveform
      {&talk, true, "D", 4},  {&talk, true, "E", 4},
      {&talk, false, "F", 4}, {&talk, false, nullptr, 4},  // no callback: still fine
  };
  for (const auto& [url, waveform, name, pending] : requests) {
    controller_->finalizeAssetWithCompositionAVURL(*url, waveform, name ? record(name) : nullptr);
    EXPECT_EQ(controller_->pendingOperationCountForTesting(), pending) << name;
  }
  EXPECT_TRUE(answered().empty());
  // Pending work keeps the daemon alive by itself, not only through the
  // sessions it was asked under.
  EXPECT_TRUE(RCSXPCTransactionController::sharedInstance().isInTransaction());
  runAll();
  EXPECT_EQ(controller_->pendingOperationCountForTesting(), 0u);
  EXPECT_FALSE(RCSXPCTransactionController::sharedInstance().isInTransaction());
  // Each operation answers its own callers together, in the order they came.
  auto all = answered();
  auto position = [&](const std::string& entry) {
    return std::ranges::find(all, entry) - all.begin();
  };
  ASSERT_EQ(all.size(), 6u);
  EXPECT_EQ(position("A yes") + 1, position("B yes"));
  EXPECT_LT(position("C no"), 6);
  EXPECT_LT(position("F yes"), 6);
  EXPECT_EQ(position("D no") + 1, position("E no"));

  // Once answered, the work is gone: the next request queues anew.
  controller_->setMaxConcurrentOperationCountForTesting(0);
  controller_->finalizeAssetWithCompositionAVURL(walk, false, record("G"));
  EXPECT_EQ(controller_->pendingOperationCountForTesting(), 1u);
  runAll();
  EXPECT_EQ(answered().back(), "G yes");
}

TEST_F(ExportControllerTest, ThreeFinalizationsRunTwoAtATime) {
  auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
  const std::string take = (root_ / "take.wav").string();
  ASSERT_TRUE(testing::writeTone(take, 0.5, "wav"));
  for (const char* name : {"One", "Two", "Three"}) {
    auto editor = RCCompositionEditor::createCompositionForNewRecording(**model, name);
    ASSERT_TRUE(editor &&
                editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(take)));
    controller_->finalizeAssetWithCompositionAVURL(editor->composedAVURL(), false, record(name));
  }
  ASSERT_TRUE(engine_->waitForInside(2));
  EXPECT_EQ(controller_->pendingOperationCountForTesting(), 3u);
  engine_->open();
  runAll();
  EXPECT_EQ(engine_->mostInside(), 2);
  auto all = answered();
  std::ranges::sort(all);
  EXPECT_EQ(all, (std::vector<std::string>{"One yes", "Three yes", "Two yes"}));
}

// A finalization asked for while only the recording's waveform is still
// pending (its finalization answered) is answered before the call returns;
// one that wants the waveform too joins it.
TEST_F(ExportControllerTest, OnlyAWaveformPendingAnswersAtOnceOrJoinsIt) {
  ASSERT_TRUE(testing::writeTone(recordingsPath("Bare.m4a"), 0.5, "m4a"));  // no bundle
  const platform::URL bare = platform::URL::fileURLWithPath(recordingsPath("Bare.m4a"));
  std::thread loop([&] { main_.run(); });
  controller_->setMaxConcurrentOperationCountForTesting(0);
  controller_->finalizeAssetWithCompositionAVURL(bare, false, record("finalized"));
  controller_->finalizeAssetWithCompositionAVURL(bare, true, record("with waveform"));
  controller_->setMaxConcurrentOperationCountForTesting(2);
  ASSERT_TRUE(engine_->waitForInside(1));                             // the waveform is being built
  ASSERT_TRUE(answers_.waitUntil([&] { return !answers.empty(); }));  // the finalization's
  controller_->finalizeAssetWithCompositionAVURL(bare, false, record("at once"));
  controller_->finalizeAssetWithCompositionAVURL(bare, true, record("joining"));
  EXPECT_EQ(answered(), (std::vector<std::string>{"finalized yes", "at once yes"}));
  EXPECT_EQ(controller_->pendingOperationCountForTesting(), 1u);  // the waveform only
  engine_->open();
  ASSERT_TRUE(answers_.waitUntil([&] { return answers.size() == 4; }));
  EXPECT_EQ(answered(), (std::vector<std::string>{"finalized yes", "at once yes",
                                                  "with waveform yes", "joining yes"}));
  main_.stop();
  loop.join();
}

}  // namespace
}  // namespace quorvel
