// Serial queues, adoption, the global queue and the queue checks, on real
// threads.
#include "platform/SerialQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <barrier>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <latch>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/GlobalQueue.h"
#include "tests/support/Gate.h"

namespace platform {
namespace {

using testing::Latch;
using Log = std::vector<std::string>;

TEST(SerialQueueTest, CurrentQueueFollowsNestedSync) {
  SerialQueue outer("test.outer");
  SerialQueue inner("test.inner");
  // sync runs on the caller's thread; the inner queue is current inside,
  // the outer one still counts.
  std::thread::id ranOn;
  outer.sync([&] {
    ranOn = std::this_thread::get_id();
    EXPECT_TRUE(DispatchQueue::current() == &outer && !inner.isCurrent());
    inner.sync([&] { EXPECT_TRUE(outer.isCurrent() && DispatchQueue::current() == &inner); });
    EXPECT_EQ(DispatchQueue::current(), &outer);
  });
  EXPECT_EQ(ranOn, std::this_thread::get_id());
  EXPECT_EQ(DispatchQueue::current(), nullptr);
}

TEST(SerialQueueTest, AsyncRunsOffTheCallersThreadAndDestructionRunsWhatIsQueued) {
  std::atomic<int> ran{0};
  Latch release;
  std::thread::id ranOn;
  {
    SerialQueue queue("test.drain");
    queue.async([&] {
      release.wait();
      ranOn = std::this_thread::get_id();
    });
    for (int i = 0; i < 100; ++i) {
      queue.async([&] {
        if (++ran == 100) queue.async([&] { ++ran; });
      });
    }
    release.open();
  }
  EXPECT_EQ(ran.load(), 101);  // including what the tasks queued
  EXPECT_NE(ranOn, std::this_thread::get_id());
}

// Threads named `name` (a queue's worker takes its queue's label), so the
// sanitizers' own threads do not count.
std::size_t threadCount(const std::string& name = "test.lazy") {
  std::size_t count = 0;
  for (const auto& task : std::filesystem::directory_iterator("/proc/self/task")) {
    std::ifstream comm(task.path() / "comm");
    std::string line;
    if (std::getline(comm, line) && line == name) ++count;
  }
  return count;
}

// Opens its latch when the thread it belongs to ends.
struct OnThreadExit {
  std::shared_ptr<Latch> latch;
  ~OnThreadExit() {
    if (latch) latch->open();
  }
};
thread_local OnThreadExit tOnExit;

// A queue entered only synchronously costs no thread; a worker started for
// asynchronous work ends by itself once the queue has been idle a while.
TEST(SerialQueueTest, NeedsAThreadOnlyWhileAsyncWorkIsQueued) {
  SerialQueue queue("test.lazy");
  for (int i = 0; i < 100; ++i) queue.sync([] {});
  EXPECT_EQ(threadCount(), 0u);
  std::promise<std::size_t> during;
  auto ended = std::make_shared<Latch>();
  queue.async([&, ended] {
    tOnExit.latch = ended;
    during.set_value(threadCount());
  });
  EXPECT_EQ(during.get_future().get(), 1u);
  EXPECT_TRUE(ended->wait());
  // A new worker takes what comes later.
  std::promise<void> again;
  queue.async([&] { again.set_value(); });
  again.get_future().get();
}

// Producers queue work across queues, half of them async from inside
// adoption scopes (as an event loop does), the others async and sync, so
// adopted runs race the workers and the sync callers: each queue's tasks
// never overlap, and each producer's tasks on a queue run in the order it
// queued them. The plain counters are touched only on their queue, so TSan
// flags any overlap too.
TEST(SerialQueueStressTest, TasksOfAQueueNeverOverlapAndKeepEachProducersOrder) {
  constexpr int kQueues = 8;
  constexpr int kProducers = 4;
  constexpr int kTasksPerProducer = 25000;
  struct Checked {
    SerialQueue queue{"stress"};
    std::vector<int> next = std::vector<int>(kProducers, 0);  // expected from each producer
    int faults = 0;
    std::atomic<bool> inside{false};
  };
  std::vector<std::unique_ptr<Checked>> queues;
  for (int q = 0; q < kQueues; ++q) queues.push_back(std::make_unique<Checked>());
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
        Checked& c = *queues[(i * 7 + p) % kQueues];
        auto task = [&c, p, n = sequence[(i * 7 + p) % kQueues]++] {
          if (c.inside.exchange(true) || c.next[p] != n) ++c.faults;
          c.next[p] = n + 1;
          c.inside = false;
        };
        if (p % 2 == 0 && i % 3 == 0) {  // a sync from inside a scope could deadlock
          c.queue.sync(task);
        } else {
          c.queue.async(task);
        }
      }
    });
  }
  for (auto& producer : producers) producer.join();
  int total = 0;
  for (auto& c : queues) {
    c->queue.sync([&] {
      EXPECT_EQ(c->faults, 0);
      for (int n : c->next) total += n;
    });
  }
  EXPECT_EQ(total, kProducers * kTasksPerProducer);
}

// What runs where when the test's thread adopts a queue: each row queues
// work inside an AdoptionScope; the log names every task in the order it
// ran, with "@caller" when it ran on the adopting thread and "@worker"
// otherwise.
struct Adopted {
  SerialQueue& queue;
  Log log;  // touched only on the queue
  Latch started;
  Latch scopeEnded;
  std::thread::id caller = std::this_thread::get_id();

