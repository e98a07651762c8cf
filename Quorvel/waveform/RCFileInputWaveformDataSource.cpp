#include "Quorvel/waveform/RCFileInputWaveformDataSource.h"

#include <unistd.h>

#include <chrono>
#include <cmath>
#include <limits>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
}

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/media/RCAudioDecoder.h"
#include "Quorvel/waveform/RCWaveformBuilder.h"
#include "Quorvel/waveform/RCWaveformFile.h"
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
  auto opened = RCAudioDecoder::open(avURL_);
  if (!opened) return platform::fail(opened.error());
  RCAudioDecoder& decoder = **opened;
  std::optional<RCWaveformBuilder> builder;
  const bool flushes = saves_ && std::isfinite(flushInterval_) && flushInterval_ >= 0;
  const auto interval = std::chrono::duration_cast<std::chrono::steady_clock::duration>(
      std::chrono::duration<double>(flushes ? flushInterval_ : 0));
  auto nextFlush = std::chrono::steady_clock::now() + interval;
  const std::string name = avURL_.lastPathComponent();

  auto handle = [&](AVFrame* frame) -> platform::Status {
    if (!builder) {
      builder.emplace(frame->sample_rate);
    } else if (frame->sample_rate != builder->waveform().sampleRate()) {
      return platform::fail(
          RCMediaError(RCMediaErrorCodeDecodeFailed, name + " changes its sample rate midway"));
    }
    builder->append(frame);
    if (flushes && std::chrono::steady_clock::now() >= nextFlush) {
      if (auto saved = save(builder->waveform(), partialWaveformURL_); !saved) return saved;
      if (flushHandler_) flushHandler_(builder->waveform());
      nextFlush = std::chrono::steady_clock::now() + interval;
    }
    return {};
  };

  AVPacket* packet = av_packet_alloc();
  if (!packet) throw std::bad_alloc();
  platform::Status status;
  for (;;) {
    if (cancelled_) {
      status = platform::fail(RCMediaError(RCMediaErrorCodeDecodeFailed, "cancelled"));
      break;
    }
    auto more = decoder.readPacket(packet);
    if (!more) {
      status = platform::fail(more.error());
      break;
    }
    status = decoder.decode(*more ? packet : nullptr, handle);
    av_packet_unref(packet);
    if (!status || !*more) break;
  }
  av_packet_free(&packet);
  if (!status) return status;

  if (!builder || builder->framesAppended() == 0)
    return platform::fail(
        RCMediaError(RCMediaErrorCodeDecodeFailed, "no audio could be decoded from " + name));
  const int rate = builder->waveform().sampleRate();
  const double decoded = double(builder->framesAppended()) / rate;
  const double declared = decoder.declaredDurationSeconds();
  // Decoders round up to whole codec frames; anything shorter than the
  // declared duration by more than a few frames is missing audio.
  if (declared > 0 && decoded < declared - std::max(0.05, 4096.0 / rate))
    return platform::fail(RCMediaError(
        RCMediaErrorCodeTruncated,
        fmt::format("{} holds {:.3f}s of audio but declares {:.3f}s", name, decoded, declared)));
  builder->finish();
  waveform_ = builder->waveform();
  return save(waveform_, waveformURL_);
}

}  // namespace quorvel
