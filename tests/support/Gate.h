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

}  // namespace platform::testing
