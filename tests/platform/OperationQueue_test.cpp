// Operations and the operation queue on real worker threads: dependencies,
// the concurrency limit, suspension, completion blocks; plus a randomized
// stress over dependency graphs.
#include "platform/OperationQueue.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <mutex>
#include <random>
#include <thread>
#include <vector>

#include "tests/support/Gate.h"

namespace platform {
namespace {

using testing::Counter;
using testing::Latch;
using Operations = std::vector<std::shared_ptr<Operation>>;

// An operation that counts its start, then blocks until `gate` opens.
std::shared_ptr<Operation> blocking(Counter& started, Latch& gate) {
  return std::make_shared<BlockOperation>([&] {
    started.increment();
    gate.wait();
  });
}

TEST(OperationTest, DependenciesInEveryPlacementFinishFirst) {
  OperationQueue queue;
  OperationQueue other;
  std::mutex mutex;
  std::vector<std::string> order;
  auto record = [&](std::string name) {
    return std::make_shared<BlockOperation>([&, name] {
      std::lock_guard lock(mutex);
      order.push_back(name);
    });
  };
  auto done = record("done");  // finished before the dependent exists
  queue.addOperation(done);
  queue.waitUntilAllOperationsAreFinished();
  auto later = record("later");          // same queue, queued after its dependent
  auto elsewhere = record("elsewhere");  // another queue
  auto dependent = record("dependent");
  for (const auto& dependency : {done, later, elsewhere}) dependent->addDependency(dependency);
  other.setSuspended(true);
  Counter laterDone;
  later->setCompletionBlock([&] { laterDone.increment(); });
  queue.addOperation(dependent);
  queue.addOperation(later);
  other.addOperation(elsewhere);
  laterDone.waitFor(1);  // the dependent still waits for "elsewhere"
  EXPECT_FALSE(dependent->isReady() || dependent->isExecuting() || dependent->isFinished());
  other.setSuspended(false);
  other.waitUntilAllOperationsAreFinished();
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(order, (std::vector<std::string>{"done", "later", "elsewhere", "dependent"}));
}

// At most the limit run, and the next starts when one ends; suspension then
// holds queued operations and lets running ones finish; destroying the
// queue waits for the one still running and drops those held.
TEST(OperationQueueTest, LimitSuspensionAndDestruction) {
  Counter started;
  Counter finished;
  Latch gates[3];
  Latch open;
  open.open();
  Operations operations;
  Operations held;
  std::thread opener;
  {
    OperationQueue queue;
    auto add = [&](Operations& into, Latch& gate) {
      into.push_back(blocking(started, gate));
      into.back()->setCompletionBlock([&] { finished.increment(); });
      queue.addOperation(into.back());
    };
    queue.setMaxConcurrentOperationCount(0);  // starts nothing until raised
    for (auto& gate : gates) add(operations, gate);
    EXPECT_FALSE(operations[0]->isExecuting());
    queue.setMaxConcurrentOperationCount(2);
    started.waitFor(2);
    EXPECT_TRUE(operations[0]->isExecuting() && operations[1]->isExecuting());
    EXPECT_FALSE(operations[2]->isExecuting());
    gates[1].open();
    started.waitFor(3);
    EXPECT_TRUE(operations[2]->isExecuting() && operations[1]->isFinished());

    queue.setSuspended(true);
    for (int i = 0; i < 3; ++i) add(held, open);
    gates[0].open();
    finished.waitFor(2);  // a running one went on while suspended
    EXPECT_EQ(started.value(), 3);
    for (const auto& operation : held) EXPECT_TRUE(operation->isReady());
    opener = std::thread([&] { gates[2].open(); });  // races the destruction
  }
  opener.join();
  EXPECT_EQ(finished.value(), 3);
  for (const auto& operation : held)
    EXPECT_FALSE(operation->isExecuting() || operation->isFinished());
}

TEST(OperationQueueDeathTest, AddingAnOperationTwiceAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        OperationQueue queue;
        queue.setSuspended(true);
        auto operation = std::make_shared<BlockOperation>([] {});
        queue.addOperation(operation);
        queue.addOperation(operation);
      },
      "only once");
}

// Random dependency graphs: no operation starts before its dependencies
// finished, the limit is never exceeded, main (executing) and then the
// completion block (finished) run once each, while another thread suspends
// and resumes the queue at random.
TEST(OperationQueueStressTest, RandomGraphsHonourDependenciesLimitAndCompletions) {
  constexpr int kOperations = 300;
  for (int limit : {1, 2, 3}) {
    for (unsigned seed = 1; seed <= 4; ++seed) {
      SCOPED_TRACE(::testing::Message() << "limit " << limit << " seed " << seed);
      std::mt19937 random(seed * 7919 + limit);
      OperationQueue queue;
      queue.setMaxConcurrentOperationCount(limit);
      std::atomic<int> running{0};
      std::atomic<int> maxRunning{0};
      std::atomic<int> faults{0};                       // early starts and wrong states
      std::vector<std::atomic<int>> runs(kOperations);  // mains and completions
      Operations operations(kOperations);
      for (int i = 0; i < kOperations; ++i) {
        operations[i] = std::make_shared<BlockOperation>([&, i] {
          const int now = ++running;
          int seen = maxRunning.load();
          while (now > seen && !maxRunning.compare_exchange_weak(seen, now)) {
          }
          for (const auto& dependency : operations[i]->dependencies()) {
            if (!dependency->isFinished()) ++faults;
          }
          if (!operations[i]->isExecuting() || operations[i]->isFinished()) ++faults;
          runs[i] += 1;
          std::this_thread::yield();
          --running;
        });
        operations[i]->setCompletionBlock([&, i] {
          runs[i] += 1000;
          if (!operations[i]->isFinished() || operations[i]->isExecuting()) ++faults;
        });
      }
      // Dependencies point at earlier-created operations (no cycles); some
      // are wired before queueing, some after (under suspension).
      std::vector<std::pair<int, int>> lateEdges;
      for (int i = 1; i < kOperations; ++i) {
        for (int k = std::uniform_int_distribution<int>(0, 3)(random); k > 0; --k) {
          const int dependency = std::uniform_int_distribution<int>(0, i - 1)(random);
          if (random() % 4 == 0) {
            lateEdges.emplace_back(i, dependency);
          } else {
            operations[i]->addDependency(operations[dependency]);
          }
        }
      }
      std::vector<int> addOrder(kOperations);
      for (int i = 0; i < kOperations; ++i) addOrder[i] = i;
      std::shuffle(addOrder.begin(), addOrder.end(), random);
      queue.setSuspended(true);
      for (int i : addOrder) {
        if (i % 3 == 0) queue.addOperation(operations[i]);
      }
      for (auto [from, to] : lateEdges) operations[from]->addDependency(operations[to]);
      std::atomic<bool> adding{true};
      std::thread toggler([&, seed] {
        std::mt19937 toggles(seed);
        while (adding) queue.setSuspended(toggles() % 2 == 0);
        queue.setSuspended(false);
      });
      for (int i : addOrder) {
        if (i % 3 != 0) queue.addOperation(operations[i]);
      }
      adding = false;
      toggler.join();
      queue.waitUntilAllOperationsAreFinished();
      EXPECT_EQ(faults.load(), 0);
      EXPECT_EQ(queue.operationCount(), 0u);
      EXPECT_LE(maxRunning.load(), limit);
      for (int i = 0; i < kOperations; ++i) {
        ASSERT_EQ(runs[i].load(), 1001) << "operation " << i;
        ASSERT_TRUE(operations[i]->isFinished());
      }
    }
  }
}

}  // namespace
}  // namespace platform
