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
//
// Adoption (AdoptionScope) lets an event loop's thread stand in for the
// worker: an async() from inside the scope onto an idle queue marks the
// queue owned, as a running worker task would, and records it in the
// thread's list. Ownership is what keeps the worker and every other thread
// off the queue, so nothing else changes: other threads' async() calls queue
// behind it, sync() callers queue a gate, and when the scope ends the
// adopting thread drains the queue with the worker's own loop (less the
// waiting), then gives ownership back. The worker is woken only when someone
// else has to go on: work left after the time budget, or a stop.
//
// asyncOnWorker() tasks are never adopted: an adopted run that reaches one
// stops there and hands the queue to the worker, as after its time budget.
//
// Wake-ups: async() signals the worker only when the queue is not owned. An
// owner always looks at the FIFO before it lets go (the worker's loop, a sync
// caller's release, the end of an adopted run), so a signal to a worker that
// cannot take the queue yet would only wake it to sleep again.
#include "platform/SerialQueue.h"
#include "platform/Misuse.h"

#include <fmt/format.h>
#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <exception>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

namespace platform {
namespace {

// How long a sync caller waits for a busy queue before it sleeps.
constexpr auto kSpinBeforeSleeping = std::chrono::microseconds(5);

inline void cpuRelax() {
#if defined(__x86_64__) || defined(__i386__)
  __builtin_ia32_pause();
#endif
}

// Spins until `owned` reads false or kSpinBeforeSleeping has passed.
void spinWhileOwned(const std::atomic<bool>& owned) {
  const auto until = std::chrono::steady_clock::now() + kSpinBeforeSleeping;
  while (owned.load(std::memory_order_relaxed)) {
    for (int i = 0; i < 16; ++i) cpuRelax();
    if (std::chrono::steady_clock::now() >= until) return;
  }
}

struct SyncGate {
  enum class Signal {
    None,
    Granted,  // the queue is the waiter's: the worker or an adopted run handed it over
    Retry,    // a sync caller let go of the queue: the waiter takes it, first in line
  };
  std::condition_variable signalled;
  Signal signal = Signal::None;
};

struct Item {
  Task task;
  SyncGate* gate = nullptr;  // set for a sync caller waiting for its turn
  bool workerOnly = false;   // never run by an adopting thread
};

// The calling thread's adoption scope: whether one is open, and the queues
// it has adopted so far, in order.
struct Adoption {
  bool open = false;
  std::vector<SerialQueue*> queues;
};
thread_local Adoption tAdoption;

// Takes `queue` off the thread's adopted list; whether it was there.
bool takeAdopted(SerialQueue* queue) {
  auto found = std::find(tAdoption.queues.begin(), tAdoption.queues.end(), queue);
  if (found == tAdoption.queues.end()) return false;
  tAdoption.queues.erase(found);
  return true;
}

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
  // The worker thread exists only while it has work or has had some within
  // kWorkerLinger: `workerRunning` while its loop runs. It is detached, so a
  // process that exits while it lingers leaves nothing unjoined; the
  // destructor waits on `workerEnded` for its loop to end instead.
  bool workerRunning = false;
  std::thread::id workerId;
  std::condition_variable workerEnded;
};

namespace {

// How long an idle worker waits for more work before its thread ends. Long
// enough that a busy queue keeps its thread, short enough that an idle daemon
// has none.
constexpr auto kWorkerLinger = std::chrono::seconds(1);

}  // namespace

void SerialQueue::workerLoop() {
  State& state = *state_;
  // Named after the queue, so `top -H` and /proc show which queue is busy.
  pthread_setname_np(pthread_self(), state.label.substr(0, 15).c_str());
  std::unique_lock lock(state.mutex);
  for (;;) {
    const bool woken = state.wake.wait_for(lock, kWorkerLinger, [&] {
      return (!state.items.empty() && !state.owned) ||
             (state.stopping && state.items.empty() && !state.owned);
    });
    if (!woken && state.items.empty()) break;  // idle for a while: the thread goes
    if (!woken) continue;            // owned by a sync caller or an adopted run: it hands work back
    if (state.items.empty()) break;  // stopping and drained
    Item item = std::move(state.items.front());
    state.items.pop_front();
    state.owned = true;
    if (item.gate != nullptr) {
      // Hand the queue to the waiting sync caller; it clears `owned`.
      item.gate->signal = SyncGate::Signal::Granted;
      item.gate->signalled.notify_one();
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
  state.workerRunning = false;
  state.workerId = {};
  // After this the thread touches nothing of the queue but the unlock.
  state.workerEnded.notify_all();
}

void SerialQueue::wakeWorker(std::unique_lock<std::mutex>& lock) {
  State& state = *state_;
  QV_MISUSE(!lock.owns_lock(), "SerialQueue '{}' woken without its lock", state.label);
  if (state.workerRunning) {
    state.wake.notify_one();
    return;
  }
  state.workerRunning = true;
  std::thread worker([this] { workerLoop(); });
  state.workerId = worker.get_id();
  worker.detach();
}

SerialQueue::SerialQueue(std::string label) : state_(std::make_unique<State>()) {
  state_->label = std::move(label);
}

SerialQueue::~SerialQueue() {
  QV_MISUSE(detail::isRunningOnQueue(*this), "SerialQueue '{}' destroyed from its own queue",
            state_->label);
  // Adopted by this thread: its tasks run now, as the worker would run them.
  if (takeAdopted(this)) runAdopted(*this);
  std::unique_lock lock(state_->mutex);
  QV_MISUSE(state_->workerRunning && state_->workerId == std::this_thread::get_id(),
            "SerialQueue '{}' destroyed from its own queue", state_->label);
  state_->stopping = true;
  // What is still queued runs before the queue goes, on a worker.
  if (!state_->items.empty() || state_->workerRunning) wakeWorker(lock);
  state_->workerEnded.wait(lock, [this] { return !state_->workerRunning; });
}

void SerialQueue::async(Task task) { enqueue(std::move(task), false); }

void SerialQueue::asyncOnWorker(Task task) { enqueue(std::move(task), true); }

void SerialQueue::enqueue(Task task, bool workerOnly) {
  std::unique_lock lock(state_->mutex);
  // An owned queue is passed on by its owner, who looks at the FIFO first.
  bool wake = !state_->owned;
  if (wake && !workerOnly && tAdoption.open && state_->items.empty()) {
    state_->owned = true;
    tAdoption.queues.push_back(this);
    wake = false;
  }
  state_->items.push_back(Item{std::move(task), nullptr, workerOnly});
  if (wake) wakeWorker(lock);
}

void SerialQueue::sync(Task task) {
  QV_MISUSE(detail::isRunningOnQueue(*this),
            "SerialQueue::sync called from the '{}' queue onto itself: it would deadlock",
            state_->label);
  // Adopted by this thread: what it queued comes first, and runs here now.
  if (takeAdopted(this)) runAdopted(*this);
  State& state = *state_;
  {
    std::unique_lock lock(state.mutex);
    bool atHead = false;  // woken by a release: first in line, ahead of the FIFO
    bool spun = false;
    for (;;) {
      if (!state.owned && (atHead || state.items.empty())) {
        state.owned = true;
        break;
      }
      if (state.owned && (atHead || state.items.empty()) && !spun) {
        // Another thread holds the queue and nothing waits behind it. The
        // queues that are synced onto hold it for a microsecond or two (a
        // table update), far less than going to sleep and being woken
        // again, so wait a little for it before queueing a gate.
        lock.unlock();
        spinWhileOwned(state.owned);
        lock.lock();
        spun = true;
        continue;
      }
      if (!tAdoption.queues.empty()) {
        // About to wait for another thread, which may itself be waiting for
        // a queue this thread adopted: hand those to their workers first, so
        // the wait ends as it would have had the worker taken them.
        lock.unlock();
        handOffAdopted();
        lock.lock();
        continue;
      }
      SyncGate gate;
      // No wake-up: whoever owns the queue passes it on when done.
      if (atHead) {
        state.items.push_front(Item{nullptr, &gate});
      } else {
        state.items.push_back(Item{nullptr, &gate});
      }
      gate.signalled.wait(lock, [&] { return gate.signal != SyncGate::Signal::None; });
      if (gate.signal == SyncGate::Signal::Granted) break;  // handed over: owned stays set
      atHead = true;
      spun = false;
    }
  }
  struct Release {
    SerialQueue& queue;
    ~Release() {
      State& state = *queue.state_;
      std::unique_lock lock(state.mutex);
      state.owned = false;
      if (!state.items.empty() && state.items.front().gate != nullptr) {
        // The next in line is another sync caller: wake it to take the
        // queue, first in line, without a round trip through the worker.
        // The queue is not handed to it while it sleeps: a caller that
        // comes back at once (a loop of table updates) would otherwise
        // find the queue owned by a thread that is not running yet, and
        // go to sleep in turn, and the two would take turns sleeping.
        SyncGate* next = state.items.front().gate;
        state.items.pop_front();
        next->signal = SyncGate::Signal::Retry;
        next->signalled.notify_one();
        return;
      }
      // An idle queue's worker has nothing to do: leave it asleep (or gone).
      if (!state.items.empty() || (state.stopping && state.workerRunning)) queue.wakeWorker(lock);
    }
  } release{*this};
  detail::ScopedCurrentQueue scope(*this);
  task();
}

void SerialQueue::runAdopted(SerialQueue& queue) {
  State& state = *queue.state_;
  const auto start = std::chrono::steady_clock::now();
  std::unique_lock lock(state.mutex);
  for (bool first = true;; first = false) {
    if (state.items.empty() || state.items.front().workerOnly ||
        (!first && std::chrono::steady_clock::now() - start > kAdoptedRunBudget)) {
      queue.giveBackToWorker(lock);
      return;
    }
    Item item = std::move(state.items.front());
    state.items.pop_front();
    if (item.gate != nullptr) {
      // A sync caller's turn: the queue is its now; its release passes the
      // queue on to the worker if work remains.
      item.gate->signal = SyncGate::Signal::Granted;
      item.gate->signalled.notify_one();
      return;
    }
    lock.unlock();
    {
      detail::ScopedCurrentQueue scope(queue);
      item.task();
      item.task = nullptr;
    }
    lock.lock();
  }
}

SerialQueue::AdoptionScope::AdoptionScope() {
  QV_MISUSE(tAdoption.open, "SerialQueue::AdoptionScope opened inside another one");
  tAdoption.open = true;
}

SerialQueue::AdoptionScope::~AdoptionScope() {
  // What the adopted tasks queue elsewhere goes to those queues' workers.
  tAdoption.open = false;
  // Leaving through an exception: hand the work to the workers instead of
  // running tasks in the middle of unwinding.
  if (std::uncaught_exceptions() > 0) handOffAdopted();
  while (!tAdoption.queues.empty()) {
    SerialQueue* queue = tAdoption.queues.front();
    tAdoption.queues.erase(tAdoption.queues.begin());
    runAdopted(*queue);
  }
}

void SerialQueue::giveBackToWorker(std::unique_lock<std::mutex>& lock) {
  State& state = *state_;
  state.owned = false;
  // Signalled with the lock held: a stopping queue may be freed as soon as
  // its worker, woken by this, has left.
  if (!state.items.empty() || (state.stopping && state.workerRunning)) wakeWorker(lock);
}

void SerialQueue::handOffAdopted() {
  for (SerialQueue* queue : std::exchange(tAdoption.queues, {})) {
    std::unique_lock lock(queue->state_->mutex);
    queue->giveBackToWorker(lock);
  }
}

bool SerialQueue::isCurrent() const { return detail::isRunningOnQueue(*this); }

const std::string& SerialQueue::label() const { return state_->label; }

}  // namespace platform
