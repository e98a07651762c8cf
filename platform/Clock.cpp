#include "platform/Clock.h"

#include <utility>

namespace platform {

SystemClock& SystemClock::instance() {
  static SystemClock clock;
  return clock;
}

// A manual clock starts at an arbitrary but non-zero point, so code that
// subtracts durations from "now" never goes below the epoch.
ManualClock::ManualClock() : now_(TimePoint{} + std::chrono::hours(24)) {}

TimePoint ManualClock::now() const {
  std::lock_guard lock(mutex_);
  return now_;
}

void ManualClock::addObserver(std::function<void()> onChange) {
  std::lock_guard lock(mutex_);
  observers_.push_back(std::move(onChange));
}

void ManualClock::advance(Duration by) {
  std::vector<std::function<void()>> observers;
  {
    std::lock_guard lock(mutex_);
    now_ += by;
    observers = observers_;
  }
  // Outside the lock: an observer may read the time (and usually takes the
  // lock of whatever waits on this clock).
  for (auto& observer : observers) observer();
}

}  // namespace platform
