// RCInProcessMediaEngine: the media engine that does the work on the calling
// thread with FFmpeg and the framework's own MP4 atom code. Apps, tools and
// tests install it (RCUseInProcessMediaEngine); the media worker runs its jobs
// with it. Stateless: every member may be called from any thread, several
// jobs at a time.
#pragma once

#include <memory>

#include "Quorvel/media/RCMediaEngine.h"

namespace quorvel {

class RCInProcessMediaEngine final : public RCMediaEngine {
 public:
  platform::Result<RCMediaProbe> probe(const platform::URL& url) override;
  platform::Status compose(const std::vector<RCComposerSegment>& segments,
                           const platform::URL& destination,
                           const std::optional<platform::URL>& waveformDestination,
                           const RCMediaProgress& progress) override;
  platform::Status buildWaveform(const platform::URL& audio, const platform::URL& destination,
                                 const RCMediaProgress& progress) override;
  platform::Status writeTitle(const platform::URL& file, const std::string& title,
                              const std::string& language) override;
};

// Installs an RCInProcessMediaEngine as the process's current engine.
void RCUseInProcessMediaEngine();

}  // namespace quorvel
