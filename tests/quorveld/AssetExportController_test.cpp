// The export controller's folding of requests, with its operation queue held
// back so that every request meets the pending work of the ones before it.
// The recordings have no bundle (a finalization with nothing to do
// succeeds) and no audio (their waveform fails without an error).
#include "quorveld/AssetExportController.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "platform/MainQueue.h"

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

}  // namespace
}  // namespace quorvel
