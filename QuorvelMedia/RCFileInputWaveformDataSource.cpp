#include "QuorvelMedia/RCFileInputWaveformDataSource.h"

#include <unistd.h>

#include <chrono>
#include <cmath>

#include "Quorvel/waveform/RCWaveformFile.h"
#include "QuorvelMedia/RCWaveformBuilder.h"
#include "QuorvelMedia/RCWaveformDecoding.h"
#include "platform/Log.h"

namespace quorvel {

RCFileInputWaveformDataSource::RCFileInputWaveformDataSource(const platform::URL& avURL,
                                                             bool savesGeneratedWaveform,
                                                             double segmentFlushInterval)
    : avURL_(avURL),
      waveformURL_(RCWaveform::waveformURLForAVURL(avURL)),
      partialWaveformURL_(platform::URL::fileURLWithPath(waveformURL_.path() + ".partial")),
      saves_(savesGeneratedWaveform),
      flushInterval_(segmentFlushInterval) {}

RCFileInputWaveformDataSource::~RCFileInputWaveformDataSource() {
  cancelled_ = true;
  if (thread_.joinable()) thread_.join();
}

void RCFileInputWaveformDataSource::setFlushHandler(FlushHandler handler) {
  std::lock_guard lock(mutex_);
  if (!began_) flushHandler_ = std::move(handler);
}

void RCFileInputWaveformDataSource::beginLoading() {
  std::lock_guard lock(mutex_);
  if (began_) return;
  began_ = true;
  thread_ = std::thread([this] { load(); });
}

bool RCFileInputWaveformDataSource::waitUntilFinished() {
  std::unique_lock lock(mutex_);
  if (!began_) return false;
  finishedCondition_.wait(lock, [this] { return finished_; });
  return succeeded_;
}

void RCFileInputWaveformDataSource::load() {
  QV_LOG(platform::kLogLevelDebug, "Computing the waveform of {}", avURL_.lastPathComponent());
  auto status = generate();
  if (saves_) ::unlink(partialWaveformURL_.path().c_str());
  if (!status && cancelled_) {
    QV_LOG(platform::kLogLevelDebug, "Stopped computing the waveform of {}",
           avURL_.lastPathComponent());
    error_ = status.error();
  } else if (!status) {
    QV_LOG(platform::kLogLevelError, "ERROR: Computing the waveform of {} failed: {}",
           avURL_.lastPathComponent(), status.error());
    error_ = status.error();
  } else {
    QV_LOG(platform::kLogLevelDebug, "Computed the waveform of {}: {} pixels",
           avURL_.lastPathComponent(), waveform_.length());
  }
  std::lock_guard lock(mutex_);
  succeeded_ = status.has_value();
  finished_ = true;
  finishedCondition_.notify_all();
}

platform::Status RCFileInputWaveformDataSource::save(const RCWaveform& waveform,
                                                     const platform::URL& destination) {
  if (!saves_) return {};
  return RCWriteWaveformFile(waveform, destination);
}

platform::Status RCFileInputWaveformDataSource::generate() {
  const bool flushes = saves_ && std::isfinite(flushInterval_) && flushInterval_ >= 0;
  const auto interval = std::chrono::duration_cast<std::chrono::steady_clock::duration>(
      std::chrono::duration<double>(flushes ? flushInterval_ : 0));
  auto nextFlush = std::chrono::steady_clock::now() + interval;
  RCWaveformDecoding decoding{.cancelled = [this] { return cancelled_.load(); }};
  if (flushes) {
    decoding.onFrame = [&](const RCWaveformBuilder& builder, double) -> platform::Status {
      if (std::chrono::steady_clock::now() < nextFlush) return {};
      if (auto saved = save(builder.waveform(), partialWaveformURL_); !saved) return saved;
      if (flushHandler_) flushHandler_(builder.waveform());
      nextFlush = std::chrono::steady_clock::now() + interval;
      return {};
    };
  }
  auto waveform = RCDecodeWaveform(avURL_, decoding);
  if (!waveform) return platform::fail(waveform.error());
  waveform_ = std::move(*waveform);
  return save(waveform_, waveformURL_);
}

}  // namespace quorvel
