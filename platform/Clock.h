// Clock: where timers read the time. The main queue's timers and the idle
// exit read a Clock, so tests drive time with ManualClock instead of sleeping.
// Thread-safe.
#pragma once

#include <chrono>
#include <functional>
#include <mutex>
#include <vector>

namespace platform {

using Duration = std::chrono::nanoseconds;
using TimePoint = std::chrono::steady_clock::time_point;

class Clock {
 public:
  virtual ~Clock() = default;
  virtual TimePoint now() const = 0;
  // Registers a callback run (on the advancing thread) whenever the time
  // jumps, so waiters re-read it. Real clocks never call it.
  virtual void addObserver(std::function<void()> /*onChange*/) {}
};

// The real monotonic clock.
class SystemClock final : public Clock {
 public:
  static SystemClock& instance();
  TimePoint now() const override { return std::chrono::steady_clock::now(); }
};

// A clock that moves only when told. advance() wakes every waiter.
class ManualClock final : public Clock {
 public:
  ManualClock();
  TimePoint now() const override;
  void addObserver(std::function<void()> onChange) override;
  void advance(Duration by);

 private:
  mutable std::mutex mutex_;
  TimePoint now_;
  std::vector<std::function<void()>> observers_;
};

}  // namespace platform
