// SerialQueue: one worker thread draining a FIFO of items under one mutex.
//
// async() appends a task and signals the worker: one lock, one deque slot,
// no allocation beyond the task itself.
//
// sync() runs its task on the calling thread, not the worker, once the queue
// is the caller's: the queue is "owned" by at most one thread at a time (the
// worker running a task, or a sync caller). When the queue is idle (nothing
// queued, no owner) the caller takes it at once without waking the worker.
// Otherwise the caller queues a gate item and waits; when the worker reaches
// the gate it hands ownership to the caller instead of running anything, and
// waits until the caller gives it back. A sync caller that finishes while
// another one waits at the head hands the queue straight on. So FIFO order
// holds across async and sync, the caller's thread-local state (the current
// connection, the queue chain) stays visible inside the task, and an idle
// sync costs no thread hop.
#include "platform/SerialQueue.h"
#include "platform/Misuse.h"

#include <fmt/format.h>

#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <mutex>
#include <thread>
#include <utility>

namespace platform {
namespace {

// About a few microseconds of pause instructions.
constexpr int kSpinsBeforeSleeping = 100;

inline void cpuRelax() {
#if defined(__x86_64__) || defined(__i386__)
  __builtin_ia32_pause();
#endif
}

struct SyncGate {
  std::condition_variable granted_cv;
  bool granted = false;
};

struct Item {
  Task task;
  SyncGate* gate = nullptr;  // set for a sync caller waiting for its turn
};

}  // namespace

struct SerialQueue::State {
  std::string label;
  std::mutex mutex;
  std::condition_variable wake;  // the worker: an item arrived, ownership returned, or stop
  std::deque<Item> items;
  // A thread (worker or sync caller) is running a task of this queue. Written
  // under `mutex`; read without it only by a sync caller spinning for it.
  std::atomic<bool> owned{false};
  bool stopping = false;
  std::thread::id workerId;
  std::thread worker;
};

SerialQueue::SerialQueue(std::string label) : state_(std::make_unique<State>()) {
  state_->label = std::move(label);
  State& state = *state_;
  state_->worker = std::thread([this, &state] {
    std::unique_lock lock(state.mutex);
    for (;;) {
      state.wake.wait(lock, [&] {
        return (!state.items.empty() && !state.owned) ||
               (state.stopping && state.items.empty() && !state.owned);
      });
      if (state.items.empty()) return;  // stopping and drained
      Item item = std::move(state.items.front());
      state.items.pop_front();
      state.owned = true;
      if (item.gate != nullptr) {
        // Hand the queue to the waiting sync caller; it clears `owned`.
        item.gate->granted = true;
        item.gate->granted_cv.notify_one();
        continue;
      }
      lock.unlock();
      {
        detail::ScopedCurrentQueue scope(*this);
        item.task();
        item.task = nullptr;  // destroy captures while still on the queue
      }
      lock.lock();
      state.owned = false;
    }
  });
  state_->workerId = state_->worker.get_id();
}

SerialQueue::~SerialQueue() {
  QV_MISUSE(std::this_thread::get_id() == state_->workerId || detail::isRunningOnQueue(*this),
            "SerialQueue '{}' destroyed from its own queue", state_->label);
  {
    std::lock_guard lock(state_->mutex);
    state_->stopping = true;
  }
  state_->wake.notify_all();
  state_->worker.join();
}

void SerialQueue::async(Task task) {
  {
    std::lock_guard lock(state_->mutex);
    state_->items.push_back(Item{std::move(task), nullptr});
  }
  state_->wake.notify_one();
}

void SerialQueue::sync(Task task) {
  QV_MISUSE(detail::isRunningOnQueue(*this),
            "SerialQueue::sync called from the '{}' queue onto itself: it would deadlock",
            state_->label);
  State& state = *state_;
  {
    std::unique_lock lock(state.mutex);
    if (state.owned && state.items.empty()) {
      // Another thread holds the queue and nothing waits behind it. The
      // queues that are synced onto hold it for a few microseconds (a table
      // update), far less than going to sleep and being woken again, so spin
      // a little before queueing a gate.
      lock.unlock();
      for (int i = 0; i < kSpinsBeforeSleeping && state.owned.load(std::memory_order_relaxed);
           ++i) {
        cpuRelax();
      }
      lock.lock();
    }
    if (state.owned || !state.items.empty()) {
      SyncGate gate;
      // No wake-up: whoever owns the queue passes it on when done.
      state.items.push_back(Item{nullptr, &gate});
      gate.granted_cv.wait(lock, [&] { return gate.granted; });
    } else {
      state.owned = true;
    }
  }
  struct Release {
    State& state;
    ~Release() {
      bool work;
      {
        std::lock_guard lock(state.mutex);
        if (!state.items.empty() && state.items.front().gate != nullptr) {
          // The next in line is another sync caller: hand the queue straight
          // to it, without a round trip through the worker.
          SyncGate* next = state.items.front().gate;
          state.items.pop_front();
          next->granted = true;
          next->granted_cv.notify_one();
          return;
        }
        state.owned = false;
        work = !state.items.empty() || state.stopping;
      }
      // An idle queue's worker has nothing to do: leave it asleep.
      if (work) state.wake.notify_one();
    }
  } release{state};
  detail::ScopedCurrentQueue scope(*this);
  task();
}

bool SerialQueue::isCurrent() const { return detail::isRunningOnQueue(*this); }

const std::string& SerialQueue::label() const { return state_->label; }

}  // namespace platform
