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
//
// A busy daemon schedules thousands of timers a second (every keep-alive ends
// a second after its work), so timers are cheap: scheduling one wakes the
// loop only when it becomes the earliest deadline, and a loop that sleeps
// until a deadline sleeps kTimerLeeway longer, so the timers that fall due
// within that window run in one turn instead of one wake-up each. The leeway
// only delays waking on the real clock; what is due is always decided by the
// queue's clock, so a manual clock's jump runs exactly the timers it passes.
// Timers scheduled in deadline order (nearly all: every keep-alive waits the
// same second) go to the tail of a FIFO instead of into the ordered map, and
// the two are merged by (deadline, order of scheduling) when they fall due.
#include "platform/MainQueue.h"
#include "platform/Misuse.h"

#include <fmt/format.h>

#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <iterator>
#include <map>
#include <mutex>
#include <optional>
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
// How late a sleeping loop may wake for a timer, to run its neighbours along.
constexpr Duration kTimerLeeway = std::chrono::milliseconds(5);

}  // namespace

struct MainQueue::State {
  State(Clock& c, std::string l) : clock(c), label(std::move(l)) {}

  Clock& clock;
  const std::string label;
  mutable std::mutex mutex;
  std::condition_variable wake;
  std::deque<Task> ready;
  using TimerKey = std::pair<TimePoint, std::uint64_t>;  // (deadline, order of scheduling)
  std::map<TimerKey, Task> timers;
  std::deque<std::pair<TimerKey, Task>> timersInOrder;  // deadlines never decrease
  std::uint64_t nextTimerOrder = 0;
  std::atomic<bool> stopRequested{false};  // written under `mutex`
  int servicers = 0;                       // threads inside run() / runUntilIdle()
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

namespace {

// With the state's mutex held: the first deadline of either timer list.
template <class StateT>
std::optional<typename StateT::TimerKey> firstTimer(const StateT& state) {
  std::optional<typename StateT::TimerKey> first;
  if (!state.timers.empty()) first = state.timers.begin()->first;
  if (!state.timersInOrder.empty() && (!first || state.timersInOrder.front().first < *first)) {
    first = state.timersInOrder.front().first;
  }
  return first;
}

}  // namespace

void MainQueue::after(Duration delay, Task task) {
  bool earliest;
  {
    std::lock_guard lock(state_->mutex);
    const State::TimerKey key(deadlineAfter(state_->clock.now(), delay), state_->nextTimerOrder++);
    const auto first = firstTimer(*state_);
    earliest = !first || key < *first;
    if (state_->timersInOrder.empty() || state_->timersInOrder.back().first.first <= key.first) {
      state_->timersInOrder.emplace_back(key, std::move(task));
    } else {
      state_->timers.emplace(key, std::move(task));
    }
  }
  // A later deadline than the first changes nothing for a sleeping loop.
  if (earliest) state_->wake.notify_all();
}

namespace {

// With `lock` held: moves the due timers to the ready FIFO, then runs every
// task that is ready at this moment with the lock released, as one batch, so
// the thousands of timers a busy second brings do not take the lock (and
// contend with the threads scheduling more) once each. Tasks queued meanwhile
// wait for the next turn. A stop() from within the batch puts the tasks not
// yet run back at the head of the FIFO (only for run(): runUntilIdle() does
// not stop). Returns how many ran.
template <class StateT>
std::size_t runReady(MainQueue& queue, StateT& state, std::unique_lock<std::mutex>& lock,
                     bool honourStop) {
  const TimePoint now = state.clock.now();
  for (auto first = firstTimer(state); first && first->first <= now; first = firstTimer(state)) {
    if (!state.timersInOrder.empty() && state.timersInOrder.front().first == *first) {
      state.ready.push_back(std::move(state.timersInOrder.front().second));
      state.timersInOrder.pop_front();
    } else {
      auto node = state.timers.extract(state.timers.begin());
      state.ready.push_back(std::move(node.mapped()));
    }
  }
  if (state.ready.empty()) return 0;
  std::deque<Task> batch;
  batch.swap(state.ready);
  lock.unlock();
  std::size_t ran = 0;
  {
    detail::ScopedCurrentQueue scope(queue);
    while (!batch.empty() && !(honourStop && state.stopRequested.load(std::memory_order_relaxed))) {
      Task task = std::move(batch.front());
      batch.pop_front();
      task();
      task = nullptr;  // captures die while still on the queue
      ++ran;
    }
  }
  lock.lock();
  if (!batch.empty()) {
    std::move(state.ready.begin(), state.ready.end(), std::back_inserter(batch));
    state.ready.swap(batch);
  }
  return ran;
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
    if (runReady(*this, state, lock, true) > 0) continue;
    if (const auto first = firstTimer(state)) {
      const Duration left = first->first - state.clock.now();
      state.wake.wait_for(lock, std::min(left, kMaxWait) + kTimerLeeway);
    } else {
      state.wake.wait(lock);
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
  while (std::size_t ran = runReady(*this, state, lock, false)) count += ran;
  return count;
}

std::size_t MainQueue::pendingCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->ready.size() + state_->timers.size() + state_->timersInOrder.size();
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
