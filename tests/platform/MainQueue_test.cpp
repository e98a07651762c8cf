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

using namespace std::chrono_literals;
using Log = std::vector<std::string>;

TEST(MainQueueTest, TimersRunWhenTheClockReachesTheirDeadlineInTheOrderScheduled) {
  ManualClock clock;
  MainQueue queue(clock);
  Log fired;
  auto timer = [&](Duration delay, std::string name) {
    queue.after(delay, [&fired, name] { fired.push_back(name); });
  };
  timer(2s, "2s");
  timer(1s, "1s");
  timer(1s, "1s second");
  timer(0ns, "now");
  timer(-5s, "past");
  EXPECT_EQ(queue.runUntilIdle(), 2u);
  EXPECT_EQ(fired, (Log{"now", "past"}));
  clock.advance(1s - 1ns);
  EXPECT_EQ(queue.runUntilIdle(), 0u);
  clock.advance(1ns);
  EXPECT_EQ(queue.runUntilIdle(), 2u);
  EXPECT_EQ(fired, (Log{"now", "past", "1s", "1s second"}));

  // A timer scheduled from a late timer counts from the clock's time then
  // (3 s), not from its parent's deadline.
  queue.after(500ms, [&] {
    fired.push_back("1.5s");
    timer(1s, "4s");
  });
  clock.advance(2s);
  EXPECT_EQ(queue.runUntilIdle(), 2u);
  EXPECT_EQ(fired, (Log{"now", "past", "1s", "1s second", "1.5s", "2s"}));
  clock.advance(999ms);
  EXPECT_EQ(queue.runUntilIdle(), 0u);
  clock.advance(1ms);
  EXPECT_EQ(queue.runUntilIdle(), 1u);
  EXPECT_EQ(fired.back(), "4s");

  // Many equal deadlines, interleaved: the 5 s ones and the 3 s ones each
  // keep their order.
  fired.clear();
  for (int i = 0; i < 200; ++i) timer(i % 2 ? 5s : 3s, std::to_string(i));
  clock.advance(24h * 365);
  EXPECT_EQ(queue.runUntilIdle(), 200u);
  for (int i = 0; i < 100; ++i) {
    EXPECT_EQ(fired[i], std::to_string(2 * i));
    EXPECT_EQ(fired[100 + i], std::to_string(2 * i + 1));
  }
  timer(Duration::max(), "never");  // must not overflow into the past
  clock.advance(24h * 365);
  EXPECT_EQ(queue.runUntilIdle(), 0u);
  EXPECT_EQ(queue.pendingCount(), 1u);

  // A queue destroyed before its clock is forgotten by it.
  {
    MainQueue gone(clock);
    gone.after(1s, [] { ADD_FAILURE() << "a destroyed queue's timer ran"; });
  }
  clock.advance(2s);
}

// The loop on its own thread, woken by clock jumps and by tasks from
// several threads, which run in each thread's order.
TEST(MainQueueTest, ARunningLoopRunsSyncTasksTimersAndEachThreadsTasksInOrder) {
  ManualClock clock;
  MainQueue queue(clock, "test.running");
  std::thread loop([&] { queue.run(); });
  std::promise<std::thread::id> fired;
  queue.after(1h, [&] { fired.set_value(std::this_thread::get_id()); });
  auto timer = fired.get_future();
  // A sync from another thread runs on the loop thread as the queue; the
  // timer does not run before its time, however the loop wakes.
  std::thread::id ranOn;
  bool current = false;
  queue.sync([&] {
    ranOn = std::this_thread::get_id();
    current = queue.isCurrent() && DispatchQueue::current() == &queue;
  });
  EXPECT_EQ(ranOn, loop.get_id());
  EXPECT_TRUE(current);
  EXPECT_FALSE(queue.isCurrent());
  EXPECT_EQ(timer.wait_for(0ms), std::future_status::timeout);
  clock.advance(1h);
  EXPECT_EQ(timer.get(), loop.get_id());

  constexpr int kThreads = 4;
  constexpr int kTasks = 5000;
  std::vector<int> next(kThreads, 0);  // touched only on the loop
  int outOfOrder = 0;
  std::vector<std::thread> producers;
  for (int t = 0; t < kThreads; ++t) {
    producers.emplace_back([&, t] {
      for (int i = 0; i < kTasks; ++i) {
        if (i % 50 == 0) queue.after(0ns, [] {});
        queue.async([&, t, i] {
          if (next[t] != i) ++outOfOrder;
          next[t] = i + 1;
        });
      }
    });
  }
  for (auto& producer : producers) producer.join();
  int total = 0;
  queue.sync([&] {
    for (int n : next) total += n;
  });
  EXPECT_EQ(total, kThreads * kTasks);
  EXPECT_EQ(outOfOrder, 0);
  queue.stop();
  loop.join();
}

TEST(MainQueueTest, TasksRunInOrderIncludingNewOnesAndStopEndsRun) {
  ManualClock clock;
  MainQueue queue(clock);
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

  // A stop from a task ends run(); one that comes before run() ends the next
  // run() at once.
  queue.async([&] { order.push_back(4); });
  queue.async([&] { queue.stop(); });
  queue.async([&] { order.push_back(5); });
  queue.run();
  EXPECT_EQ(order.back(), 4);
  queue.stop();
  queue.run();
  EXPECT_EQ(order.back(), 4);
  EXPECT_EQ(queue.runUntilIdle(), 1u);
  EXPECT_EQ(order.back(), 5);
}

// Scheduling wakes a sleeping loop only for a new earliest deadline: a loop
// asleep until an hour from now must still run a timer due in a millisecond.
TEST(MainQueueTest, AnEarlierTimerWakesALoopSleepingUntilALaterOne) {
  MainQueue queue;  // system clock
  queue.after(1h, [] {});
  std::promise<void> sleeping;
  queue.async([&] { sleeping.set_value(); });
  std::thread loop([&] { queue.run(); });
  sleeping.get_future().wait();
  queue.after(2h, [] {});
  queue.after(1ms, [&] { queue.stop(); });
  loop.join();  // hangs if the earlier timer did not wake the loop
  EXPECT_EQ(queue.pendingCount(), 2u);
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
