// A media engine for tests that does what the in-process engine does, except
// for the jobs a test overrides (to fail one file, or to hold a job until the
// test lets it go).
#pragma once

#include "Quorvel/media/RCInProcessMediaEngine.h"

namespace quorvel::testing {

class DelegatingMediaEngine : public RCMediaEngine {
 public:
  platform::Result<RCMediaProbe> probe(const platform::URL& url) override {
    return engine_.probe(url);
  }
  platform::Status compose(const std::vector<RCComposerSegment>& segments,
                           const platform::URL& destination,
                           const std::optional<platform::URL>& waveform,
                           const RCMediaProgress& progress) override {
    return engine_.compose(segments, destination, waveform, progress);
  }
  platform::Status buildWaveform(const platform::URL& audio, const platform::URL& destination,
                                 const RCMediaProgress& progress) override {
    return engine_.buildWaveform(audio, destination, progress);
  }
  platform::Status writeTitle(const platform::URL& file, const std::string& title,
                              const std::string& language) override {
    return engine_.writeTitle(file, title, language);
  }

 private:
  RCInProcessMediaEngine engine_;
};

}  // namespace quorvel::testing
