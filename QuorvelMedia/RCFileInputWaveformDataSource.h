// RCFileInputWaveformDataSource: computes the waveform of an audio file by
// decoding it on a thread of its own, and (when asked to save) writes the
// recording's waveform file (RCWaveform::waveformURLForAVURL) once, whole, at
// the end. While it decodes, every `segmentFlushInterval` seconds of wall
// clock the pixels computed so far replace a side file beside it
// (partialWaveformURL), so a long recording is saved a bounded number of
// times and a crash never leaves a truncated waveform under the real name.
// Every replacement is atomic (temporary file, fsync, rename).
//
// A file that cannot be opened or decoded, holds no audio, or ends before the
// duration it declares makes the generation fail. The side file is removed
// when the generation ends, however it ends.
//
// Owned by its creator. beginLoading() and waitUntilFinished() may be called
// from any thread (typically the same one); waveform() and error() only after
// waitUntilFinished() has returned. The flush handler runs on the loading
// thread. Destroying the source while it loads stops the work and waits for
// the thread.
#pragma once

#include <atomic>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <optional>
#include <thread>

#include "Quorvel/waveform/RCWaveform.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

class RCFileInputWaveformDataSource {
 public:
  RCFileInputWaveformDataSource(const platform::URL& avURL, bool savesGeneratedWaveform,
                                double segmentFlushInterval);
  ~RCFileInputWaveformDataSource();
  RCFileInputWaveformDataSource(const RCFileInputWaveformDataSource&) = delete;
  RCFileInputWaveformDataSource& operator=(const RCFileInputWaveformDataSource&) = delete;

  const platform::URL& avURL() const { return avURL_; }
  const platform::URL& waveformURL() const { return waveformURL_; }
  // "<name>.waveform.partial", beside the waveform file.
  const platform::URL& partialWaveformURL() const { return partialWaveformURL_; }

  // Called on the loading thread right after each intermediate save, with the
  // waveform just written to the side file (which stays as written until the
  // handler returns).
  // Set it before beginLoading().
  using FlushHandler = std::function<void(const RCWaveform& saved)>;
  void setFlushHandler(FlushHandler handler);

  // Starts decoding on a new thread. Later calls do nothing.
  void beginLoading();
  // Blocks, without a time limit, until generation has ended (saving included).
  // Returns whether it succeeded; false at once if loading never began.
  bool waitUntilFinished();

  // After waitUntilFinished(): the complete waveform, or the error of a failure.
  const RCWaveform& waveform() const { return waveform_; }
  const std::optional<platform::Error>& error() const { return error_; }

 private:
  void load();
  platform::Status generate();
  platform::Status save(const RCWaveform& waveform, const platform::URL& destination);

  const platform::URL avURL_;
  const platform::URL waveformURL_;
  const platform::URL partialWaveformURL_;
  const bool saves_;
  const double flushInterval_;
  FlushHandler flushHandler_;

  std::thread thread_;
  std::atomic<bool> cancelled_{false};
  std::mutex mutex_;
  std::condition_variable finishedCondition_;
  bool began_ = false;      // guarded by mutex_
  bool finished_ = false;   // guarded by mutex_
  bool succeeded_ = false;  // guarded by mutex_

  // Written by the loading thread before finished_ is set; read after.
  RCWaveform waveform_;
  std::optional<platform::Error> error_;
};

}  // namespace quorvel
