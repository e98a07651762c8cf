#include "platform/SequenceChecker.h"

#include <gtest/gtest.h>

#include <future>
#include <thread>

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
