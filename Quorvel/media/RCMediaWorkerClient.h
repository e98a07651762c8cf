// RCMediaWorkerClient: the media engine of the daemon. It runs every job in a
// quorvel-media worker process, so no audio file is parsed inside the daemon
// and a decoder that crashes or hangs costs one job, never the daemon.
//
// Two small pools of the same worker program, one per lane: the short lane
// runs probes (single and batched), at most `maxShortWorkers` workers; the
// long lane runs composes, waveforms and title writes, at most `maxWorkers`
// workers, started at a lower CPU priority (nice +10; the .cpp says how).
// Each worker runs one job at a time and many jobs over its life; a job
// waits only for a free worker of its own lane. Workers are started on the
// first job that needs one, over a socket pair whose end the worker
// inherits; a worker exits by itself after `idleExitAfter` without a job,
// and every worker dies with the daemon (the kernel's parent-death signal,
// and the end of file on its socket).
//
// A worker that dies during a job (a signal, an address-space limit, an exit)
// fails that job with an error naming the signal and the file; a job that
// reports no progress for `noProgressTimeout` has its worker killed the same
// way. The next job gets a fresh worker. When the worker binary cannot be
// started every job fails with an error saying so.
//
// Why probes get workers of their own beyond the two that compose, rather
// than one of those two: a probe takes milliseconds and callers wait on it
// (the service queue's repairs, the orphan recovery, metadata for a client),
// while a compose takes seconds to minutes. Reserving one of two workers for
// probes would halve composing for good, and a reserved worker lent to a
// compose while idle would be busy exactly when a probe comes. Extra probe
// workers cost little: they are idle most of the time and leave after
// `idleExitAfter`. The long lane's lower priority keeps two encoding
// composes on a two-core machine from starving the daemon and its probes,
// so a probe that no longer queues behind a compose also gets the CPU.
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
    // Workers of the long lane (compose, waveform, title write).
    std::size_t maxWorkers = 2;
    // Workers of the short lane (probes), on top of those.
    std::size_t maxShortWorkers = 2;
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
  // Sends the files to one worker in requests of up to kRCMediaMaxProbeBatch
  // files. When that worker dies or hangs, the files it answered keep their
  // answers and the rest of that request's files are probed one at a time,
  // so only the file that took the worker down fails.
  std::vector<platform::Result<RCMediaProbe>> probeMany(
      const std::vector<platform::URL>& urls) override;
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
  // sent to the worker `pid`, and for a probeMany request again after each
  // file's answer has arrived.
  using JobObserver = std::function<void(pid_t pid, RCMediaJobKind kind)>;
  void setJobObserverForTesting(JobObserver observer);

 private:
  struct Worker;
  // One pool: its workers, its limit and its wait. The limit and the nice
  // increment are set by the constructor; the rest is guarded by mutex_.
  struct Lane {
    std::size_t maxWorkers = 1;
    int nice = 0;  // added to the daemon's nice value for its workers
    std::condition_variable available;
    std::vector<std::unique_ptr<Worker>> idle;
    std::vector<pid_t> pids;   // every live worker
    std::size_t starting = 0;  // spawns under way
  };
  // Called with each item of a probeMany job, in order.
  using ItemSink = std::function<void(RCMediaReply&& item)>;

  Lane& laneFor(RCMediaJobKind kind);
  platform::Result<RCMediaReply> run(RCMediaRequest request, const std::string& doing,
                                     const RCMediaProgress& progress, const ItemSink& items = {});
  void probeBatch(const std::vector<platform::URL>& urls,
                  std::vector<platform::Result<RCMediaProbe>>& probes);
  platform::Result<std::unique_ptr<Worker>> acquire(Lane& lane);
  void release(Lane& lane, std::unique_ptr<Worker> worker);
  void discard(Lane& lane, std::unique_ptr<Worker> worker);
  platform::Result<std::unique_ptr<Worker>> spawn(const Lane& lane);

  const Options options_;
  const std::string workerPath_;
  mutable std::mutex mutex_;
  Lane shortLane_;            // guarded by mutex_
  Lane longLane_;             // guarded by mutex_
  std::uint64_t nextId_ = 1;  // guarded by mutex_
  JobObserver observer_;      // guarded by mutex_
};

}  // namespace quorvel
