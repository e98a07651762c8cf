// The global queue: a pool of worker threads sharing one FIFO. A worker is
// started when a task finds none idle (up to one per core, at least two) and
// ends after a second without work, so an idle process has none. The queue is
// created on first use and deliberately never destroyed, so tasks queued by
// other static objects' destructors at exit cannot reach a dead queue.
#include "platform/GlobalQueue.h"

#include <pthread.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <thread>
#include <vector>

namespace platform {
namespace {

class GlobalQueue final : public DispatchQueue {
 public:
  void async(Task task) override {
    bool start = false;
    {
      std::lock_guard lock(mutex_);
      tasks_.push_back(std::move(task));
      if (idle_ < tasks_.size() && workers_ < maxWorkers_) {
        ++workers_;
        start = true;
      }
    }
    if (start) {
      std::thread([this] { workerLoop(); }).detach();
    } else {
      wake_.notify_one();
    }
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
    pthread_setname_np(pthread_self(), "global");
    for (;;) {
      Task task;
      {
        std::unique_lock lock(mutex_);
        ++idle_;
        const bool woken = wake_.wait_for(lock, kLinger, [this] { return !tasks_.empty(); });
        --idle_;
        if (!woken) {
          --workers_;
          return;
        }
        task = std::move(tasks_.front());
        tasks_.pop_front();
      }
      detail::ScopedCurrentQueue scope(*this);
      task();
    }
  }

  static constexpr auto kLinger = std::chrono::seconds(1);
  const std::string label_ = "global";
  const std::size_t maxWorkers_ = std::max(2u, std::thread::hardware_concurrency());
  std::mutex mutex_;  // guards the fields below
  std::condition_variable wake_;
  std::deque<Task> tasks_;
  std::size_t workers_ = 0;  // started and not yet ended
  std::size_t idle_ = 0;     // of those, waiting for a task
};

}  // namespace

DispatchQueue& globalQueue() {
  static GlobalQueue* queue = new GlobalQueue();
  return *queue;
}

}  // namespace platform
