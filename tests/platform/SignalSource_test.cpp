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

namespace platform {
namespace {

const bool kSignalBlocked = (SignalSource::blockInThisThread(SIGUSR1), true);

void raiseAtProcess() { ASSERT_EQ(::kill(::getpid(), SIGUSR1), 0); }

// Consumes a SIGUSR1 pending on the process; true when there was one.
bool consumePendingSignal() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGUSR1);
  timespec zero{0, 0};
  return ::sigtimedwait(&set, nullptr, &zero) == SIGUSR1;
}

TEST(SignalSourceTest, ADeliveryRunsTheHandlerOnTheGlobalQueueAndTheProcessGoesOn) {
  ASSERT_TRUE(kSignalBlocked);
  std::promise<bool> ran;
  SignalSource source(SIGUSR1, [&] { ran.set_value(globalQueue().isCurrent()); });
  raiseAtProcess();
  EXPECT_TRUE(ran.get_future().get());
  EXPECT_EQ(source.receivedCount(), 1u);
}

TEST(SignalSourceTest, DeliveriesBeforeTheHandlerRunsMergeIntoOneRun) {
  SerialQueue queue("test.signal");
  std::atomic<int> runs{0};
  SignalSource source(
      SIGUSR1, [&] { ++runs; }, queue);
  std::promise<void> release;
  queue.async([released = release.get_future().share()] { released.wait(); });
  for (std::uint64_t i = 1; i <= 3; ++i) {
    raiseAtProcess();
    source.waitUntilReceived(i);
  }
  release.set_value();
  queue.sync([] {});
  EXPECT_EQ(runs.load(), 1);

  // A later delivery runs the handler again.
  raiseAtProcess();
  source.waitUntilReceived(4);
  queue.sync([] {});
  EXPECT_EQ(runs.load(), 2);
}

TEST(SignalSourceTest, ADeliveryDuringTheHandlerRunsItOnceMoreNeverConcurrently) {
  std::promise<void> firstEntered;
  std::promise<void> letFirstFinish;
  auto finish = letFirstFinish.get_future().share();
  std::atomic<int> runs{0};
  std::atomic<int> inside{0};
  std::atomic<int> overlaps{0};
  std::promise<void> secondDone;
  SignalSource source(SIGUSR1, [&] {
    if (++inside > 1) ++overlaps;
    const int run = ++runs;
    if (run == 1) {
      firstEntered.set_value();
      finish.wait();
    }
    --inside;
    if (run == 2) secondDone.set_value();
  });
  raiseAtProcess();
  firstEntered.get_future().wait();
  raiseAtProcess();
  source.waitUntilReceived(2);
  raiseAtProcess();
  source.waitUntilReceived(3);
  letFirstFinish.set_value();
  secondDone.get_future().wait();
  EXPECT_EQ(runs.load(), 2);
  EXPECT_EQ(overlaps.load(), 0);
}

TEST(SignalSourceTest, ADeliveryToAThreadThatDoesNotBlockTheSignalIsForwarded) {
  std::promise<void> ran;
  SignalSource source(SIGUSR1, [&] { ran.set_value(); });
  std::thread unblocked([] {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGUSR1);
    pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
    pthread_kill(pthread_self(), SIGUSR1);  // handled in this thread, at once
  });
  unblocked.join();
  ran.get_future().wait();
  EXPECT_EQ(source.receivedCount(), 1u);
}

TEST(SignalSourceTest, CancelSkipsAQueuedRunAndLaterDeliveriesStayHarmless) {
  SerialQueue queue("test.signal-cancel");
  std::atomic<int> runs{0};
  SignalSource source(
      SIGUSR1, [&] { ++runs; }, queue);
  std::promise<void> release;
  queue.async([released = release.get_future().share()] { released.wait(); });
  raiseAtProcess();
  source.waitUntilReceived(1);
  source.cancel();
  release.set_value();
  queue.sync([] {});
  EXPECT_EQ(runs.load(), 0);

  // Nobody reads the signal any more: it stays pending, blocked, harmless.
  raiseAtProcess();
  EXPECT_TRUE(consumePendingSignal());
  EXPECT_EQ(source.receivedCount(), 1u);
  source.cancel();  // twice is fine
}

TEST(SignalSourceTest, ANewSourceAfterADestroyedOneWorks) {
  for (int round = 0; round < 3; ++round) {
    std::promise<void> ran;
    SignalSource source(SIGUSR1, [&] { ran.set_value(); });
    raiseAtProcess();
    ran.get_future().wait();
  }
}

}  // namespace
}  // namespace platform
