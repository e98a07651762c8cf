// SerialQueue: one worker thread running tasks one at a time, FIFO. The
// owner destroys it; destruction runs the tasks already queued, then joins
// the thread (never destroy a queue from its own thread).
//
// sync() waits for its turn in the FIFO, then runs the task on the calling
// thread while the worker holds off; meanwhile the caller counts as running
// on this queue (and still on any queue it was already running on). A sync
// onto a queue the caller is running on aborts: it could never get its turn.
// Every member may be called from any thread.
#pragma once

#include <memory>
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
  void sync(Task task) override;
  bool isCurrent() const override;
  const std::string& label() const override;

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace platform
