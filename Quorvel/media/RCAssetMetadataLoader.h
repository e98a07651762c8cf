// RCAssetMetadataLoader: the worker that loads audio asset metadata. One per
// process, created on first use and never destroyed; it owns one thread that
// runs the submitted jobs one at a time, in order. Jobs never need any other
// queue, so a caller may block on a job's result from any queue (the service
// serial queue included) without deadlock.
//
// submit() may be called from any thread, including from inside a job.
#pragma once

#include <functional>

namespace quorvel {

class RCAssetMetadataLoader {
 public:
  using Job = std::move_only_function<void()>;
  static RCAssetMetadataLoader& shared();
  void submit(Job job);
  // Whether the calling thread is the loader's worker.
  bool isCurrent() const;

 private:
  RCAssetMetadataLoader();
  struct State;
  State* state_;
};

}  // namespace quorvel
