// The main run loop and its timers, driven by a manual clock: no test waits
// for real time to pass.
#include "platform/MainQueue.h"

#include <gtest/gtest.h>

#include <future>
#include <string>
#include <thread>
#include <vector>

#include "platform/Clock.h"

namespace platform {
namespace {

using std::chrono::hours;
using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using std::chrono::seconds;

TEST(MainQueueTest, RunUntilIdleRunsReadyTasksInOrderIncludingNewOnes) {
  ManualClock clock;
  MainQueue queue(clock, "test.main");
  std::vector<int> order;
  queue.async([&] {
    order.push_back(1);
    queue.async([&] { order.push_back(3); });
  });
  queue.async([&] { order.push_back(2); });
  EXPECT_TRUE(order.empty()) << "async never runs inline";
  EXPECT_EQ(queue.runUntilIdle(), 3u);
  EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
  EXPECT_EQ(queue.runUntilIdle(), 0u);
}

TEST(MainQueueTest, TimersRunWhenTheClockReachesTheirDeadline) {
  ManualClock clock;
  MainQueue queue(clock);
  std::vector<std::string> fired;
  queue.after(seconds(2), [&] { fired.push_back("2s"); });
  queue.after(seconds(1), [&] { fired.push_back("1s"); });
  queue.after(seconds(1), [&] { fired.push_back("1s second"); });
  queue.after(nanoseconds(0), [&] { fired.push_back("now"); });
  queue.after(seconds(-5), [&] { fired.push_back("past"); });
  EXPECT_EQ(queue.runUntilIdle(), 2u);
  EXPECT_EQ(fired, (std::vector<std::string>{"now", "past"}));

  clock.advance(seconds(1) - nanoseconds(1));
  EXPECT_EQ(queue.runUntilIdle(), 0u);
  clock.advance(nanoseconds(1));
  EXPECT_EQ(queue.runUntilIdle(), 2u);
  EXPECT_EQ(fired, (std::vector<std::string>{"now", "past", "1s", "1s second"}));

  // A timer scheduled from a late timer counts from the clock's time then
  // (3 s), not from its parent's deadline.
  queue.after(milliseconds(500), [&] {
    fired.push_back("1.5s");
    queue.after(seconds(1), [&] { fired.push_back("4s"); });
  });
  clock.advance(seconds(2));
  EXPECT_EQ(queue.runUntilIdle(), 2u);
  EXPECT_EQ(fired.back(), "2s");
  EXPECT_EQ(fired[fired.size() - 2], "1.5s");
  EXPECT_EQ(queue.pendingCount(), 1u);
  clock.advance(milliseconds(999));
  EXPECT_EQ(queue.runUntilIdle(), 0u);
  clock.advance(milliseconds(1));
  EXPECT_EQ(queue.runUntilIdle(), 1u);
  EXPECT_EQ(fired.back(), "4s");
}

TEST(MainQueueTest, ManyTimersWithEqualDeadlinesKeepTheirOrder) {
  ManualClock clock;
  MainQueue queue(clock);
  std::vector<int> fired;
  for (int i = 0; i < 200; ++i) {
    // Alternating delays: the 5 s ones and the 3 s ones each keep their order.
    queue.after(i % 2 ? seconds(5) : seconds(3), [&fired, i] { fired.push_back(i); });
  }
  clock.advance(seconds(10));
  EXPECT_EQ(queue.runUntilIdle(), 200u);
  for (int i = 0; i < 100; ++i) {
    EXPECT_EQ(fired[i], 2 * i);
    EXPECT_EQ(fired[100 + i], 2 * i + 1);
  }
}

TEST(MainQueueTest, AHugeDelayNeverFiresAndDoesNotOverflow) {
  ManualClock clock;
  MainQueue queue(clock);
  bool fired = false;
  queue.after(Duration::max(), [&] { fired = true; });
  clock.advance(hours(24 * 365));
  EXPECT_EQ(queue.runUntilIdle(), 0u);
  EXPECT_FALSE(fired);
  EXPECT_EQ(queue.pendingCount(), 1u);
}

// The run loop on its own thread, woken by clock jumps.
class RunningMainQueueTest : public ::testing::Test {
 protected:
  void SetUp() override {
    loop_ = std::thread([this] { queue_.run(); });
  }
  void TearDown() override {
    queue_.stop();
    loop_.join();
  }

