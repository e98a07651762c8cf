// OperationQueue: a list of queued operations in the order they were added,
// a count of running ones, and a pool of worker threads that grows on demand
// up to the concurrency limit.
//
// Whenever something changes that may let an operation start (an operation
// added, a dependency finished, the queue resumed, the limit raised),
// schedule() counts how many could start now and, when there are more than
// idle workers, starts threads (never more threads than the limit) and wakes
// the workers. A worker takes the first ready operation under the queue's
// mutex, marking it executing under the operation's mutex, so a dependency
// added concurrently either lands before the check or finds it started. A
// worker runs main(), the finish observers and the completion block, then
// gives its slot back and looks for the next operation before going idle.
#include "platform/OperationQueue.h"
#include "platform/Misuse.h"

#include <fmt/format.h>

#include <algorithm>
#include <climits>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <thread>
#include <vector>

namespace platform {
namespace {

thread_local const detail::OperationQueueState* tCurrentQueue = nullptr;

}  // namespace

namespace detail {

struct OperationQueueState {
  std::mutex mutex;
  std::condition_variable work;     // idle workers
  std::condition_variable allDone;  // waitUntilAllOperationsAreFinished
  std::deque<std::shared_ptr<Operation>> pending;
  int maxConcurrent = OperationQueue::kDefaultMaxConcurrentOperationCount;
  int running = 0;
  bool suspended = false;
  bool shuttingDown = false;
  std::size_t idleWorkers = 0;
  std::size_t unfinished = 0;  // queued, not yet through its completion block
  std::vector<std::thread> threads;

  int limit() const { return maxConcurrent < 0 ? INT_MAX : maxConcurrent; }

  // With the mutex held: how many pending operations are ready, up to `upTo`.
  int countReady(int upTo) const {
    int ready = 0;
    for (const auto& operation : pending) {
      if (ready >= upTo) break;
      std::lock_guard lock(operation->mutex_);
      if (operation->unfinishedDependencies_ == 0) ++ready;
    }
    return ready;
  }

  // With the mutex held: the first ready operation, now executing, or null.
  std::shared_ptr<Operation> takeReady() {
    if (suspended || shuttingDown || running >= limit()) return nullptr;
    for (auto it = pending.begin(); it != pending.end(); ++it) {
      std::lock_guard lock((*it)->mutex_);
      if ((*it)->unfinishedDependencies_ == 0) {
        (*it)->phase_ = Operation::Phase::Executing;
        std::shared_ptr<Operation> operation = std::move(*it);
        pending.erase(it);
        return operation;
      }
    }
    return nullptr;
  }

  // With the mutex held: makes sure a worker takes every operation that may
  // start now.
  void schedule() {
    if (suspended || shuttingDown) return;
    const int free = limit() - running;
    if (free <= 0) return;
    const int ready = countReady(free);
    if (ready == 0) return;
    if (static_cast<std::size_t>(ready) > idleWorkers) {
      std::size_t wanted = static_cast<std::size_t>(ready) - idleWorkers;
      const std::size_t cap = static_cast<std::size_t>(limit());
      wanted = threads.size() >= cap ? 0 : std::min(wanted, cap - threads.size());
      for (std::size_t i = 0; i < wanted; ++i) {
        threads.emplace_back([this] { workerLoop(); });
      }
    }
    work.notify_all();
  }

  void workerLoop() {
    tCurrentQueue = this;
    std::unique_lock lock(mutex);
    for (;;) {
      if (shuttingDown) return;
      if (std::shared_ptr<Operation> operation = takeReady()) {
        ++running;
        lock.unlock();
        operation->runOnWorker();
        operation.reset();
        lock.lock();
        --running;
        if (--unfinished == 0) allDone.notify_all();
        continue;
      }
      ++idleWorkers;
      work.wait(lock);
      --idleWorkers;
    }
  }
};

void operationBecameReady(OperationQueueState& state) {
  std::lock_guard lock(state.mutex);
  state.schedule();
}

}  // namespace detail

OperationQueue::OperationQueue() : state_(std::make_shared<detail::OperationQueueState>()) {}

OperationQueue::~OperationQueue() {
  detail::OperationQueueState& state = *state_;
  QV_MISUSE(tCurrentQueue == &state, "an operation queue destroyed from one of its operations");
  std::deque<std::shared_ptr<Operation>> dropped;
  std::vector<std::thread> threads;
  {
    std::lock_guard lock(state.mutex);
    state.shuttingDown = true;  // from here on no thread is started
    dropped.swap(state.pending);
    threads.swap(state.threads);
  }
  state.work.notify_all();
  for (auto& thread : threads) thread.join();
  // `dropped` is released outside the mutex: an operation's destructor may
  // be arbitrary code.
}

void OperationQueue::addOperation(std::shared_ptr<Operation> operation) {
  if (!operation) return;
  {
    std::lock_guard lock(operation->mutex_);
    QV_MISUSE(operation->queued_, "an operation can be added to a queue only once");
    operation->queued_ = true;
    operation->queue_ = state_;
  }
  std::lock_guard lock(state_->mutex);
  state_->pending.push_back(std::move(operation));
  ++state_->unfinished;
  state_->schedule();
}

void OperationQueue::setMaxConcurrentOperationCount(int count) {
  std::lock_guard lock(state_->mutex);
  state_->maxConcurrent = count < 0 ? kDefaultMaxConcurrentOperationCount : count;
  state_->schedule();
}

int OperationQueue::maxConcurrentOperationCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->maxConcurrent;
}

void OperationQueue::setSuspended(bool suspended) {
  std::lock_guard lock(state_->mutex);
  state_->suspended = suspended;
  state_->schedule();
}

std::size_t OperationQueue::operationCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->unfinished;
}

void OperationQueue::waitUntilAllOperationsAreFinished() {
  QV_MISUSE(tCurrentQueue == state_.get(),
            "waitUntilAllOperationsAreFinished from an own operation");
  std::unique_lock lock(state_->mutex);
  state_->allDone.wait(lock, [this] { return state_->unfinished == 0; });
}

}  // namespace platform
