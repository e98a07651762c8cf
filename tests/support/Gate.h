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

// A copy of `field`, read with `mutex` held.
template <class T>
T readLocked(std::mutex& mutex, const T& field) {
  std::lock_guard lock(mutex);
  return field;
}

class Gate {
 public:
  // Wakes the waiters with the lock held, so a waiter may destroy the gate
  // (or the Latch or Counter around it) as soon as its wait returns.
  void update(const std::function<void()>& change) {
    std::lock_guard lock(mutex_);
    change();
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
// returns whether the test opened it within kWait.
class Latch {
 public:
  void open() {
    gate_.update([this] { open_ = true; });
  }
  bool wait() {
    return gate_.waitUntil([this] { return open_; });
  }

 private:
  Gate gate_;
  bool open_ = false;
};

// Counter: a count the test waits on; waitFor() returns whether it reached
// `atLeast` within kWait.
class Counter {
 public:
  void increment() {
    gate_.update([this] { ++count_; });
  }
  bool waitFor(int atLeast) {
    return gate_.waitUntil([&] { return count_ >= atLeast; });
  }
  int value() { return readLocked(gate_.mutex(), count_); }

 private:
  Gate gate_;
  int count_ = 0;
};

}  // namespace platform::testing