  ManualClock clock_;
  MainQueue queue_{clock_, "test.running"};
  std::thread loop_;
};

TEST_F(RunningMainQueueTest, AdvancingTheClockRunsDueTimersWithoutRealWaiting) {
  std::promise<std::thread::id> fired;
  queue_.after(hours(1), [&] { fired.set_value(std::this_thread::get_id()); });
  auto future = fired.get_future();
  // The timer must not run before its time, however the loop wakes; sync
  // from another thread runs on the loop thread as the queue.
  std::thread::id ranOn;
  bool current = false;
  queue_.sync([&] {
    ranOn = std::this_thread::get_id();
    current = queue_.isCurrent() && DispatchQueue::current() == &queue_;
  });
  EXPECT_EQ(ranOn, loop_.get_id());
  EXPECT_TRUE(current);
  EXPECT_FALSE(queue_.isCurrent());
  EXPECT_EQ(future.wait_for(milliseconds(0)), std::future_status::timeout);
  clock_.advance(hours(1));
  EXPECT_EQ(future.get(), loop_.get_id());
}

TEST_F(RunningMainQueueTest, TasksFromManyThreadsAllRunInPerThreadOrder) {
  constexpr int kThreads = 4;
  constexpr int kTasks = 5000;
  std::vector<int> next(kThreads, 0);  // touched only on the loop
  int outOfOrder = 0;
  std::vector<std::thread> producers;
  for (int t = 0; t < kThreads; ++t) {
    producers.emplace_back([&, t] {
      for (int i = 0; i < kTasks; ++i) {
        if (i % 50 == 0) {
          queue_.after(nanoseconds(0), [] {});
        }
        queue_.async([&, t, i] {
          if (next[t] != i) ++outOfOrder;
          next[t] = i + 1;
        });
      }
    });
  }
  for (auto& producer : producers) producer.join();
  int total = 0;
  queue_.sync([&] {
    for (int n : next) total += n;
  });
  EXPECT_EQ(total, kThreads * kTasks);
  EXPECT_EQ(outOfOrder, 0);
}

TEST(MainQueueRunTest, StopFromATaskEndsRunAndAnEarlyStopEndsTheNextRun) {
  ManualClock clock;
  MainQueue queue(clock);
  int ran = 0;
  queue.async([&] { ++ran; });
  queue.async([&] { queue.stop(); });
  queue.async([&] { ++ran; });
  queue.run();
  EXPECT_EQ(ran, 1);
  queue.stop();
  queue.run();  // returns at once
  EXPECT_EQ(ran, 1);
  EXPECT_EQ(queue.runUntilIdle(), 1u);
  EXPECT_EQ(ran, 2);
}

// Scheduling wakes a sleeping loop only for a new earliest deadline: a loop
// asleep until an hour from now must still run a timer due in a millisecond.
TEST(MainQueueRunTest, AnEarlierTimerWakesALoopSleepingUntilALaterOne) {
  MainQueue queue;  // system clock
  queue.after(std::chrono::hours(1), [] {});
  std::promise<void> sleeping;
  queue.async([&] { sleeping.set_value(); });
  std::thread loop([&] { queue.run(); });
  sleeping.get_future().wait();
  queue.after(std::chrono::hours(2), [] {});
  queue.after(milliseconds(1), [&] { queue.stop(); });
  loop.join();  // hangs if the earlier timer did not wake the loop
  EXPECT_EQ(queue.pendingCount(), 2u);
}

TEST(MainQueueRunTest, AQueueDestroyedBeforeItsClockIsForgotten) {
  ManualClock clock;
  {
    MainQueue queue(clock);
    queue.after(seconds(1), [] { ADD_FAILURE() << "a destroyed queue's timer ran"; });
  }
  clock.advance(seconds(2));
}

TEST(MainQueueDeathTest, SyncFromItsOwnTaskAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        ManualClock clock;
        MainQueue queue(clock, "test.self");
        queue.async([&] { queue.sync([] {}); });
        queue.runUntilIdle();
      },
      "'test.self' queue onto itself");
}

}  // namespace
}  // namespace platform
