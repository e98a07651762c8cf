#include "Quorvel/media/RCMediaEngine.h"

#include <mutex>

#include "Quorvel/errors/RCErrors.h"

namespace quorvel {
namespace {

// The engine of a process that installed none: media work is impossible,
// and says so instead of crashing.
class NoMediaEngine final : public RCMediaEngine {
 public:
  platform::Result<RCMediaProbe> probe(const platform::URL& url) override {
    return platform::fail(missing("read " + url.lastPathComponent()));
  }
  platform::Status compose(const std::vector<RCComposerSegment>&, const platform::URL& destination,
                           const std::optional<platform::URL>&, const RCMediaProgress&) override {
    return platform::fail(missing("compose " + destination.lastPathComponent()));
  }
  platform::Status buildWaveform(const platform::URL& audio, const platform::URL&,
                                 const RCMediaProgress&) override {
    return platform::fail(missing("compute the waveform of " + audio.lastPathComponent()));
  }
  platform::Status writeTitle(const platform::URL& file, const std::string&,
                              const std::string&) override {
    return platform::fail(missing("write the title of " + file.lastPathComponent()));
  }

 private:
  static platform::Error missing(const std::string& what) {
    return RCMediaError(RCMediaErrorCodeWorkerFailed,
                        "cannot " + what + ": this process has no media engine installed");
  }
};

struct Current {
  std::mutex mutex;
  std::shared_ptr<RCMediaEngine> engine;
};

Current& current() {
  static Current* instance = new Current;  // used until the process ends
  return *instance;
}

}  // namespace

std::vector<platform::Result<RCMediaProbe>> RCMediaEngine::probeMany(
    const std::vector<platform::URL>& urls) {
  std::vector<platform::Result<RCMediaProbe>> probes;
  probes.reserve(urls.size());
  for (const platform::URL& url : urls) probes.push_back(probe(url));
  return probes;
}

std::shared_ptr<RCMediaEngine> RCMediaEngine::current() {
  Current& state = quorvel::current();
  std::lock_guard lock(state.mutex);
  if (!state.engine) state.engine = std::make_shared<NoMediaEngine>();
  return state.engine;
}

void RCMediaEngine::setCurrent(std::shared_ptr<RCMediaEngine> engine) {
  Current& state = quorvel::current();
  std::lock_guard lock(state.mutex);
  state.engine = std::move(engine);
}

}  // namespace quorvel
