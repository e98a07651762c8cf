#include "platform/SequenceChecker.h"

#include <gtest/gtest.h>

#include <atomic>
#include <barrier>
#include <future>
#include <memory>
#include <thread>
#include <vector>

#include "platform/SerialQueue.h"

namespace platform {
namespace {

// Binding and rebinding, on real queues.
TEST(SequenceCheckerTest, BindsOnFirstUseAndRebindsAfterDetach) {
  SerialQueue first("test.first");
  SerialQueue second("test.second");
  SequenceChecker checker;
  EXPECT_EQ(checker.boundSequenceDescription(), "no sequence");

  first.sync([&] { EXPECT_TRUE(checker.calledOnValidSequence()); });
  EXPECT_EQ(checker.boundSequenceDescription(), "the test.first queue");
  first.sync([&] { EXPECT_TRUE(checker.calledOnValidSequence()); });
  second.sync([&] { EXPECT_FALSE(checker.calledOnValidSequence()); });
  EXPECT_FALSE(checker.calledOnValidSequence());  // no queue at all

  // A task of the bound queue that enters another queue is still on it, and
  // the entered queue's task counts as being on that queue too.
  first.sync([&] { second.sync([&] { EXPECT_TRUE(checker.calledOnValidSequence()); }); });
  SequenceChecker onSecond;
  first.sync([&] { second.sync([&] { EXPECT_TRUE(onSecond.calledOnValidSequence()); }); });
  EXPECT_EQ(onSecond.boundSequenceDescription(), "the test.second queue");
  second.sync([&] { EXPECT_TRUE(onSecond.calledOnValidSequence()); });

  checker.detachFromSequence();
  second.sync([&] { EXPECT_TRUE(checker.calledOnValidSequence()); });
  first.sync([&] { EXPECT_FALSE(checker.calledOnValidSequence()); });
}

TEST(SequenceCheckerTest, WithoutAQueueItBindsToTheThread) {
  SequenceChecker checker;
  EXPECT_TRUE(checker.calledOnValidSequence());
  bool elsewhere = true;
  std::thread([&] { elsewhere = checker.calledOnValidSequence(); }).join();
  EXPECT_FALSE(elsewhere);
  // A queue's task on the queue's own thread is elsewhere too; one entered
  // with sync() runs on the bound thread, which stays one sequence.
  SerialQueue queue("test.queue");
  std::promise<bool> onWorker;
  queue.async([&] { onWorker.set_value(checker.calledOnValidSequence()); });
  EXPECT_FALSE(onWorker.get_future().get());
  queue.sync([&] { EXPECT_TRUE(checker.calledOnValidSequence()); });
}

// Queues racing to the first checked use agree on one winner, every round.
TEST(SequenceCheckerTest, QueuesRacingToBindAgreeOnOneWinner) {
  constexpr int kQueues = 4;
  constexpr int kRounds = 200;
  std::vector<std::unique_ptr<SerialQueue>> queues;
  for (int i = 0; i < kQueues; ++i) {
    queues.push_back(std::make_unique<SerialQueue>("test.racer"));
  }
  for (int round = 0; round < kRounds; ++round) {
    SequenceChecker checker;
    std::barrier start(kQueues);
    std::atomic<int> winners = 0;
    for (auto& queue : queues) {
      queue->async([&] {
        start.arrive_and_wait();
        if (checker.calledOnValidSequence()) ++winners;
      });
    }
    for (auto& queue : queues) queue->sync([] {});  // the round's tasks are over
    ASSERT_EQ(winners.load(), 1) << "round " << round;
  }
}

#if defined(QUORVEL_DCHECK_IS_ON)
using SequenceCheckerDeathTest = ::testing::Test;

TEST_F(SequenceCheckerDeathTest, ACheckFromAnotherQueueAbortsNamingTheBoundQueue) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  SerialQueue owner("test.owner");
  SerialQueue intruder("test.intruder");
  SequenceChecker checker;
  owner.sync([&] { QV_DCHECK_CALLED_ON_VALID_SEQUENCE(checker); });
  EXPECT_DEATH(intruder.sync([&] { QV_DCHECK_CALLED_ON_VALID_SEQUENCE(checker); }),
               "must be called on the test.owner queue \\(running on the test.intruder queue\\)");
  EXPECT_DEATH(QV_DCHECK_CALLED_ON_VALID_SEQUENCE(checker),
               "must be called on the test.owner queue");
}
#endif

}  // namespace
}  // namespace platform
