// Operation: the phase, the dependency count and the finish observers, under
// the operation's own mutex. A dependent registers a finish observer on each
// dependency (holding itself weakly); when a dependency finishes, the count
// drops, and the one that brings it to zero tells the dependent's queue.
// Lock order: a queue's mutex may be held while taking an operation's mutex,
// never the other way round, and no observer or block runs under a mutex.
#include "platform/Operation.h"

#include <cxxabi.h>
#include <fmt/format.h>

#include <cstdio>
#include <cstdlib>
#include <typeinfo>

#include "platform/Misuse.h"
#include "platform/OperationQueue.h"

namespace platform {
namespace {}  // namespace

Operation::Operation() = default;
Operation::~Operation() = default;

void Operation::addDependency(std::shared_ptr<Operation> dependency) {
  if (!dependency) return;
  QV_MISUSE(dependency.get() == this, "an operation cannot depend on itself");
  std::weak_ptr<Operation> self = weak_from_this();
  QV_MISUSE(self.expired(), "an operation must be owned by a std::shared_ptr");
  {
    std::lock_guard lock(mutex_);
    QV_MISUSE(phase_ != Phase::Pending, "dependency added after the operation started");
    dependencies_.push_back(dependency);
    ++unfinishedDependencies_;
  }
  const bool pending = dependency->addFinishObserver([self] {
    if (auto operation = self.lock()) operation->dependencyFinished();
  });
  if (!pending) dependencyFinished();
}

std::vector<std::shared_ptr<Operation>> Operation::dependencies() const {
  std::lock_guard lock(mutex_);
  return dependencies_;
}

bool Operation::isReady() const {
  std::lock_guard lock(mutex_);
  return phase_ == Phase::Pending && unfinishedDependencies_ == 0;
}

bool Operation::isExecuting() const {
  std::lock_guard lock(mutex_);
  return phase_ == Phase::Executing;
}

bool Operation::isFinished() const {
  std::lock_guard lock(mutex_);
  return phase_ == Phase::Finished;
}

void Operation::setCompletionBlock(std::move_only_function<void()> block) {
  std::lock_guard lock(mutex_);
  completionBlock_ = std::move(block);
}

std::string Operation::description() const {
  const char* mangled = typeid(*this).name();
  int status = 0;
  char* demangled = abi::__cxa_demangle(mangled, nullptr, nullptr, &status);
  std::string name = status == 0 && demangled != nullptr ? demangled : mangled;
  std::free(demangled);
  // Drop namespaces, but not inside template arguments.
  const std::size_t angle = name.find('<');
  const std::size_t colon = name.rfind("::", angle);
  if (colon != std::string::npos) name.erase(0, colon + 2);
  return fmt::format("<{}: {}>", name, static_cast<const void*>(this));
}

bool Operation::addFinishObserver(std::move_only_function<void()> onFinished) {
  std::lock_guard lock(mutex_);
  if (phase_ == Phase::Finished) return false;
  finishObservers_.push_back(std::move(onFinished));
  return true;
}

void Operation::dependencyFinished() {
  std::shared_ptr<detail::OperationQueueState> queue;
  {
    std::lock_guard lock(mutex_);
    if (--unfinishedDependencies_ == 0 && phase_ == Phase::Pending) queue = queue_.lock();
  }
  if (queue) detail::operationBecameReady(*queue);
}

void Operation::runOnWorker() {
  main();
  std::vector<std::move_only_function<void()>> observers;
  std::move_only_function<void()> completion;
  {
    std::lock_guard lock(mutex_);
    phase_ = Phase::Finished;
    observers.swap(finishObservers_);
    completion = std::move(completionBlock_);
    completionBlock_ = nullptr;
  }
  for (auto& observer : observers) observer();
  if (completion) completion();
}

}  // namespace platform
