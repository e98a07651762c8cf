// Root transaction bookkeeping and idle exit, on a main queue driven by a
// manual clock.
#include "platform/ProcessLifetime.h"

#include <gtest/gtest.h>

#include "platform/Clock.h"
#include "platform/MainQueue.h"

namespace platform {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

class ProcessLifetimeTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lifetime_.setIdleHandler([this] {
      EXPECT_TRUE(queue_.isCurrent());
      ++idleExits_;
    });
  }
  // Moves time on and runs whatever became due.
  void advance(Duration by) {
    clock_.advance(by);
    queue_.runUntilIdle();
  }

  ManualClock clock_;
  MainQueue queue_{clock_};
  ProcessLifetime lifetime_{queue_};
  int idleExits_ = 0;
};

TEST_F(ProcessLifetimeTest, NeverExitsBeforeEnablingOrWithAZeroPeriod) {
  lifetime_.beginTransaction();
  lifetime_.endTransaction();
  advance(seconds(3600));
  EXPECT_EQ(idleExits_, 0);
  lifetime_.setIdleExitAfter(Duration::zero());
  lifetime_.enableTransactions();
  lifetime_.beginTransaction();
  lifetime_.endTransaction();
  advance(seconds(86400));
  EXPECT_EQ(idleExits_, 0);
  EXPECT_EQ(queue_.pendingCount(), 0u);
}

TEST_F(ProcessLifetimeTest, IdleForTheDefaultThirtySecondsAfterEnablingRunsTheHandlerOnce) {
  lifetime_.enableTransactions();
  advance(seconds(30) - milliseconds(1));
  EXPECT_EQ(idleExits_, 0);
  advance(milliseconds(1));
  EXPECT_EQ(idleExits_, 1);
  advance(seconds(300));
  EXPECT_EQ(idleExits_, 1);
}

TEST_F(ProcessLifetimeTest, TheIdlePeriodCountsFromTheLastEnd) {
  lifetime_.setIdleExitAfter(seconds(10));
  lifetime_.enableTransactions();
  lifetime_.beginTransaction();
  EXPECT_TRUE(lifetime_.isInTransaction());
  advance(seconds(100));  // held: never idle
  EXPECT_EQ(idleExits_, 0);
  lifetime_.endTransaction();
  EXPECT_FALSE(lifetime_.isInTransaction());
  advance(seconds(9));
  lifetime_.beginTransaction();  // just before the deadline: cancels it
  advance(seconds(5));
  EXPECT_EQ(idleExits_, 0);
  lifetime_.endTransaction();
  advance(seconds(9));
  EXPECT_EQ(idleExits_, 0);
  advance(seconds(1));
  EXPECT_EQ(idleExits_, 1);
}

TEST_F(ProcessLifetimeTest, ABeginAndEndInsideThePeriodRestartsIt) {
  lifetime_.setIdleExitAfter(seconds(10));
  lifetime_.enableTransactions();
  advance(seconds(6));
  lifetime_.beginTransaction();
  lifetime_.endTransaction();  // the earlier timer (due at 10 s) is stale now
  advance(seconds(6));
  EXPECT_EQ(idleExits_, 0);
  advance(seconds(4));
  EXPECT_EQ(idleExits_, 1);
}

TEST_F(ProcessLifetimeTest, ChangingThePeriodWhileIdleRestartsTheCountdown) {
  lifetime_.enableTransactions();
  advance(seconds(20));
  lifetime_.setIdleExitAfter(seconds(5));
  advance(seconds(4));
  EXPECT_EQ(idleExits_, 0);
  advance(seconds(1));
  EXPECT_EQ(idleExits_, 1);
}

TEST_F(ProcessLifetimeTest, AHandlerMayBeginAgain) {
  lifetime_.setIdleExitAfter(seconds(1));
  lifetime_.setIdleHandler([this] {
    ++idleExits_;
    lifetime_.beginTransaction();
  });
  lifetime_.enableTransactions();
  advance(seconds(1));
  EXPECT_EQ(idleExits_, 1);
  EXPECT_TRUE(lifetime_.isInTransaction());
}

TEST_F(ProcessLifetimeTest, WaitersForNoTransactionRunOnceWhenTheRootEnds) {
  int ran = 0;
  lifetime_.whenNoTransaction([&] { ++ran; });  // none held: at once
  EXPECT_EQ(ran, 1);
  lifetime_.beginTransaction();
  lifetime_.whenNoTransaction([&] {
    EXPECT_FALSE(lifetime_.isInTransaction());
    ++ran;
  });
  EXPECT_EQ(ran, 1);
  lifetime_.endTransaction();
  EXPECT_EQ(ran, 2);
  lifetime_.beginTransaction();
  lifetime_.endTransaction();
  EXPECT_EQ(ran, 2);
}

}  // namespace
}  // namespace platform
