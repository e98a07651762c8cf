// Serial queues, the global queue, the current-queue chain and the queue
// assertion, driven through real worker threads.
#include "platform/SerialQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <barrier>
#include <filesystem>
#include <future>
#include <latch>
#include <memory>
#include <optional>
#include <thread>
#include <vector>

#include "platform/GlobalQueue.h"

namespace platform {
namespace {

// Their order is the stress test's business below.
TEST(SerialQueueTest, RunsAsyncTasksOnOneThreadThatIsNotTheCaller) {
  SerialQueue queue("test.thread");
  std::vector<std::thread::id> threads;
  for (int i = 0; i < 100; ++i) queue.async([&] { threads.push_back(std::this_thread::get_id()); });
  queue.sync([] {});
  ASSERT_EQ(threads.size(), 100u);
  for (auto id : threads) EXPECT_EQ(id, threads.front());
  EXPECT_NE(threads.front(), std::this_thread::get_id());
}

TEST(SerialQueueTest, SyncWaitsBehindQueuedWorkAndKeepsFifoWithAsync) {
  SerialQueue queue("test.sync-order");
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  std::vector<std::string> log;
  queue.async([&, released] {
    released.wait();
    log.push_back("blocked task");
  });
  queue.async([&] { log.push_back("async 1"); });
  auto syncDone =
      std::async(std::launch::async, [&] { queue.sync([&] { log.push_back("sync"); }); });
  // The sync cannot finish while the first task holds the queue.
  EXPECT_EQ(syncDone.wait_for(std::chrono::milliseconds(0)), std::future_status::timeout);
  release.set_value();
  syncDone.get();
  queue.async([&] { log.push_back("async 2"); });
  queue.sync([] {});
  EXPECT_EQ(log, (std::vector<std::string>{"blocked task", "async 1", "sync", "async 2"}));
}

TEST(SerialQueueTest, CurrentQueueFollowsNestedSync) {
  SerialQueue outer("test.outer");
  SerialQueue inner("test.inner");
  // From the caller's thread (sync runs there) and from the outer queue's own
  // worker: the inner queue is current inside, the outer one still counts.
  auto nested = [&] {
    bool ok = DispatchQueue::current() == &outer && !inner.isCurrent();
    inner.sync([&] { ok = ok && outer.isCurrent() && DispatchQueue::current() == &inner; });
    return ok && DispatchQueue::current() == &outer;
  };
  std::thread::id ranOn;
  bool fromCaller = false;
  outer.sync([&] {
    ranOn = std::this_thread::get_id();
    fromCaller = nested();
  });
  EXPECT_EQ(ranOn, std::this_thread::get_id());
  EXPECT_TRUE(fromCaller);
  EXPECT_FALSE(outer.isCurrent());
  EXPECT_EQ(DispatchQueue::current(), nullptr);
  std::promise<bool> fromWorker;
  outer.async([&] { fromWorker.set_value(nested()); });
  EXPECT_TRUE(fromWorker.get_future().get());
}

TEST(SerialQueueTest, DestructionRunsWhatIsQueuedIncludingWhatTasksQueue) {
  std::atomic<int> ran{0};
  {
    SerialQueue queue("test.drain");
    std::promise<void> release;
    std::shared_future<void> released = release.get_future().share();
    queue.async([released] { released.wait(); });
    for (int i = 0; i < 100; ++i) {
      queue.async([&] {
        ++ran;
        if (ran == 100) queue.async([&] { ++ran; });
      });
    }
    release.set_value();
  }
  EXPECT_EQ(ran.load(), 101);
}

std::size_t threadCount() {
  return std::distance(std::filesystem::directory_iterator("/proc/self/task"),
                       std::filesystem::directory_iterator());
}

// A queue entered only synchronously costs no thread; a worker started for
// asynchronous work ends once the queue has been idle a while.
TEST(SerialQueueTest, NeedsAThreadOnlyWhileAsyncWorkIsQueued) {
  const std::size_t before = threadCount();
  SerialQueue queue("test.lazy");
  for (int i = 0; i < 100; ++i) queue.sync([] {});
  EXPECT_LE(threadCount(), before);
  std::promise<std::size_t> during;
  queue.async([&] { during.set_value(threadCount()); });
  EXPECT_GE(during.get_future().get(), before + 1);
  const auto until = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (threadCount() > before && std::chrono::steady_clock::now() < until)
    std::this_thread::sleep_for(std::chrono::milliseconds(5));  // the worker's end has no event
  EXPECT_LE(threadCount(), before);
  // A new worker takes what comes later.
  std::promise<void> again;
  queue.async([&] { again.set_value(); });
  again.get_future().get();
}

TEST(SerialQueueTest, TasksNeverOverlapUnderConcurrentAsyncAndSync) {
  SerialQueue queue("test.exclusive");
  int unguarded = 0;  // only touched on the queue; TSan flags any overlap
  std::atomic<bool> inside{false};
  std::atomic<int> overlaps{0};
  auto body = [&] {
    if (inside.exchange(true)) ++overlaps;
    ++unguarded;
    inside = false;
  };
  constexpr int kThreads = 4;
  constexpr int kPerThread = 2000;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    // Odd threads queue from inside adoption scopes, as an event loop does,
    // so adopted runs race the worker and the other threads' sync calls.
    threads.emplace_back([&, t] {
      for (int i = 0; i < kPerThread; ++i) {
        std::optional<SerialQueue::AdoptionScope> adoption;
        if (t % 2 == 1) adoption.emplace();
        if ((i + t) % 3 == 0) {
          queue.sync(body);
        } else {
          queue.async(body);
        }
      }
    });
  }
  for (auto& thread : threads) thread.join();
  int total = 0;
  queue.sync([&] { total = unguarded; });
  EXPECT_EQ(total, kThreads * kPerThread);
  EXPECT_EQ(overlaps.load(), 0);
}

// 100,000 tasks from several producers across several queues: each
// producer's tasks for a queue run in the order it queued them.
TEST(SerialQueueStressTest, HundredThousandTasksAcrossQueuesRunInOrder) {
  constexpr int kQueues = 8;
  constexpr int kProducers = 4;
  constexpr int kTasksPerProducer = 25000;
  std::vector<std::unique_ptr<SerialQueue>> queues;
  for (int q = 0; q < kQueues; ++q) queues.push_back(std::make_unique<SerialQueue>("stress"));
  // next[q][p]: the sequence number queue q expects next from producer p;
  // only touched on queue q.
  std::vector<std::vector<int>> next(kQueues, std::vector<int>(kProducers, 0));
  std::vector<int> outOfOrder(kQueues, 0);
  std::latch start(kProducers);
  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p) {
    producers.emplace_back([&, p] {
      start.arrive_and_wait();
      std::vector<int> sequence(kQueues, 0);
      std::optional<SerialQueue::AdoptionScope> adoption;
      for (int i = 0; i < kTasksPerProducer; ++i) {
        if (p % 2 == 1 && i % 4 == 0) {
          adoption.reset();
          adoption.emplace();
        }
        const int q = (i * 7 + p) % kQueues;
        const int n = sequence[q]++;
        queues[q]->async([&, q, p, n] {
          if (next[q][p] != n) ++outOfOrder[q];
          next[q][p] = n + 1;
        });
      }
    });
  }
  for (auto& producer : producers) producer.join();
  int total = 0;
  for (int q = 0; q < kQueues; ++q) {
    queues[q]->sync([&] {
      EXPECT_EQ(outOfOrder[q], 0) << "queue " << q;
      for (int p = 0; p < kProducers; ++p) total += next[q][p];
    });
  }
  EXPECT_EQ(total, kProducers * kTasksPerProducer);
}

