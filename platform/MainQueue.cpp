// MainQueue: a FIFO of ready tasks plus timers ordered by (deadline, order of
// scheduling), serviced by whichever thread calls run() or runUntilIdle().
//
// Timers never sleep on their own: a turn of the loop moves every timer that
// is due by the clock to the tail of the ready FIFO, and an idle loop waits on
// its condition variable for the time left until the first deadline. That
// wait is only a bound: the clock's observer wakes the loop whenever a manual
// clock jumps, so tests advance time and due timers run with no real sleeping.
// The observer takes the queue's mutex before notifying, so a jump can never
// fall between the loop reading the clock and starting to wait.
#include "platform/MainQueue.h"
#include "platform/Misuse.h"

#include <fmt/format.h>

#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <map>
#include <mutex>
#include <semaphore>
#include <utility>

namespace platform {
namespace {

TimePoint deadlineAfter(TimePoint now, Duration delay) {
  if (delay <= Duration::zero()) return now;
  if (now > TimePoint::max() - delay) return TimePoint::max();
  return now + delay;
}

// The longest single wait of an idle loop; it re-reads the clock afterwards.
constexpr Duration kMaxWait = std::chrono::hours(1);

}  // namespace

struct MainQueue::State {
  State(Clock& c, std::string l) : clock(c), label(std::move(l)) {}

  Clock& clock;
  const std::string label;
  mutable std::mutex mutex;
  std::condition_variable wake;
  std::deque<Task> ready;
  std::map<std::pair<TimePoint, std::uint64_t>, Task> timers;
  std::uint64_t nextTimerOrder = 0;
  bool stopRequested = false;
  int servicers = 0;  // threads inside run() / runUntilIdle()
};

MainQueue::MainQueue(Clock& clock, std::string label)
    : state_(std::make_shared<State>(clock, std::move(label))) {
  clock.addObserver([weak = std::weak_ptr<State>(state_)] {
    if (auto state = weak.lock()) {
      { std::lock_guard lock(state->mutex); }
      state->wake.notify_all();
    }
  });
}

MainQueue::~MainQueue() {
  QV_MISUSE(detail::isRunningOnQueue(*this), "MainQueue '{}' destroyed from its own task",
            state_->label);
}

void MainQueue::async(Task task) {
  {
    std::lock_guard lock(state_->mutex);
    state_->ready.push_back(std::move(task));
  }
  state_->wake.notify_all();
}

void MainQueue::sync(Task task) {
  QV_MISUSE(detail::isRunningOnQueue(*this),
            "MainQueue::sync called from the '{}' queue onto itself: it would deadlock",
            state_->label);
  std::binary_semaphore done(0);
  async([&] {
    task();
    done.release();
  });
  done.acquire();
}

bool MainQueue::isCurrent() const { return detail::isRunningOnQueue(*this); }

const std::string& MainQueue::label() const { return state_->label; }

Clock& MainQueue::clock() const { return state_->clock; }

void MainQueue::after(Duration delay, Task task) {
  {
    std::lock_guard lock(state_->mutex);
    const TimePoint deadline = deadlineAfter(state_->clock.now(), delay);
    state_->timers.emplace(std::pair(deadline, state_->nextTimerOrder++), std::move(task));
  }
  state_->wake.notify_all();
}

namespace {

// With `lock` held: moves the due timers to the ready FIFO, then runs the
// first ready task (with the lock released). Returns whether one ran.
template <class StateT>
bool runNext(MainQueue& queue, StateT& state, std::unique_lock<std::mutex>& lock) {
  const TimePoint now = state.clock.now();
  while (!state.timers.empty() && state.timers.begin()->first.first <= now) {
    auto node = state.timers.extract(state.timers.begin());
    state.ready.push_back(std::move(node.mapped()));
  }
  if (state.ready.empty()) return false;
  Task task = std::move(state.ready.front());
  state.ready.pop_front();
  lock.unlock();
  {
    detail::ScopedCurrentQueue scope(queue);
    task();
    task = nullptr;  // captures die while still on the queue
  }
  lock.lock();
  return true;
}

template <class StateT>
struct ServicingScope {
  StateT& state;
  ServicingScope(StateT& s, std::unique_lock<std::mutex>&) : state(s) {
    if (++state.servicers > 1) {
      QV_MISUSE(true, "MainQueue '{}' serviced by two threads at once", state.label);
    }
  }
  ~ServicingScope() { --state.servicers; }
};

}  // namespace

void MainQueue::run() {
  State& state = *state_;
  std::unique_lock lock(state.mutex);
  ServicingScope servicing(state, lock);
  for (;;) {
    if (state.stopRequested) {
      state.stopRequested = false;
      return;
    }
    if (runNext(*this, state, lock)) continue;
    if (state.timers.empty()) {
      state.wake.wait(lock);
    } else {
      const Duration left = state.timers.begin()->first.first - state.clock.now();
      state.wake.wait_for(lock, std::min(left, kMaxWait));
    }
  }
}

void MainQueue::stop() {
  {
    std::lock_guard lock(state_->mutex);
    state_->stopRequested = true;
  }
  state_->wake.notify_all();
}

std::size_t MainQueue::runUntilIdle() {
  State& state = *state_;
  std::unique_lock lock(state.mutex);
  ServicingScope servicing(state, lock);
  std::size_t count = 0;
  while (runNext(*this, state, lock)) ++count;
  return count;
}

std::size_t MainQueue::pendingCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->ready.size() + state_->timers.size();
}

namespace {
std::atomic<MainQueue*> gMainQueueForTesting{nullptr};
}  // namespace

MainQueue& mainQueue() {
  if (MainQueue* replacement = gMainQueueForTesting.load(std::memory_order_acquire)) {
    return *replacement;
  }
  static MainQueue* queue = new MainQueue(SystemClock::instance(), "main");
  return *queue;
}

void setMainQueueForTesting(MainQueue* queue) {
  gMainQueueForTesting.store(queue, std::memory_order_release);
}

}  // namespace platform
