// The calling thread's queues: a thread-local chain of scopes, one per queue
// whose task the thread is running. A serial queue's sync() runs its task on
// the caller's thread, so a thread in A's task that enters B.sync() holds both
// A and B: checks for A still pass inside B's task, and a sync() back onto A
// (a certain deadlock) is caught as a sync onto the current queue.
#include "platform/DispatchQueue.h"

#include <fmt/format.h>

#include <cstdio>
#include <cstdlib>

#include "platform/Misuse.h"

namespace platform {
namespace {
thread_local detail::ScopedCurrentQueue* tCurrentScope = nullptr;
}  // namespace

DispatchQueue* DispatchQueue::current() {
  return tCurrentScope != nullptr ? tCurrentScope->queue_ : nullptr;
}

namespace detail {

ScopedCurrentQueue::ScopedCurrentQueue(DispatchQueue& queue)
    : queue_(&queue), previous_(tCurrentScope) {
  tCurrentScope = this;
}

ScopedCurrentQueue::~ScopedCurrentQueue() { tCurrentScope = previous_; }

bool isRunningOnQueue(const DispatchQueue& queue) {
  for (const ScopedCurrentQueue* scope = tCurrentScope; scope != nullptr;
       scope = scope->previous_) {
    if (scope->queue_ == &queue) return true;
  }
  return false;
}

void checkOnQueue(const DispatchQueue& queue, const char* file, int line) {
  if (queue.isCurrent()) return;
  const DispatchQueue* current = DispatchQueue::current();
  misuse(file, line,
         fmt::format("must be called on the {} queue (running on {})", queue.label(),
                     current != nullptr ? current->label() : std::string("no queue")));
}

}  // namespace detail
}  // namespace platform
