// SerialQueue: tasks run one at a time, FIFO. The owner destroys it;
// destruction runs the tasks already queued, then joins the worker (never
// destroy a queue from its own thread).
//
// The worker thread exists only while asynchronous work is queued (and for a
// second after, in case more comes): a queue entered only with sync() costs
// no thread.
//
// sync() waits for its turn in the FIFO, then runs the task on the calling
// thread while the worker holds off; meanwhile the caller counts as running
// on this queue (and still on any queue it was already running on). A sync
// onto a queue the caller is running on aborts: it could never get its turn.
// Every member may be called from any thread.
//
// An event loop may run the work its deliveries queue itself (see
// AdoptionScope), which spares a busy daemon two thread switches per request.
#pragma once

#include <memory>
#include <mutex>
#include <string>

#include "platform/DispatchQueue.h"

namespace platform {

class SerialQueue final : public DispatchQueue {
 public:
  explicit SerialQueue(std::string label);
  ~SerialQueue() override;
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  void async(Task task) override;
  // Like async(), but the task runs on the queue's own worker thread, never
  // on a thread that adopted the queue: for work that may take long, which
  // would hold up an adopting event loop. FIFO order with the other tasks
  // holds; an adopted run that reaches the task hands the queue to the worker.
  void asyncOnWorker(Task task);
  void sync(Task task) override;
  bool isCurrent() const override;
  const std::string& label() const override;

  // While an AdoptionScope exists on a thread, an async() from that thread
  // onto an idle serial queue (no task running, nothing queued) leaves the
  // queue's worker asleep: the thread adopts the queue, and when the scope
  // ends it runs the queue's tasks itself, as the worker would, one at a time
  // in FIFO order, until the queue is empty, a sync() caller's turn comes, or
  // kAdoptedRunBudget has passed (the rest then goes to the worker). Tasks
  // queued meanwhile by other threads wait for it as they would for the
  // worker's current task. A sync() onto an adopted queue from the adopting
  // thread first runs what the queue holds; a sync() from it that has to
  // wait for another thread first hands its adopted queues to their workers.
  //
  // Meant for an event loop around each delivery: the work a delivered
  // message queues then runs right after it on the loop's thread, which
  // keeps the loop from reading the next message meanwhile, so only loops
  // whose queued work is short should use it (queue long work with
  // asyncOnWorker()). Scopes do not nest; create it on the stack, outside
  // every task.
  class AdoptionScope {
   public:
    AdoptionScope();
    ~AdoptionScope();
    AdoptionScope(const AdoptionScope&) = delete;
    AdoptionScope& operator=(const AdoptionScope&) = delete;
  };
  static constexpr Duration kAdoptedRunBudget = std::chrono::milliseconds(2);

 private:
  struct State;
  void enqueue(Task task, bool workerOnly);
  // The worker's loop; it returns once the queue has been idle a while.
  void workerLoop();
  // Wakes the worker, starting one if none runs. Called with the queue's
  // mutex held through `lock`.
  void wakeWorker(std::unique_lock<std::mutex>& lock);
  // Ends an adopted run: the queue is no longer owned, and the worker is
  // woken if work is left or the queue is stopping. Called with the queue's
  // mutex held through `lock`.
  void giveBackToWorker(std::unique_lock<std::mutex>& lock);
  // Runs an adopted queue's tasks on the calling thread (see AdoptionScope).
  static void runAdopted(SerialQueue& queue);
  // Gives every queue the calling thread has adopted back to its worker.
  static void handOffAdopted();
  std::unique_ptr<State> state_;
};

}  // namespace platform
