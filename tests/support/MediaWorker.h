// Test support: run the media work of the code under test through the real
// quorvel-media worker built beside the tests, as the daemon does.
#pragma once

#include <memory>
#include <string>

#include "Quorvel/media/RCMediaWorkerClient.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"

namespace quorvel::testing {

// Installs a worker client as the process's media engine until destroyed,
// then the in-process engine again.
class ScopedMediaWorkerEngine {
 public:
  explicit ScopedMediaWorkerEngine(RCMediaWorkerClient::Options options = defaults())
      : client_(std::make_shared<RCMediaWorkerClient>(std::move(options))) {
    RCMediaEngine::setCurrent(client_);
  }
  ~ScopedMediaWorkerEngine() { RCUseInProcessMediaEngine(); }
  ScopedMediaWorkerEngine(const ScopedMediaWorkerEngine&) = delete;
  ScopedMediaWorkerEngine& operator=(const ScopedMediaWorkerEngine&) = delete;

  static RCMediaWorkerClient::Options defaults() {
    return {.workerPath = std::string(QUORVEL_BINARY_DIR) + "/bin/quorvel-media"};
  }
  RCMediaWorkerClient& client() const { return *client_; }

 private:
  std::shared_ptr<RCMediaWorkerClient> client_;
};

}  // namespace quorvel::testing
