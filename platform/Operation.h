// Operation: one unit of work run once by an OperationQueue. Subclasses
// override main(); the daemon's export operations do so and block in it.
//
// An operation is owned by std::shared_ptr: its queue, its dependents and
// whoever created it share it. It starts only once every dependency has
// finished; dependencies may be added until it starts (a dependency may sit
// in the same queue or another, be added to a queue later, or be finished
// already). The completion block runs exactly once, on the worker thread
// that ran main(), after isFinished() has turned true.
//
// Every member may be called from any thread.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace platform {

namespace detail {
struct OperationQueueState;
}  // namespace detail

class Operation : public std::enable_shared_from_this<Operation> {
 public:
  Operation();
  virtual ~Operation();
  Operation(const Operation&) = delete;
  Operation& operator=(const Operation&) = delete;

  // The work; runs once on a worker thread of the queue. The base does
  // nothing.
  virtual void main() {}

  // Makes this operation wait for `dependency` to finish. Only before this
  // operation starts; the operation keeps its dependencies alive.
  void addDependency(std::shared_ptr<Operation> dependency);
  // The dependencies in the order they were added.
  std::vector<std::shared_ptr<Operation>> dependencies() const;

  // Every dependency has finished (and the operation has not started).
  bool isReady() const;
  bool isExecuting() const;
  bool isFinished() const;

  // Runs once after the operation finished. Set it before the operation
  // finishes; setting it again replaces the earlier one.
  void setCompletionBlock(std::move_only_function<void()> block);

  // "<ClassName: 0x...>": the dynamic class (without namespaces) and address.
  virtual std::string description() const;

 private:
  friend class OperationQueue;
  friend struct detail::OperationQueueState;
  enum class Phase { Pending, Executing, Finished };

  // Registers `onFinished` to run when this operation finishes; returns
  // false (and drops it) when it has already finished.
  bool addFinishObserver(std::move_only_function<void()> onFinished);
  void dependencyFinished();
  // The queue's worker: runs main(), then the finish observers, then the
  // completion block.
  void runOnWorker();

  mutable std::mutex mutex_;
  Phase phase_ = Phase::Pending;
  int unfinishedDependencies_ = 0;
  std::vector<std::shared_ptr<Operation>> dependencies_;
  std::vector<std::move_only_function<void()>> finishObservers_;
  std::move_only_function<void()> completionBlock_;
  std::weak_ptr<detail::OperationQueueState> queue_;
  bool queued_ = false;
};

// An operation that runs a function.
class BlockOperation : public Operation {
 public:
  explicit BlockOperation(std::move_only_function<void()> block) : block_(std::move(block)) {}
  void main() override {
    if (block_) block_();
  }

 private:
  std::move_only_function<void()> block_;
};

}  // namespace platform
