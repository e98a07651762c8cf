// RCMediaWorkerClient: the media engine of the daemon. It runs every job in a
// quorvel-media worker process, so no audio file is parsed inside the daemon
// and a decoder that crashes or hangs costs one job, never the daemon.
//
// A small pool: at most `maxWorkers` workers, each running one job at a time
// and many jobs over its life; a job waits for a free worker when all are
// busy. Workers are started on the first job that needs one, over a socket
// pair whose end the worker inherits; a worker exits by itself after
// `idleExitAfter` without a job, and every worker dies with the daemon (the
// kernel's parent-death signal, and the end of file on its socket).
//
// A worker that dies during a job (a signal, an address-space limit, an exit)
// fails that job with an error naming the signal and the file; a job that
// reports no progress for `noProgressTimeout` has its worker killed the same
// way. The next job gets a fresh worker. When the worker binary cannot be
// started every job fails with an error saying so.
//
// Owned through std::shared_ptr (RCMediaEngine::current()); every member may
// be called from any thread, jobs from several threads at once. It must not
// be destroyed while a job runs (jobs hold the shared reference); destroying
// it ends its idle workers.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "Quorvel/media/RCMediaEngine.h"
#include "Quorvel/media/RCMediaProtocol.h"

namespace quorvel {

class RCMediaWorkerClient final : public RCMediaEngine {
 public:
  struct Options {
    // The worker executable; empty for defaultWorkerPath().
    std::string workerPath;
    std::chrono::duration<double> idleExitAfter{30};
    std::chrono::duration<double> noProgressTimeout{60};
    std::size_t maxWorkers = 2;
    // Directories the worker may read and write besides the recordings
    // directory (which is the one a worker gets when it starts).
    std::vector<std::string> extraSandboxDirectories;
  };

  // $QUORVEL_MEDIA_WORKER when set; else quorvel-media beside the running
  // executable, or in ../libexec/quorvel/ from it when only that exists.
  static std::string defaultWorkerPath();

  RCMediaWorkerClient();
  explicit RCMediaWorkerClient(Options options);
  ~RCMediaWorkerClient() override;
  RCMediaWorkerClient(const RCMediaWorkerClient&) = delete;
  RCMediaWorkerClient& operator=(const RCMediaWorkerClient&) = delete;

  platform::Result<RCMediaProbe> probe(const platform::URL& url) override;
  platform::Status compose(const std::vector<RCComposerSegment>& segments,
                           const platform::URL& destination,
                           const std::optional<platform::URL>& waveformDestination,
                           const RCMediaProgress& progress) override;
  platform::Status buildWaveform(const platform::URL& audio, const platform::URL& destination,
                                 const RCMediaProgress& progress) override;
  platform::Status writeTitle(const platform::URL& file, const std::string& title,
                              const std::string& language) override;

  // For tests: the process ids of the workers alive now (busy or idle).
  std::vector<pid_t> workerPids() const;
  // For tests: called on the job's thread right after a request has been
  // sent to the worker `pid`.
  using JobObserver = std::function<void(pid_t pid, RCMediaJobKind kind)>;
  void setJobObserverForTesting(JobObserver observer);

 private:
  struct Worker;
  platform::Result<RCMediaReply> run(RCMediaRequest request, const std::string& doing,
                                     const RCMediaProgress& progress);
  platform::Result<std::unique_ptr<Worker>> acquire();
  void release(std::unique_ptr<Worker> worker);
  void discard(std::unique_ptr<Worker> worker);
  platform::Result<std::unique_ptr<Worker>> spawn();

  const Options options_;
  const std::string workerPath_;
  mutable std::mutex mutex_;
  std::condition_variable available_;
  std::vector<std::unique_ptr<Worker>> idle_;  // guarded by mutex_
  std::vector<pid_t> pids_;                    // guarded by mutex_: every live worker
  std::size_t starting_ = 0;                   // guarded by mutex_: spawns under way
  std::uint64_t nextId_ = 1;                   // guarded by mutex_
  JobObserver observer_;                       // guarded by mutex_
};

}  // namespace quorvel