TEST(SerialQueueTest, AnAdoptingThreadRunsWhatItQueuedOnAnIdleQueueWhenTheScopeEnds) {
  SerialQueue idle("test.idle");
  SerialQueue busy("test.busy");
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  busy.async([released] { released.wait(); });
  std::vector<std::string> log;
  std::vector<std::thread::id> ranOn;
  std::promise<std::thread::id> busyRanOn;
  {
    SerialQueue::AdoptionScope adoption;
    idle.async([&] {
      log.push_back("a");
      ranOn.push_back(std::this_thread::get_id());
      EXPECT_TRUE(idle.isCurrent());
      idle.async([&] { log.push_back("queued by a"); });
    });
    idle.async([&] { log.push_back("b"); });
    // A queue already at work keeps its worker.
    busy.async([&] { busyRanOn.set_value(std::this_thread::get_id()); });
    EXPECT_TRUE(log.empty());
    // A sync from the adopting thread runs what it queued first.
    idle.sync([&] { log.push_back("sync"); });
    idle.async([&] {
      log.push_back("c");
      ranOn.push_back(std::this_thread::get_id());
    });
    EXPECT_EQ(log.size(), 4u);
  }
  EXPECT_EQ(log, (std::vector<std::string>{"a", "b", "queued by a", "sync", "c"}));
  EXPECT_EQ(ranOn, (std::vector<std::thread::id>(2, std::this_thread::get_id())));
  release.set_value();
  EXPECT_NE(busyRanOn.get_future().get(), std::this_thread::get_id());
}

