// The checker binds under its own mutex, so two queues that race to the first
// checked use agree on one winner and the loser is reported. A bound queue is
// remembered by address and label: the address is compared with the
// thread's running queues (which include queues entered through sync()), and
// the label, copied at binding, names the queue in the report even if the
// queue is gone by then.
#include "platform/SequenceChecker.h"

#include <fmt/format.h>
#include <fmt/std.h>

#include <cstdio>
#include <cstdlib>

namespace platform {

bool SequenceChecker::isBound() const { return queue_ != nullptr || thread_ != std::thread::id(); }

bool SequenceChecker::calledOnValidSequence() const {
  std::lock_guard lock(mutex_);
  if (!isBound()) {
    if (const DispatchQueue* current = DispatchQueue::current()) {
      queue_ = current;
      queueLabel_ = current->label();
    } else {
      thread_ = std::this_thread::get_id();
    }
    return true;
  }
  if (queue_ != nullptr) return detail::isRunningOnQueue(*queue_);
  return thread_ == std::this_thread::get_id();
}

void SequenceChecker::detachFromSequence() {
  std::lock_guard lock(mutex_);
  queue_ = nullptr;
  queueLabel_.clear();
  thread_ = std::thread::id();
}

std::string SequenceChecker::boundSequenceDescription() const {
  std::lock_guard lock(mutex_);
  if (queue_ != nullptr) return fmt::format("the {} queue", queueLabel_);
  if (thread_ != std::thread::id()) return fmt::format("thread {}", thread_);
  return "no sequence";
}

namespace detail {

void checkCalledOnValidSequence(const SequenceChecker& checker, const char* file, int line) {
  if (checker.calledOnValidSequence()) return;
  const DispatchQueue* current = DispatchQueue::current();
  fmt::print(stderr, "{}:{}: must be called on {} (running on {})\n", file, line,
             checker.boundSequenceDescription(),
             current != nullptr
                 ? fmt::format("the {} queue", current->label())
                 : fmt::format("thread {} outside any queue", std::this_thread::get_id()));
  std::fflush(stderr);
  std::abort();
}

}  // namespace detail
}  // namespace platform
