// Keep-alive transactions and the root transaction they fold into (their
// log lines are pinned in ServiceLog_test).
#include <gtest/gtest.h>

#include <functional>
#include <latch>
#include <thread>
#include <vector>

#include "platform/MainQueue.h"
#include "platform/ProcessLifetime.h"
#include "quorveld/RCSXPCTransaction.h"
#include "quorveld/RCSXPCTransactionController.h"

namespace quorvel {
namespace {

bool rootHeld() {
  const bool held = RCSXPCTransactionController::sharedInstance().isInTransaction();
  EXPECT_EQ(platform::ProcessLifetime::instance().isInTransaction(), held);
  return held;
}

// One step of a timeline: what is done, how far the clock then moves before
// the main queue runs (negative: it does not run), and which of the first
// transaction, the second and the root are active after ("110": the first
// two).
struct Step {
  std::function<void()> act;
  int advanceMs;
  const char* active;
};

TEST(TransactionTest, TheRootIsHeldWhileAnyTransactionIsActiveAndEndsRunOnTheMainQueue) {
  ASSERT_FALSE(rootHeld());  // the process-wide lifetime stays on the real main queue
  platform::ManualClock clock;
  platform::MainQueue main(clock, "test main");
  platform::setMainQueueForTesting(&main);
  auto first = RCSXPCTransaction::initWithName("same");
  auto second = RCSXPCTransaction::initWithName("same");
  auto begin = [](auto& t) { return [&t] { t->beginTransaction(); }; };
  auto end = [](auto& t) { return [&t] { t->endTransaction(); }; };
  // Begins `first` and ends it `seconds` from now (after an end, with `thenEnd`).
  auto endIn = [&](double seconds, bool thenEnd = false) {
    return [&, seconds, thenEnd] {
      first->beginTransaction();
      first->endTransactionOnDate(platform::Date::dateWithTimeIntervalSinceNow(seconds));
      if (thenEnd) first->endTransaction();
    };
  };
  const Step timeline[] = {
      {begin(first), -1, "101"},
      {begin(second), -1, "111"},
      {end(first), -1, "011"},
      {begin(second), -1, "011"},
      {end(second), -1, "000"},
      {end(second), -1, "000"},
      {endIn(2.0), 1990, "101"},
      {[] {}, 10, "000"},
      {endIn(-1.0), -1, "101"},
      {[] {}, 0, "000"},
      // A scheduled end after an earlier end touches nothing.
      {endIn(-1.0, true), -1, "000"},
      {begin(second), 0, "011"},
      {end(second), -1, "000"},
  };
  for (const Step& step : timeline) {
    step.act();
    if (step.advanceMs >= 0) {
      clock.advance(std::chrono::milliseconds(step.advanceMs));
      main.runUntilIdle();
    }
    const std::string active = {char('0' + first->isActive()), char('0' + second->isActive()),
                                char('0' + rootHeld())};
    EXPECT_EQ(active, step.active) << "step " << &step - timeline;
  }
  RCSXPCTransaction::initWithName("never begun")->endTransaction();
  EXPECT_FALSE(rootHeld());

  // A scheduled end keeps a transaction nobody else owns alive until it runs.
  std::weak_ptr<RCSXPCTransaction> weak = first;
  endIn(-1.0)();
  first.reset();
  EXPECT_FALSE(weak.expired());
  EXPECT_TRUE(rootHeld());
  main.runUntilIdle();
  EXPECT_TRUE(weak.expired());
  EXPECT_FALSE(rootHeld());
  platform::setMainQueueForTesting(nullptr);
}

// The threads start together, so even their first transactions race.
TEST(TransactionTest, ConcurrentBeginsEndsAndDropsKeepTheRootConsistent) {
  constexpr int kThreads = 8;
  std::latch start(kThreads);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&start] {
      start.arrive_and_wait();
      for (int i = 0; i < 1000; ++i) {
        auto transaction = RCSXPCTransaction::initWithName("stress");
        transaction->beginTransaction();
        if (i % 3 == 0) transaction->endTransaction();
        if (i % 5 == 0) (void)RCSXPCTransaction::activeTransactions();
      }  // the rest end in their destructors
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_TRUE(RCSXPCTransaction::activeTransactions().empty());
  EXPECT_FALSE(rootHeld());
}

}  // namespace
}  // namespace quorvel
