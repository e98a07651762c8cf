// DispatchQueue: something that runs tasks. Serial queues run one task at a
// time in FIFO order; the global queue runs them concurrently.
// Every member may be called from any thread.
#pragma once

#include <functional>
#include <string>

#include "platform/Clock.h"

namespace platform {

using Task = std::move_only_function<void()>;

class DispatchQueue {
 public:
  virtual ~DispatchQueue() = default;

  // Queues `task` and returns at once.
  virtual void async(Task task) = 0;
  // Runs `task` on the queue and returns when it has run. Calling it from
  // the queue itself is a programming error: it aborts with a message.
  virtual void sync(Task task) = 0;
  // Whether the calling thread is currently running a task of this queue
  // (including a task it entered through sync() from another queue's task).
  virtual bool isCurrent() const = 0;
  virtual const std::string& label() const = 0;

  // The queue whose task is running on this thread, or nullptr.
  static DispatchQueue* current();
};

}  // namespace platform

// QV_DCHECK_ON_QUEUE(q): in debug builds, aborts with "must be called on the
// <label> queue" unless the caller runs on queue `q`.
#if defined(QUORVEL_DCHECK_IS_ON)
#define QV_DCHECK_ON_QUEUE(queue) ::platform::detail::checkOnQueue((queue), __FILE__, __LINE__)
#else
#define QV_DCHECK_ON_QUEUE(queue) \
  do {                            \
  } while (0)
#endif

namespace platform::detail {

// Aborts with "must be called on the <label> queue" unless the calling
// thread runs a task of `queue`.
void checkOnQueue(const DispatchQueue& queue, const char* file, int line);

// Whether `queue` is among the queues the calling thread is running a task
// of. A thread that runs a task of A and enters B with B.sync() runs both.
bool isRunningOnQueue(const DispatchQueue& queue);

// Queue implementations: marks the calling thread as running a task of
// `queue` for the scope's lifetime. Scopes nest (innermost is current()).
class ScopedCurrentQueue {
 public:
  explicit ScopedCurrentQueue(DispatchQueue& queue);
  ~ScopedCurrentQueue();
  ScopedCurrentQueue(const ScopedCurrentQueue&) = delete;
  ScopedCurrentQueue& operator=(const ScopedCurrentQueue&) = delete;

 private:
  DispatchQueue* queue_;
  ScopedCurrentQueue* previous_;
  friend DispatchQueue* ::platform::DispatchQueue::current();
  friend bool isRunningOnQueue(const DispatchQueue& queue);
};

}  // namespace platform::detail
