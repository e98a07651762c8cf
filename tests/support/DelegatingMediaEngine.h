// A media engine for tests that does what an inner engine does (the
// in-process one unless given another), except for the jobs a test overrides
// (to fail one file, or to hold a job until the test lets it go). Batches go
// through probe(), so an overridden probe sees every file.
#pragma once

#include <memory>

#include "QuorvelMedia/RCInProcessMediaEngine.h"

namespace quorvel::testing {

class DelegatingMediaEngine : public RCMediaEngine {
 public:
  explicit DelegatingMediaEngine(
      std::shared_ptr<RCMediaEngine> inner = std::make_shared<RCInProcessMediaEngine>())
      : engine_(std::move(inner)) {}
  platform::Result<RCMediaProbe> probe(const platform::URL& url) override {
    return engine_->probe(url);
  }
  platform::Status compose(const std::vector<RCComposerSegment>& segments,
                           const platform::URL& destination,
                           const std::optional<platform::URL>& waveform,
                           const RCMediaProgress& progress) override {
    return engine_->compose(segments, destination, waveform, progress);
  }
  platform::Status buildWaveform(const platform::URL& audio, const platform::URL& destination,
                                 const RCMediaProgress& progress) override {
    return engine_->buildWaveform(audio, destination, progress);
  }
  platform::Status writeTitle(const platform::URL& file, const std::string& title,
                              const std::string& language) override {
    return engine_->writeTitle(file, title, language);
  }

 private:
  std::shared_ptr<RCMediaEngine> engine_;
};

}  // namespace quorvel::testing
