// MainQueue: the main thread's run loop. Tasks and timers queued from any
// thread run on whichever thread calls run() (the main thread in quorveld).
// Timers read the queue's Clock, so tests drive them with a ManualClock.
// One process-wide instance, mainQueue(); tests may build their own.
#pragma once

#include <cstddef>
#include <memory>
#include <string>

#include "platform/Clock.h"
#include "platform/DispatchQueue.h"

namespace platform {

class MainQueue final : public DispatchQueue {
 public:
  // `clock` must outlive the queue.
  explicit MainQueue(Clock& clock = SystemClock::instance(), std::string label = "main");
  // Drops whatever tasks and timers have not run. Not from its own tasks.
  ~MainQueue() override;
  MainQueue(const MainQueue&) = delete;
  MainQueue& operator=(const MainQueue&) = delete;

  void async(Task task) override;
  // Queued on the run loop, which runs it on its own thread; returns once it
  // has run. Aborts when called from this queue's own task (a deadlock).
  void sync(Task task) override;
  bool isCurrent() const override;
  const std::string& label() const override;

  // Runs `task` on this queue once `delay` has passed on the clock (at the
  // next turn when `delay` <= 0). Timers with the same deadline run in the
  // order they were scheduled.
  void after(Duration delay, Task task);

  // Services tasks and timers on the calling thread until stop() is called
  // (from any thread, or from a task). A stop() that comes while run() is not
  // running makes the next run() return at once.
  void run();
  void stop();

  // Tests: runs every task that is ready (and every timer that is due by the
  // clock) on the calling thread, until none is left, including those that
  // the tasks queue meanwhile. Returns how many ran.
  std::size_t runUntilIdle();
  // Tasks queued and timers pending (due or not).
  std::size_t pendingCount() const;

  Clock& clock() const;

 private:
  struct State;
  std::shared_ptr<State> state_;  // shared with the clock's observer
};

// The process's main queue (system clock), serviced by run() in main().
MainQueue& mainQueue();
// Tests: makes mainQueue() return `queue` (a queue on a ManualClock, say)
// until called again with nullptr. Set it before the code under test runs.
void setMainQueueForTesting(MainQueue* queue);

}  // namespace platform
