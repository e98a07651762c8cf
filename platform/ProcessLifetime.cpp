// ProcessLifetime: the root transaction flag and the idle-exit timer.
//
// Every end of the root transaction (and enableTransactions() outside one)
// arms a timer on the main queue for the idle period, tagged with a new
// generation number; every begin bumps the generation. A timer whose
// generation is no longer the latest was cancelled by a begin (or re-armed by
// a new period) and does nothing, so the idle handler runs only after a full
// idle period without a root transaction. The end of the root transaction
// also trims the heap (see trimHeapWhileIdle).
#include "platform/ProcessLifetime.h"

#include <fmt/format.h>
#include <malloc.h>

#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <utility>
#include <vector>

#include "platform/Log.h"
#include "platform/Misuse.h"

namespace platform {

struct ProcessLifetime::State {
  explicit State(MainQueue& q) : queue(q) {}

  MainQueue& queue;
  mutable std::mutex mutex;
  Duration idle = std::chrono::seconds(30);
  std::function<void()> handler;
  bool enabled = false;
  bool inTransaction = false;
  std::uint64_t generation = 0;
  std::vector<std::function<void()>> noTransactionWaiters;
};

ProcessLifetime& ProcessLifetime::instance() {
  static ProcessLifetime* lifetime = new ProcessLifetime(mainQueue());
  return *lifetime;
}

ProcessLifetime::ProcessLifetime(MainQueue& queue) : state_(std::make_shared<State>(queue)) {}

namespace {

// With the state's mutex held: arms the idle timer when idle exit applies.
template <class StateT>
void armIdleTimer(const std::shared_ptr<StateT>& state) {
  const std::uint64_t generation = ++state->generation;
  if (!state->enabled || state->inTransaction || state->idle <= Duration::zero()) return;
  const Duration idle = state->idle;
  state->queue.after(idle, [weak = std::weak_ptr<StateT>(state), generation, idle] {
    auto strong = weak.lock();
    if (!strong) return;
    std::function<void()> handler;
    {
      std::lock_guard lock(strong->mutex);
      if (strong->generation != generation) return;  // a begin came first
      handler = strong->handler;
    }
    QV_LOG(kLogLevelNotice, "Idle without a transaction for {} s; running the idle handler",
           std::chrono::duration<double>(idle).count());
    if (handler) handler();
  });
}

// With the state's mutex held, when the root transaction has just ended:
// gives the heap memory freed during the busy spell back to the system, on
// the main queue, unless work has begun again by then. Memory freed by other
// threads stays in their malloc arenas otherwise, so an idle daemon would keep
// the high-water mark of its busiest moment.
template <class StateT>
void trimHeapWhileIdle(const std::shared_ptr<StateT>& state) {
  state->queue.async([weak = std::weak_ptr<StateT>(state), generation = state->generation] {
    auto strong = weak.lock();
    if (!strong) return;
    {
      std::lock_guard lock(strong->mutex);
      if (strong->generation != generation) return;
    }
    malloc_trim(0);
  });
}

}  // namespace

void ProcessLifetime::setIdleExitAfter(Duration idle) {
  std::lock_guard lock(state_->mutex);
  state_->idle = idle;
  armIdleTimer(state_);  // a pending idle exit restarts with the new period
}

void ProcessLifetime::setIdleHandler(std::function<void()> handler) {
  std::lock_guard lock(state_->mutex);
  state_->handler = std::move(handler);
}

void ProcessLifetime::enableTransactions() {
  std::lock_guard lock(state_->mutex);
  if (state_->enabled) return;
  state_->enabled = true;
  armIdleTimer(state_);
}

void ProcessLifetime::beginTransaction() {
  std::lock_guard lock(state_->mutex);
  if (state_->inTransaction) {
#if defined(QUORVEL_DCHECK_IS_ON)
    QV_MISUSE(true, "beginTransaction called while the root transaction is already held");
#else
    return;
#endif
  }
  state_->inTransaction = true;
  ++state_->generation;  // cancels a pending idle exit
}

void ProcessLifetime::endTransaction() {
  std::vector<std::function<void()>> waiters;
  {
    std::lock_guard lock(state_->mutex);
    if (!state_->inTransaction) {
#if defined(QUORVEL_DCHECK_IS_ON)
      QV_MISUSE(true, "endTransaction called without a root transaction");
#else
      return;
#endif
    }
    state_->inTransaction = false;
    armIdleTimer(state_);
    waiters.swap(state_->noTransactionWaiters);
    trimHeapWhileIdle(state_);
  }
  for (auto& waiter : waiters) waiter();
}

bool ProcessLifetime::isInTransaction() const {
  std::lock_guard lock(state_->mutex);
  return state_->inTransaction;
}

void ProcessLifetime::whenNoTransaction(std::function<void()> callback) {
  {
    std::lock_guard lock(state_->mutex);
    if (state_->inTransaction) {
      state_->noTransactionWaiters.push_back(std::move(callback));
      return;
    }
  }
  callback();
}

}  // namespace platform
