#include "Quorvel/media/RCAssetMetadataLoader.h"

#include <condition_variable>
#include <deque>
#include <mutex>
#include <thread>

namespace quorvel {

struct RCAssetMetadataLoader::State {
  std::mutex mutex;
  std::condition_variable wake;
  std::deque<Job> jobs;
  std::thread::id worker;
};

RCAssetMetadataLoader& RCAssetMetadataLoader::shared() {
  // Lives until the process ends: its thread may still be waiting for work
  // while static destructors run, so neither is ever torn down.
  static RCAssetMetadataLoader* loader = new RCAssetMetadataLoader();
  return *loader;
}

RCAssetMetadataLoader::RCAssetMetadataLoader() : state_(new State) {
  State* state = state_;
  std::thread thread([state] {
    for (;;) {
      Job job;
      {
        std::unique_lock lock(state->mutex);
        state->wake.wait(lock, [state] { return !state->jobs.empty(); });
        job = std::move(state->jobs.front());
        state->jobs.pop_front();
      }
      job();
    }
  });
  {
    std::lock_guard lock(state->mutex);
    state->worker = thread.get_id();
  }
  thread.detach();
}

void RCAssetMetadataLoader::submit(Job job) {
  {
    std::lock_guard lock(state_->mutex);
    state_->jobs.push_back(std::move(job));
  }
  state_->wake.notify_one();
}

bool RCAssetMetadataLoader::isCurrent() const {
  std::lock_guard lock(state_->mutex);
  return state_->worker == std::this_thread::get_id();
}

}  // namespace quorvel
