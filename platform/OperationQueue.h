// OperationQueue: runs Operations on dedicated worker threads, at most
// maxConcurrentOperationCount at a time, each once its dependencies have
// finished, in the order they were added among those that are ready.
//
// Operations may block their worker for a long time, so each running
// operation has a thread of its own: threads are started on demand up to the
// concurrency limit and kept for later operations. A suspended queue starts
// nothing new; operations already running go on.
//
// Owned by its creator; destroying it waits for the running operations and
// drops those not started. Never destroy it, nor wait on it, from one of its
// own operations. Every member may be called from any thread.
#pragma once

#include <cstddef>
#include <memory>

#include "platform/Operation.h"

namespace platform {

class OperationQueue {
 public:
  // No limit: as many operations run as are ready.
  static constexpr int kDefaultMaxConcurrentOperationCount = -1;

  OperationQueue();
  ~OperationQueue();
  OperationQueue(const OperationQueue&) = delete;
  OperationQueue& operator=(const OperationQueue&) = delete;

  // Queues `operation`, which must not have been queued before.
  void addOperation(std::shared_ptr<Operation> operation);
  // At most `count` operations run at once (-1: no limit; 0: none start).
  void setMaxConcurrentOperationCount(int count);
  int maxConcurrentOperationCount() const;
  void setSuspended(bool suspended);
  // Operations queued and not yet finished (running ones included).
  std::size_t operationCount() const;
  // Blocks until every queued operation has finished and its completion
  // block has returned.
  void waitUntilAllOperationsAreFinished();

 private:
  std::shared_ptr<detail::OperationQueueState> state_;
};

namespace detail {
// Starts what may start now: an operation of the queue became ready.
void operationBecameReady(OperationQueueState& state);
}  // namespace detail

}  // namespace platform