TEST(SerialQueueTest, AnAdoptedRunHandsWhatIsLeftToTheWorkerAfterItsBudget) {
  SerialQueue queue("test.budget");
  std::promise<std::thread::id> secondRanOn;
  std::thread::id firstRanOn;
  {
    SerialQueue::AdoptionScope adoption;
    queue.async([&] {
      firstRanOn = std::this_thread::get_id();
      // Busy, not asleep: the budget counts the time the task takes.
      const auto until = std::chrono::steady_clock::now() + 2 * SerialQueue::kAdoptedRunBudget;
      while (std::chrono::steady_clock::now() < until) {
      }
    });
    queue.async([&] { secondRanOn.set_value(std::this_thread::get_id()); });
  }
  EXPECT_EQ(firstRanOn, std::this_thread::get_id());
  EXPECT_NE(secondRanOn.get_future().get(), std::this_thread::get_id());
}

// Long work queued with asyncOnWorker() must not hold up the adopting loop:
// the scope ends while that task still waits for the loop's thread, which
// would deadlock if the scope ran it. Order across the hand-over holds.
TEST(SerialQueueTest, WorkerOnlyTasksLeaveTheAdoptingThreadFreeAndKeepTheirPlace) {
  SerialQueue queue("test.worker-only");
  std::promise<void> scopeEnded;
  std::shared_future<void> ended = scopeEnded.get_future().share();
  std::vector<std::string> log;  // touched only on the queue
  std::thread::id firstRanOn;
  std::promise<std::thread::id> longRanOn;
  {
    SerialQueue::AdoptionScope adoption;
    queue.async([&] {
      log.push_back("short");
      firstRanOn = std::this_thread::get_id();
    });
    queue.asyncOnWorker([&] {
      ended.wait();
      log.push_back("long");
      longRanOn.set_value(std::this_thread::get_id());
    });
    queue.async([&] { log.push_back("after"); });
  }
  scopeEnded.set_value();
  EXPECT_EQ(firstRanOn, std::this_thread::get_id());
  EXPECT_NE(longRanOn.get_future().get(), std::this_thread::get_id());
  queue.sync([&] { EXPECT_EQ(log, (std::vector<std::string>{"short", "long", "after"})); });
}

TEST(GlobalQueueTest, RunsTasksConcurrentlyOnAtLeastTwoThreads) {
  // Two tasks that each wait for the other can only finish when they run at
  // the same time.
  std::barrier meet(2);
  std::promise<std::thread::id> a;
  std::promise<std::thread::id> b;
  globalQueue().async([&] {
    meet.arrive_and_wait();
    a.set_value(std::this_thread::get_id());
  });
  globalQueue().async([&] {
    meet.arrive_and_wait();
    b.set_value(std::this_thread::get_id());
  });
  EXPECT_NE(a.get_future().get(), b.get_future().get());
}

TEST(GlobalQueueTest, IsCurrentInsideItsTasksAndSyncRunsInline) {
  std::promise<bool> inside;
  globalQueue().async([&] {
    inside.set_value(globalQueue().isCurrent() && DispatchQueue::current() == &globalQueue());
  });
  EXPECT_TRUE(inside.get_future().get());
  EXPECT_FALSE(globalQueue().isCurrent());
  bool ran = false;
  globalQueue().sync([&] {
    ran = globalQueue().isCurrent();
    globalQueue().sync([&] {});  // allowed: a concurrent queue cannot deadlock
  });
  EXPECT_TRUE(ran);
}

class SerialQueueDeathTest : public ::testing::Test {
 protected:
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(SerialQueueDeathTest, SyncOntoTheQueueItselfAborts) {
  EXPECT_DEATH(
      {
        SerialQueue queue("test.self");
        queue.sync([&] { queue.sync([] {}); });
      },
      "sync called from the 'test.self' queue onto itself");
}

TEST_F(SerialQueueDeathTest, SyncBackOntoAnOuterQueueAborts) {
  EXPECT_DEATH(
      {
        SerialQueue a("test.a");
        SerialQueue b("test.b");
        a.sync([&] { b.sync([&] { a.sync([] {}); }); });
      },
      "from the 'test.a' queue onto itself");
}

TEST_F(SerialQueueDeathTest, SyncFromTheWorkerThreadAborts) {
  EXPECT_DEATH(
      {
        SerialQueue queue("test.worker");
        queue.async([&] { queue.sync([] {}); });
        queue.sync([] {});  // never returns: the process dies first
        std::promise<void>().get_future().wait();
      },
      "test.worker");
}

#if defined(QUORVEL_DCHECK_IS_ON)
TEST_F(SerialQueueDeathTest, QueueCheckAbortsOffTheQueueAndPassesOnIt) {
  SerialQueue queue("test.checked");
  queue.sync([&] { QV_DCHECK_ON_QUEUE(queue); });
  SerialQueue other("test.other");
  queue.sync([&] { other.sync([&] { QV_DCHECK_ON_QUEUE(queue); }); });
  EXPECT_DEATH(QV_DCHECK_ON_QUEUE(queue), "must be called on the test.checked queue");
  EXPECT_DEATH(other.sync([&] { QV_DCHECK_ON_QUEUE(queue); }),
               "must be called on the test.checked queue");
}
#endif

}  // namespace
}  // namespace platform
