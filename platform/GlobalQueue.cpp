// The global queue: a fixed pool of worker threads sharing one FIFO. The pool
// is created on first use and deliberately never destroyed, so tasks queued
// by other static objects' destructors at exit cannot reach a dead queue.
#include "platform/GlobalQueue.h"

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <thread>
#include <vector>

namespace platform {
namespace {

class GlobalQueue final : public DispatchQueue {
 public:
  GlobalQueue() {
    const unsigned count = std::max(2u, std::thread::hardware_concurrency());
    for (unsigned i = 0; i < count; ++i) {
      std::thread([this] { workerLoop(); }).detach();
    }
  }

  void async(Task task) override {
    {
      std::lock_guard lock(mutex_);
      tasks_.push_back(std::move(task));
    }
    wake_.notify_one();
  }

  // A concurrent queue cannot deadlock on itself: the task runs at once on
  // the calling thread, which counts as running on this queue meanwhile.
  void sync(Task task) override {
    detail::ScopedCurrentQueue scope(*this);
    task();
  }

  bool isCurrent() const override { return detail::isRunningOnQueue(*this); }
  const std::string& label() const override { return label_; }

 private:
  void workerLoop() {
    for (;;) {
      Task task;
      {
        std::unique_lock lock(mutex_);
        wake_.wait(lock, [this] { return !tasks_.empty(); });
        task = std::move(tasks_.front());
        tasks_.pop_front();
      }
      detail::ScopedCurrentQueue scope(*this);
      task();
    }
  }

  const std::string label_ = "global";
  std::mutex mutex_;
  std::condition_variable wake_;
  std::deque<Task> tasks_;
};

}  // namespace

DispatchQueue& globalQueue() {
  static GlobalQueue* queue = new GlobalQueue();
  return *queue;
}

}  // namespace platform
