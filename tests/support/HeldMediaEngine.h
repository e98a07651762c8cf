// HeldMediaEngine: the in-process media engine, except that the jobs a test
// picks wait inside until the test opens the gate, so the test sees work
// under way instead of racing it. Counts the jobs that came in and how many
// were inside at once. Any thread.
#pragma once

#include <algorithm>
#include <functional>
#include <string>
#include <string_view>

#include "tests/support/DelegatingMediaEngine.h"
#include "tests/support/Gate.h"

namespace quorvel::testing {

class HeldMediaEngine : public DelegatingMediaEngine {
 public:
  // Whether a job ("probe", "compose" or "waveform") on `path` waits; all do
  // by default. Set it before the engine is used.
  std::function<bool(std::string_view job, const std::string& path)> holds =
      [](std::string_view, const std::string&) { return true; };

  platform::Result<RCMediaProbe> probe(const platform::URL& url) override {
    Inside inside(*this, "probe", url);
    return DelegatingMediaEngine::probe(url);
  }
  platform::Status compose(const std::vector<RCComposerSegment>& segments,
                           const platform::URL& destination,
                           const std::optional<platform::URL>& waveform,
                           const RCMediaProgress& progress) override {
    Inside inside(*this, "compose", destination);
    return DelegatingMediaEngine::compose(segments, destination, waveform, progress);
  }
  platform::Status buildWaveform(const platform::URL& audio, const platform::URL& destination,
                                 const RCMediaProgress& progress) override {
    Inside inside(*this, "waveform", destination);
    return DelegatingMediaEngine::buildWaveform(audio, destination, progress);
  }

  void open() {
    gate_.update([&] { open_ = true; });
  }
  // Waits until `count` held jobs are inside at once.
  bool waitForInside(int count) {
    return gate_.waitUntil([&] { return inside_ >= count; });
  }
  int came() { return platform::testing::readLocked(gate_.mutex(), came_); }
  int mostInside() { return platform::testing::readLocked(gate_.mutex(), mostInside_); }

 private:
  // Counts a held job in and, once the gate is open, out.
  struct Inside {
    Inside(HeldMediaEngine& engine, std::string_view job, const platform::URL& url)
        : engine(engine), held(engine.holds(job, url.path())) {
      if (!held) return;
      engine.gate_.update([&] {
        ++engine.came_;
        engine.mostInside_ = std::max(engine.mostInside_, ++engine.inside_);
      });
      engine.gate_.waitUntil([&] { return engine.open_; });
    }
    ~Inside() {
      if (held) engine.gate_.update([&] { --engine.inside_; });
    }
    HeldMediaEngine& engine;
    const bool held;
  };

  platform::testing::Gate gate_;
  bool open_ = false;  // the fields are guarded by gate_
  int came_ = 0, inside_ = 0, mostInside_ = 0;
};

}  // namespace quorvel::testing
