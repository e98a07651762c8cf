// The signal source against real SIGUSR1 deliveries to this process.
//
// SIGUSR1 is blocked by a static initializer, before main() and before any
// thread exists, so every thread of the test process inherits the mask, as
// in quorveld where main() blocks it first. Without the mask (or the source's
// forwarding handler) the first kill() below would end the test process.
#include "platform/SignalSource.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <thread>

#include "platform/GlobalQueue.h"
#include "platform/SerialQueue.h"
#include "tests/support/Gate.h"

namespace platform {
namespace {

using testing::Latch;

const bool kSignalBlocked = (SignalSource::blockInThisThread(SIGUSR1), true);

void raiseAtProcess() { ASSERT_EQ(::kill(::getpid(), SIGUSR1), 0); }

// A new source after a destroyed one works too.
TEST(SignalSourceTest, EachSourceRunsItsHandlerOnTheGlobalQueueAndTheProcessGoesOn) {
  ASSERT_TRUE(kSignalBlocked);
  for (int round = 0; round < 3; ++round) {
    std::promise<bool> ran;
    SignalSource source(SIGUSR1, [&] { ran.set_value(globalQueue().isCurrent()); });
    raiseAtProcess();
    EXPECT_TRUE(ran.get_future().get());
    EXPECT_EQ(source.receivedCount(), 1u);
  }
}

// The queue is held while signals arrive, so the handler's runs wait.
TEST(SignalSourceTest, DeliveriesBeforeTheHandlerRunsMergeAndCancelSkipsAQueuedRun) {
  SerialQueue queue("test.signal");
  std::atomic<int> runs{0};
  SignalSource source(
      SIGUSR1, [&] { ++runs; }, queue);
  Latch release[2];
  queue.async([&] { release[0].wait(); });
  for (std::uint64_t i = 1; i <= 3; ++i) {
    raiseAtProcess();
    source.waitUntilReceived(i);
  }
  release[0].open();
  queue.sync([] {});
  EXPECT_EQ(runs.load(), 1);
  raiseAtProcess();  // a later delivery runs the handler again
  source.waitUntilReceived(4);
  queue.sync([] {});
  EXPECT_EQ(runs.load(), 2);

  queue.async([&] { release[1].wait(); });
  raiseAtProcess();
  source.waitUntilReceived(5);
  source.cancel();
  release[1].open();
  queue.sync([] {});
  EXPECT_EQ(runs.load(), 2);
  // Nobody reads the signal any more: it stays pending, blocked, harmless.
  raiseAtProcess();
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGUSR1);
  timespec zero{0, 0};
  EXPECT_EQ(::sigtimedwait(&set, nullptr, &zero), SIGUSR1);
  EXPECT_EQ(source.receivedCount(), 5u);
  source.cancel();  // twice is fine
}

TEST(SignalSourceTest, ADeliveryDuringTheHandlerRunsItOnceMoreNeverConcurrently) {
  Latch firstEntered;
  Latch letFirstFinish;
  Latch secondDone;
  std::atomic<int> runs{0};
  std::atomic<int> inside{0};
  std::atomic<int> overlaps{0};
  SignalSource source(SIGUSR1, [&] {
    if (++inside > 1) ++overlaps;
    const int run = ++runs;
    if (run == 1) {
      firstEntered.open();
      letFirstFinish.wait();
    }
    --inside;
    if (run == 2) secondDone.open();
  });
  raiseAtProcess();
  firstEntered.wait();
  for (std::uint64_t i = 2; i <= 3; ++i) {
    raiseAtProcess();
    source.waitUntilReceived(i);
  }
  letFirstFinish.open();
  secondDone.wait();
  EXPECT_EQ(runs.load(), 2);
  EXPECT_EQ(overlaps.load(), 0);
}

TEST(SignalSourceTest, ADeliveryToAThreadThatDoesNotBlockTheSignalIsForwarded) {
  Latch ran;
  SignalSource source(SIGUSR1, [&] { ran.open(); });
  std::thread([] {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGUSR1);
    pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
    pthread_kill(pthread_self(), SIGUSR1);  // handled in this thread, at once
  }).join();
  EXPECT_TRUE(ran.wait());
  EXPECT_EQ(source.receivedCount(), 1u);
}

}  // namespace
}  // namespace platform
