// SerialQueue: one worker thread running tasks one at a time, FIFO. The
// owner destroys it; destruction runs the tasks already queued, then joins
// the thread (never destroy a queue from its own thread).
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
