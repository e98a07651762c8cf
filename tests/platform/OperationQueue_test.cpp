// Operations and the operation queue on real worker threads: dependencies,
// the concurrency limit, suspension, completion blocks; plus a randomized
// stress over dependency graphs.
#include "platform/OperationQueue.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <latch>
#include <mutex>
#include <random>
#include <thread>
#include <vector>

namespace platform {
namespace {

// A count that tests wait on instead of sleeping.
class Counter {
 public:
  void increment() {
    ++count_;
    count_.notify_all();
  }
  void waitFor(int atLeast) {
    for (int now = count_.load(); now < atLeast; now = count_.load()) count_.wait(now);
  }
  int value() const { return count_.load(); }

 private:
  std::atomic<int> count_{0};
};

// A gate that blocked operations wait at until the test opens it.
struct Gate : std::latch {
  Gate() : std::latch(1) {}
  void open() { count_down(); }
};

// Records its start, then blocks until its gate opens.
class BlockingOperation : public Operation {
 public:
  BlockingOperation(Counter& started, Gate& gate) : started_(started), gate_(gate) {}
  void main() override {
    started_.increment();
    gate_.wait();
  }

 private:
  Counter& started_;
  Gate& gate_;
};

// How often main and the completion block run is the stress test's business.
TEST(OperationTest, ExecutingDuringMainAndFinishedBeforeTheCompletionBlock) {
  OperationQueue queue;
  std::atomic<bool> executingInMain{false};
  std::atomic<bool> finishedInCompletion{false};
  std::shared_ptr<Operation> operation;
  operation = std::make_shared<BlockOperation>(
      [&] { executingInMain = operation->isExecuting() && !operation->isFinished(); });
  operation->setCompletionBlock(
      [&] { finishedInCompletion = operation->isFinished() && !operation->isExecuting(); });
  queue.addOperation(operation);
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_TRUE(executingInMain.load());
  EXPECT_TRUE(finishedInCompletion.load());
  EXPECT_EQ(queue.operationCount(), 0u);
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
  // Already finished before the dependent exists.
  auto done = record("done");
  queue.addOperation(done);
  queue.waitUntilAllOperationsAreFinished();

  auto later = record("later");          // same queue, queued after its dependent
  auto elsewhere = record("elsewhere");  // another queue
  auto dependent = record("dependent");
  dependent->addDependency(done);
  dependent->addDependency(later);
  dependent->addDependency(elsewhere);
  other.setSuspended(true);
  Counter laterDone;
  later->setCompletionBlock([&] { laterDone.increment(); });
  queue.addOperation(dependent);
  queue.addOperation(later);
  other.addOperation(elsewhere);
  laterDone.waitFor(1);  // the dependent still waits for "elsewhere"
  EXPECT_FALSE(dependent->isReady());
  EXPECT_FALSE(dependent->isExecuting());
  EXPECT_FALSE(dependent->isFinished());
  other.setSuspended(false);
  other.waitUntilAllOperationsAreFinished();
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(order, (std::vector<std::string>{"done", "later", "elsewhere", "dependent"}));
}

TEST(OperationQueueTest, AtMostTheLimitRunAndTheNextStartsWhenOneEnds) {
  OperationQueue queue;
  queue.setMaxConcurrentOperationCount(0);  // starts nothing until raised
  Counter started;
  Gate gates[3];
  std::vector<std::shared_ptr<Operation>> operations;
  for (auto& gate : gates) {
    operations.push_back(std::make_shared<BlockingOperation>(started, gate));
    queue.addOperation(operations.back());
  }
  EXPECT_FALSE(operations[0]->isExecuting());
  queue.setMaxConcurrentOperationCount(2);
  started.waitFor(2);
  EXPECT_TRUE(operations[0]->isExecuting());
  EXPECT_TRUE(operations[1]->isExecuting());
  EXPECT_FALSE(operations[2]->isExecuting());
  gates[1].open();
  started.waitFor(3);
  EXPECT_TRUE(operations[2]->isExecuting());
  EXPECT_TRUE(operations[1]->isFinished());
  gates[0].open();
  gates[2].open();
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(started.value(), 3);
}

TEST(OperationQueueTest, SuspensionHoldsQueuedOperationsAndLetsRunningOnesFinish) {
  OperationQueue queue;
  queue.setMaxConcurrentOperationCount(2);
  Counter started;
  Counter finished;
  Gate running[2];
  Gate open;
  open.open();
  for (auto& gate : running) {
    auto operation = std::make_shared<BlockingOperation>(started, gate);
    operation->setCompletionBlock([&] { finished.increment(); });
    queue.addOperation(operation);
  }
  started.waitFor(2);
  queue.setSuspended(true);
  std::vector<std::shared_ptr<Operation>> held;
  for (int i = 0; i < 3; ++i) {
    held.push_back(std::make_shared<BlockingOperation>(started, open));
    held.back()->setCompletionBlock([&] { finished.increment(); });
    queue.addOperation(held.back());
  }
  running[0].open();
  running[1].open();
  finished.waitFor(2);  // the running ones went on while suspended
  EXPECT_EQ(started.value(), 2);
  for (const auto& operation : held) {
    EXPECT_TRUE(operation->isReady());
    EXPECT_FALSE(operation->isExecuting());
  }
  queue.setSuspended(false);
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(started.value(), 5);
  EXPECT_EQ(finished.value(), 5);
}

TEST(OperationQueueTest, DestructionWaitsForRunningOperationsAndDropsQueuedOnes) {
  Counter started;
  Gate gate;
  std::atomic<int> completions{0};
  auto running = std::make_shared<BlockingOperation>(started, gate);
  running->setCompletionBlock([&] { ++completions; });
  auto queued =
      std::make_shared<BlockOperation>([] { ADD_FAILURE() << "a dropped operation ran"; });
  {
    OperationQueue queue;
    queue.setMaxConcurrentOperationCount(1);
    queue.addOperation(running);
    started.waitFor(1);
    queue.setSuspended(true);
    queue.addOperation(queued);
    std::thread opener([&] { gate.open(); });
    opener.join();
  }
  EXPECT_TRUE(running->isFinished());
  EXPECT_EQ(completions.load(), 1);
  EXPECT_FALSE(queued->isExecuting());
  EXPECT_FALSE(queued->isFinished());
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
// finished, the limit is never exceeded, every completion block runs once,
// while another thread suspends and resumes the queue at random.
TEST(OperationQueueStressTest, RandomGraphsHonourDependenciesLimitAndCompletions) {
  constexpr int kOperations = 300;
  for (int limit : {1, 2, 3}) {
    for (unsigned seed = 1; seed <= 4; ++seed) {
      SCOPED_TRACE(testing::Message() << "limit " << limit << " seed " << seed);
      std::mt19937 random(seed * 7919 + limit);
      OperationQueue queue;
      queue.setMaxConcurrentOperationCount(limit);
      std::atomic<int> running{0};
      std::atomic<int> maxRunning{0};
      std::atomic<int> earlyStarts{0};
      std::vector<std::atomic<int>> mains(kOperations);
      std::vector<std::atomic<int>> completions(kOperations);
      std::vector<std::shared_ptr<Operation>> operations(kOperations);
      for (int i = 0; i < kOperations; ++i) {
        operations[i] = std::make_shared<BlockOperation>([&, i] {
          const int now = ++running;
          int seen = maxRunning.load();
          while (now > seen && !maxRunning.compare_exchange_weak(seen, now)) {
          }
          for (const auto& dependency : operations[i]->dependencies()) {
            if (!dependency->isFinished()) ++earlyStarts;
          }
          ++mains[i];
          std::this_thread::yield();
          --running;
        });
        operations[i]->setCompletionBlock([&, i] { ++completions[i]; });
      }
      // Dependencies point at earlier-created operations (no cycles); some
      // are wired before queueing, some after (under suspension).
      std::vector<std::pair<int, int>> lateEdges;
      for (int i = 1; i < kOperations; ++i) {
        const int count = std::uniform_int_distribution<int>(0, 3)(random);
        for (int k = 0; k < count; ++k) {
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
      EXPECT_EQ(earlyStarts.load(), 0);
      EXPECT_LE(maxRunning.load(), limit);
      for (int i = 0; i < kOperations; ++i) {
        ASSERT_EQ(mains[i].load(), 1) << "operation " << i;
        ASSERT_EQ(completions[i].load(), 1) << "operation " << i;
        ASSERT_TRUE(operations[i]->isFinished());
      }
    }
  }
}

}  // namespace
}  // namespace platform