  Task task(std::string name, std::function<void()> body = nullptr) {
    return [this, name, body] {
      EXPECT_TRUE(queue.isCurrent()) << name;
      if (body) body();
      log.push_back(name + (std::this_thread::get_id() == caller ? "@caller" : "@worker"));
    };
  }
};

TEST(SerialQueueTest, AnAdoptingThreadRunsWhatItQueuedOnAnIdleQueueWhenTheScopeEnds) {
  const struct {
    const char* name;
    std::function<void(Adopted&)> inScope;
    Log ran;
  } rows[] = {
      {"idle queue; a sync from the adopting thread runs what it queued first",
       [](Adopted& a) {
         a.queue.async(a.task("a", [&] { a.queue.async(a.task("queued by a")); }));
         a.queue.async(a.task("b"));
         EXPECT_TRUE(a.log.empty());
         a.queue.sync(a.task("sync"));
         EXPECT_EQ(a.log.size(), 4u);
         a.queue.async(a.task("c"));
       },
       {"a@caller", "b@caller", "queued by a@caller", "sync@caller", "c@caller"}},
      {"a queue already at work keeps its worker",
       [](Adopted& a) {
         a.queue.asyncOnWorker(a.task("running", [&] {
           a.started.open();
           a.scopeEnded.wait();
         }));
         a.started.wait();
         a.queue.async(a.task("x"));
       },
       {"running@worker", "x@worker"}},
      {"what is left after the budget goes to the worker",
       [](Adopted& a) {
         a.queue.async(a.task("first", [] {
           // Busy, not asleep: the budget counts the time the task takes.
           const auto until = std::chrono::steady_clock::now() + 2 * SerialQueue::kAdoptedRunBudget;
           while (std::chrono::steady_clock::now() < until) {
           }
         }));
         a.queue.async(a.task("second"));
       },
       {"first@caller", "second@worker"}},
      // The worker-only task waits for the scope's end, which would deadlock
      // if the scope ran it.
      {"worker-only tasks leave the adopting thread free and keep their place",
       [](Adopted& a) {
         a.queue.async(a.task("short"));
         a.queue.asyncOnWorker(a.task("long", [&] { a.scopeEnded.wait(); }));
         a.queue.async(a.task("after"));
       },
       {"short@caller", "long@worker", "after@worker"}},
      // The other queue's task waits for the adopted one, and the sync waits
      // for that task: the adopted work must not wait for the scope's end.
      {"a sync that has to wait hands what the thread adopted to the worker",
       [](Adopted& a) {
         SerialQueue other("test.other");
         Latch adopted;
         other.asyncOnWorker([&] {
           adopted.wait();
           a.queue.sync(a.task("synced by other"));
         });
         a.queue.async(a.task("x"));
         adopted.open();
         other.sync([] {});
       },
       {"x@worker", "synced by other@worker"}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    SerialQueue queue("test.adopted");
    Adopted adopted{queue};
    {
      SerialQueue::AdoptionScope adoption;
      row.inScope(adopted);
    }
    adopted.scopeEnded.open();
    queue.sync([&] { EXPECT_EQ(adopted.log, row.ran); });
  }
}

TEST(GlobalQueueTest, RunsTasksConcurrentlyIsCurrentInThemAndSyncRunsInline) {
  // Two tasks that each wait for the other only finish when they run at
  // the same time.
  std::barrier meet(2);
  std::promise<bool> a;
  std::promise<bool> b;
  for (auto* done : {&a, &b}) {
    globalQueue().async([&meet, done] {
      meet.arrive_and_wait();
      done->set_value(globalQueue().isCurrent() && DispatchQueue::current() == &globalQueue());
    });
  }
  EXPECT_TRUE(a.get_future().get());
  EXPECT_TRUE(b.get_future().get());
  EXPECT_FALSE(globalQueue().isCurrent());
  bool ran = false;
  globalQueue().sync([&] {
    ran = globalQueue().isCurrent();
    globalQueue().sync([&] {});  // allowed: a concurrent queue cannot deadlock
  });
  EXPECT_TRUE(ran);
}

TEST(SerialQueueDeathTest, SyncOntoAQueueTheCallerRunsOnAndQueueChecksOffTheQueueAbort) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
#if defined(QUORVEL_DCHECK_IS_ON)
  SerialQueue checked("test.checked");
  SerialQueue other("test.other");
  checked.sync([&] { QV_DCHECK_ON_QUEUE(checked); });
  checked.sync([&] { other.sync([&] { QV_DCHECK_ON_QUEUE(checked); }); });
#endif
  const struct {
    std::function<void()> body;
    const char* message;
  } rows[] = {
    {[] {
       SerialQueue queue("test.self");
       queue.sync([&] { queue.sync([] {}); });
     },
     "sync called from the 'test.self' queue onto itself"},
    {[] {
       SerialQueue a("test.a");
       SerialQueue b("test.b");
       a.sync([&] { b.sync([&] { a.sync([] {}); }); });
     },
     "from the 'test.a' queue onto itself"},
    {[] {
       SerialQueue queue("test.worker");
       queue.async([&] { queue.sync([] {}); });
       queue.sync([] {});  // never returns: the process dies first
       Latch().wait();
     },
     "test.worker"},
#if defined(QUORVEL_DCHECK_IS_ON)
    {[&] { QV_DCHECK_ON_QUEUE(checked); }, "must be called on the test.checked queue"},
    {[&] { other.sync([&] { QV_DCHECK_ON_QUEUE(checked); }); },
     "must be called on the test.checked queue"},
#endif
  };
  for (const auto& row : rows) EXPECT_DEATH(row.body(), row.message);
}

}  // namespace
}  // namespace platform
