// Gate: waits for a condition that other threads make true, instead of
// sleeping. A thread changes the shared state inside update(), which wakes
// every waiter; waitUntil() returns whether the predicate held within kWait.
//
// Owned by the test; every member may be called from any thread.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>

namespace platform::testing {

inline constexpr auto kWait = std::chrono::seconds(20);  // upper bound on any wait for an event

class Gate {
 public:
  void update(const std::function<void()>& change) {
    {
      std::lock_guard lock(mutex_);
      change();
    }
    changed_.notify_all();
  }
  bool waitUntil(const std::function<bool()>& predicate) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, kWait, predicate);
  }
  std::mutex& mutex() { return mutex_; }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
};

// Latch: a one-shot event. Work that must hold on waits in wait(), which
// returns whether the test opened it within kWait. open() wakes the waiters
// with the lock held, so a waiter may destroy the latch as soon as it returns.
class Latch {
 public:
  void open() {
    std::lock_guard lock(mutex_);
    open_ = true;
    opened_.notify_all();
  }
  bool wait() {
    std::unique_lock lock(mutex_);
    return opened_.wait_for(lock, kWait, [this] { return open_; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable opened_;
  bool open_ = false;
};

// Counter: a count the test waits on; waitFor() returns whether it reached
// `atLeast` within kWait. Safe to destroy once a wait returned, as Latch.
class Counter {
 public:
  void increment() {
    std::lock_guard lock(mutex_);
    ++count_;
    changed_.notify_all();
  }
  bool waitFor(int atLeast) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, kWait, [&] { return count_ >= atLeast; });
  }
  int value() {
    std::lock_guard lock(mutex_);
    return count_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  int count_ = 0;
};

}  // namespace platform::testing
