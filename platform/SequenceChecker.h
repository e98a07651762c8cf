// SequenceChecker: states in debug builds that an object is used from one
// sequence only. A class holds one as a member and checks it, through
// QV_DCHECK_CALLED_ON_VALID_SEQUENCE, in every method that its header says
// runs on the object's queue. The checker binds to the caller's queue
// (DispatchQueue::current(), or the calling thread when no queue runs) on its
// first checked use, so the owner need not know the queue when it is made;
// detachFromSequence() lets the next checked use bind it afresh (an object
// made on one queue and handed to another).
//
// A queue counts as the caller's while the caller runs one of its tasks,
// including a task entered with sync() from another queue's task: a thread
// inside A's task that runs B.sync() is on both A and B.
//
// Use QV_DCHECK_ON_QUEUE (DispatchQueue.h) instead when the queue is known
// and fixed. Every member may be called from any thread; the checker costs
// nothing but its size when the checks are off.
#pragma once

#include <mutex>
#include <string>
#include <thread>

#include "platform/DispatchQueue.h"

namespace platform {

class SequenceChecker {
 public:
  SequenceChecker() = default;
  SequenceChecker(const SequenceChecker&) = delete;
  SequenceChecker& operator=(const SequenceChecker&) = delete;

  // True when the caller runs on the bound sequence; binds the checker to the
  // caller's sequence when it is not bound yet.
  bool calledOnValidSequence() const;
  // Unbinds: the next checked use binds again.
  void detachFromSequence();
  // "the <label> queue", "thread <id>", or "no sequence" when unbound.
  std::string boundSequenceDescription() const;

 private:
  bool isBound() const;

  mutable std::mutex mutex_;  // guards the fields below
  // The bound queue (compared by address only, never used), or nullptr when
  // bound to a thread or unbound.
  mutable const DispatchQueue* queue_ = nullptr;
  mutable std::string queueLabel_;
  mutable std::thread::id thread_;  // bound to a thread when not default
};

}  // namespace platform

// QV_DCHECK_CALLED_ON_VALID_SEQUENCE(checker): with debug checks on, aborts
// with "must be called on the <label> queue" (or "on thread <id>") unless
// the caller runs on the sequence `checker` is bound to; binds it first when
// it is unbound. Does nothing when the checks are off.
#if defined(QUORVEL_DCHECK_IS_ON)
#define QV_DCHECK_CALLED_ON_VALID_SEQUENCE(checker) \
  ::platform::detail::checkCalledOnValidSequence((checker), __FILE__, __LINE__)
#else
#define QV_DCHECK_CALLED_ON_VALID_SEQUENCE(checker) \
  do {                                              \
  } while (0)
#endif

namespace platform::detail {

// Aborts with a message naming the bound sequence unless
// checker.calledOnValidSequence().
void checkCalledOnValidSequence(const SequenceChecker& checker, const char* file, int line);

}  // namespace platform::detail
