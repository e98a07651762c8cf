// How the daemon runs media jobs in worker processes.
//
// Starting. The worker sets its own parent-death signal, which the kernel
// sends when the *thread* that spawned it ends, and job threads (the global
// queue's, the metadata loader's) come and go; so workers are spawned through
// Subprocess from a thread that outlives them. The worker's socket end is
// moved to descriptor 3 in the child and every other descriptor from 3 up is
// closed, so nothing of the daemon (bus socket, database) leaks into it; the
// signal mask and dispositions are reset to defaults.
//
// One job. The request is written whole; then the job thread waits for
// replies with a deadline that every progress reply pushes back. A result or
// error ends the job and the worker goes back to the idle list. End of file,
// a read error, a malformed or foreign reply, or the deadline passing end the
// worker: it is killed (SIGKILL; harmless when it is already gone), reaped,
// and the job fails with what happened to it.
//
// Lanes. Probes and long jobs draw workers from two pools with their own
// idle lists, limits and condition variables under the one mutex, so a
// probe never waits for a compose's worker. Long-lane workers are started
// with --nice=10 and lower their own priority first thing, rather than this
// process calling setpriority() on them after the spawn: Linux keeps a nice
// value per thread, and only the worker knows it runs a single thread at that
// moment, so every decoder or encoder thread it starts later inherits the
// value; and the increment is relative, so a daemon that was itself started
// at a lower priority keeps its workers below it.
//
// Batches. probeMany sends up to kRCMediaMaxProbeBatch files per request;
// the worker answers each file with an item reply as it goes (written out
// every few milliseconds), and each item pushes back the no-progress
// deadline. Items must come in order, one per file, before the result;
// anything else breaks the protocol. When the job
// fails (the worker died, hung, broke the protocol, or none could start) the
// answers that came stay, and the request's other files are probed one at a
// time: the file the worker was on when it went is retried alone and fails
// alone if it was the cause, and the files after it get their own answers.
// A file that hangs the worker thus costs the no-progress time twice.
//
// Idle exit. An idle worker exits with status 0 when no request came for its
// idle time; the daemon notices when it next picks that worker (its socket
// reads as end of file) and reaps it. A request can cross the worker's
// decision to exit; the worker then exits without having read it, the job
// sees end of file and a clean exit before any reply, and is simply retried
// on another worker: nothing of it ran.
#include "Quorvel/media/RCMediaWorkerClient.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cmath>
#include <cstring>
#include <filesystem>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "platform/Log.h"
#include "platform/Subprocess.h"

namespace quorvel {

namespace {

constexpr const char* kWorkerName = "quorvel-media";
// The descriptor the worker finds its socket on.
constexpr int kWorkerSocketFd = 3;
// How often a job is tried when workers exit idle under it. Such a retry is
// always safe (the worker never read the job) and always ends: a new worker
// waits for its first job, so only pooled workers can leave under one, and
// several jobs racing for the two slots may each meet a leaving worker.
constexpr int kAttempts = 10;
// How much lower the long lane's workers run than the daemon.
constexpr int kLongJobNice = 10;

platform::Error workerError(std::string text) {
  return RCMediaError(RCMediaErrorCodeWorkerFailed, std::move(text));
}

std::string secondsText(std::chrono::duration<double> seconds) {
  return fmt::format("{:g} s", seconds.count());
}

}  // namespace

struct RCMediaWorkerClient::Worker {
  std::optional<platform::Subprocess> process;  // killed and reaped when the worker goes
  pid_t pid = -1;
  int fd = -1;

  ~Worker() {
    if (fd >= 0) ::close(fd);
  }

  // Whether an idle worker has gone (exited on its idle timer, or died).
  bool hasEnded() const {
    pollfd entry{fd, POLLIN, 0};
    return ::poll(&entry, 1, 0) != 0;
  }

  // Kills (when `kill`) and reaps the process; its wait status.
  int reap(bool kill) {
    if (!process) return 0;
    if (kill) process->kill(SIGKILL);
    return process->wait();
  }

  std::string fate() { return platform::Subprocess::describeStatus(reap(false)); }
};

std::string RCMediaWorkerClient::defaultWorkerPath() {
  if (const char* path = std::getenv("QUORVEL_MEDIA_WORKER"); path && *path) return path;
  std::error_code error;
  std::filesystem::path self = std::filesystem::read_symlink("/proc/self/exe", error);
  if (error) return kWorkerName;
  std::filesystem::path beside = self.parent_path() / kWorkerName;
  std::filesystem::path libexec =
      self.parent_path().parent_path() / "libexec" / "quorvel" / kWorkerName;
  if (!std::filesystem::exists(beside, error) && std::filesystem::exists(libexec, error)) {
    return libexec.string();
  }
  return beside.string();
}

RCMediaWorkerClient::RCMediaWorkerClient() : RCMediaWorkerClient(Options()) {}

RCMediaWorkerClient::RCMediaWorkerClient(Options options)
    : options_(std::move(options)),
      workerPath_(options_.workerPath.empty() ? defaultWorkerPath() : options_.workerPath) {
  shortLane_.maxWorkers = std::max<std::size_t>(1, options_.maxShortWorkers);
  longLane_.maxWorkers = std::max<std::size_t>(1, options_.maxWorkers);
  longLane_.nice = kLongJobNice;
}

RCMediaWorkerClient::~RCMediaWorkerClient() {
  std::vector<std::unique_ptr<Worker>> idle;
  {
    std::lock_guard lock(mutex_);
    for (Lane* lane : {&shortLane_, &longLane_}) {
      for (auto& worker : lane->idle) idle.push_back(std::move(worker));
      lane->idle.clear();
    }
  }
  // Closing the socket ends the worker; reap it so no zombie is left.
  for (auto& worker : idle) {
    ::close(worker->fd);
    worker->fd = -1;
    worker->reap(false);
  }
}

std::vector<pid_t> RCMediaWorkerClient::workerPids() const {
  std::lock_guard lock(mutex_);
  std::vector<pid_t> pids = shortLane_.pids;
  pids.insert(pids.end(), longLane_.pids.begin(), longLane_.pids.end());
  return pids;
}

RCMediaWorkerClient::Lane& RCMediaWorkerClient::laneFor(RCMediaJobKind kind) {
  const bool isShort = kind == RCMediaJobKind::Probe || kind == RCMediaJobKind::ProbeMany;
  return isShort ? shortLane_ : longLane_;
}

void RCMediaWorkerClient::setJobObserverForTesting(JobObserver observer) {
  std::lock_guard lock(mutex_);
  observer_ = std::move(observer);
}

platform::Result<std::unique_ptr<RCMediaWorkerClient::Worker>> RCMediaWorkerClient::spawn(
    const Lane& lane) {
  int sockets[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sockets) != 0) {
    return platform::fail(workerError(
        fmt::format("cannot start {}: socketpair: {}", kWorkerName, std::strerror(errno))));
  }
  auto worker = std::make_unique<Worker>();
  worker->fd = sockets[0];
  // Keep the child's end clear of the number it is moved to.
  int childEnd = ::fcntl(sockets[1], F_DUPFD_CLOEXEC, kWorkerSocketFd + 1);
  ::close(sockets[1]);
  if (childEnd < 0) {
    return platform::fail(
        workerError(fmt::format("cannot start {}: {}", kWorkerName, std::strerror(errno))));
  }

  std::vector<std::string> arguments = {
      workerPath_,
      "--socket-fd=" + std::to_string(kWorkerSocketFd),
      "--parent-pid=" + std::to_string(::getpid()),
      fmt::format("--idle-exit-after={:g}", options_.idleExitAfter.count()),
      "--allow=" + RCSavedRecordingsDirectory(),
  };
  if (lane.nice != 0) arguments.push_back("--nice=" + std::to_string(lane.nice));
  for (const std::string& directory : options_.extraSandboxDirectories) {
    arguments.push_back("--allow=" + directory);
  }
  // The worker sets its own parent-death signal, so it is spawned from a
  // thread that lives as long as it does.
  auto spawned = platform::Subprocess::spawn({.arguments = std::move(arguments),
                                              .descriptors = {{kWorkerSocketFd, childEnd}},
                                              .closeFrom = kWorkerSocketFd + 1,
                                              .outlivesSpawningThread = true});
  ::close(childEnd);
  if (!spawned) {
    return platform::fail(
        workerError(fmt::format("cannot start the media worker {}: {}", workerPath_,
                                std::strerror(int(spawned.error().code())))));
  }
  const pid_t pid = spawned->pid();
  worker->process = std::move(*spawned);
  worker->pid = pid;
  QV_LOG(platform::kLogLevelDebug, "Started {} (pid {})", kWorkerName, pid);
  return worker;
}

platform::Result<std::unique_ptr<RCMediaWorkerClient::Worker>> RCMediaWorkerClient::acquire(
    Lane& lane) {
  std::vector<std::unique_ptr<Worker>> ended;
  std::unique_lock lock(mutex_);
  for (;;) {
    while (!lane.idle.empty()) {
      std::unique_ptr<Worker> worker = std::move(lane.idle.back());
      lane.idle.pop_back();
      if (!worker->hasEnded()) {
        lock.unlock();
        return worker;
      }
      std::erase(lane.pids, worker->pid);
      ended.push_back(std::move(worker));  // reaped below, outside the lock
    }
    if (lane.pids.size() + lane.starting < lane.maxWorkers) break;
    lane.available.wait(lock);
  }
  ++lane.starting;
  lock.unlock();
  for (auto& worker : ended) worker->reap(false);
  ended.clear();
  auto worker = spawn(lane);
  lock.lock();
  --lane.starting;
  if (worker) {
    lane.pids.push_back((*worker)->pid);
  } else {
    lane.available.notify_one();
  }
  return worker;
}

void RCMediaWorkerClient::release(Lane& lane, std::unique_ptr<Worker> worker) {
  std::lock_guard lock(mutex_);
  lane.idle.push_back(std::move(worker));
  lane.available.notify_one();
}

void RCMediaWorkerClient::discard(Lane& lane, std::unique_ptr<Worker> worker) {
  worker->reap(true);
  std::lock_guard lock(mutex_);
  std::erase(lane.pids, worker->pid);
  lane.available.notify_one();
}

platform::Result<RCMediaReply> RCMediaWorkerClient::run(RCMediaRequest request,
                                                        const std::string& doing,
                                                        const RCMediaProgress& progress,
                                                        const ItemSink& items) {
  Lane& lane = laneFor(request.kind);
  for (int attempt = 1;; ++attempt) {
    auto acquired = acquire(lane);
    if (!acquired) {
      QV_LOG(platform::kLogLevelError, "ERROR: {}", acquired.error().localizedDescription());
      return platform::fail(acquired.error());
    }
    std::unique_ptr<Worker> worker = std::move(*acquired);
    JobObserver observer;
    {
      std::lock_guard lock(mutex_);
      request.id = nextId_++;
      observer = observer_;
    }
    const std::string frame = RCMediaEncodeFrame(RCMediaEncodeRequest(request));
    if (frame.size() > kRCMediaMaxFrameBytes + 4) {
      release(lane, std::move(worker));
      return platform::fail(workerError("the request for " + doing + " is too large"));
    }

    // Sends the request; a worker gone meanwhile shows up as end of file below.
    std::size_t sent = 0;
    while (sent < frame.size()) {
      ssize_t n = ::send(worker->fd, frame.data() + sent, frame.size() - sent, MSG_NOSIGNAL);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) break;
      sent += std::size_t(n);
    }
    if (observer) observer(worker->pid, request.kind);

    RCMediaFrameReader reader;
    bool replied = false;      // any reply, progress included
    std::size_t answered = 0;  // items of a probeMany job
    std::optional<platform::Error> failure;
    std::optional<RCMediaReply> final;
    auto deadline =
        std::chrono::steady_clock::now() +
        std::chrono::duration_cast<std::chrono::steady_clock::duration>(options_.noProgressTimeout);
    while (!final && !failure) {
      auto body = reader.next();
      if (!body) {
        failure = workerError(fmt::format("{} broke the protocol while {}: {}", kWorkerName, doing,
                                          body.error().localizedDescription()));
        break;
      }
      if (*body) {
        auto reply = RCMediaDecodeReply(**body);
        if (!reply || reply->id != request.id) {
          failure = workerError(fmt::format(
              "{} broke the protocol while {}: {}", kWorkerName, doing,
              reply ? "a reply to another request" : reply.error().localizedDescription()));
          break;
        }
        replied = true;
        const bool isItem = reply->kind == RCMediaReply::Kind::Item;
        const bool isBatch = request.kind == RCMediaJobKind::ProbeMany;
        if (isItem && (!isBatch || reply->index != answered || answered >= request.urls.size())) {
          failure = workerError(fmt::format(
              "{} broke the protocol while {}: an answer out of order", kWorkerName, doing));
          break;
        }
        if (isBatch && reply->kind == RCMediaReply::Kind::Result &&
            answered != request.urls.size()) {
          failure =
              workerError(fmt::format("{} broke the protocol while {}: {} answers for {} files",
                                      kWorkerName, doing, answered, request.urls.size()));
          break;
        }
        if (reply->kind == RCMediaReply::Kind::Progress || isItem) {
          deadline = std::chrono::steady_clock::now() +
                     std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                         options_.noProgressTimeout);
          if (isItem) {
            ++answered;
            if (items) items(std::move(*reply));
            if (observer) observer(worker->pid, request.kind);
          } else if (progress) {
            progress(reply->progress);
          }
        } else {
          final = std::move(*reply);
        }
        continue;
      }
      auto remaining = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      if (remaining.count() < 0) {
        worker->reap(true);
        failure =
            workerError(fmt::format("{} made no progress for {} while {}; it was killed",
                                    kWorkerName, secondsText(options_.noProgressTimeout), doing));
        break;
      }
      pollfd entry{worker->fd, POLLIN, 0};
      int ready = ::poll(&entry, 1, int(std::min<long long>(remaining.count() + 1, INT_MAX)));
      if (ready < 0 && errno != EINTR) {
        failure =
            workerError(fmt::format("cannot wait for {}: {}", kWorkerName, std::strerror(errno)));
      }
      if (ready <= 0) continue;
      char buffer[65536];
      ssize_t n = ::read(worker->fd, buffer, sizeof buffer);
      if (n < 0 && errno == EINTR) continue;
      if (n > 0) {
        reader.append(buffer, std::size_t(n));
        continue;
      }
      // End of file (or a reset): the worker is gone or going.
      worker->reap(false);
      const int status = worker->reap(false);
      if (!replied && attempt < kAttempts && WIFEXITED(status) && WEXITSTATUS(status) == 0) {
        break;  // exited idle under the request, which it never read
      }
      failure = workerError(fmt::format("{} {} while {}", kWorkerName, worker->fate(), doing));
    }
    if (final) {
      release(lane, std::move(worker));
      return std::move(*final);
    }
    discard(lane, std::move(worker));
    if (failure) {
      QV_LOG(platform::kLogLevelError, "ERROR: {}", failure->localizedDescription());
      return platform::fail(std::move(*failure));
    }
  }
}

platform::Result<RCMediaProbe> RCMediaWorkerClient::probe(const platform::URL& url) {
  RCMediaRequest request;
  request.kind = RCMediaJobKind::Probe;
  request.url = url;
  auto reply = run(std::move(request), "probing " + url.lastPathComponent(), {});
  if (!reply) return platform::fail(reply.error());
  if (reply->kind == RCMediaReply::Kind::Error) return platform::fail(*reply->error);
  if (!reply->probe) {
    return platform::fail(workerError(fmt::format(
        "{} broke the protocol while probing {}: no probe", kWorkerName, url.lastPathComponent())));
  }
  return std::move(*reply->probe);
}

std::vector<platform::Result<RCMediaProbe>> RCMediaWorkerClient::probeMany(
    const std::vector<platform::URL>& urls) {
  std::vector<platform::Result<RCMediaProbe>> probes;
  probes.reserve(urls.size());
  for (std::size_t begin = 0; begin < urls.size(); begin += kRCMediaMaxProbeBatch) {
    const std::size_t end = std::min(urls.size(), begin + kRCMediaMaxProbeBatch);
    probeBatch(std::vector<platform::URL>(urls.begin() + begin, urls.begin() + end), probes);
  }
  return probes;
}

void RCMediaWorkerClient::probeBatch(const std::vector<platform::URL>& urls,
                                     std::vector<platform::Result<RCMediaProbe>>& probes) {
  if (urls.size() == 1) {
    probes.push_back(probe(urls.front()));
    return;
  }
  RCMediaRequest request;
  request.kind = RCMediaJobKind::ProbeMany;
  request.urls = urls;
  const std::size_t first = probes.size();
  auto reply = run(std::move(request), fmt::format("probing {} files", urls.size()), {},
                   [&](RCMediaReply&& item) {
                     if (item.probe) {
                       probes.push_back(std::move(*item.probe));
                     } else {
                       probes.push_back(platform::fail(std::move(*item.error)));
                     }
                   });
  if (reply && reply->kind == RCMediaReply::Kind::Result) return;  // every file answered
  for (std::size_t index = probes.size() - first; index < urls.size(); ++index) {
    probes.push_back(probe(urls[index]));
  }
}

namespace {

platform::Status statusOf(platform::Result<RCMediaReply> reply) {
  if (!reply) return platform::fail(reply.error());
  if (reply->kind == RCMediaReply::Kind::Error) return platform::fail(*reply->error);
  return {};
}

}  // namespace

platform::Status RCMediaWorkerClient::compose(
    const std::vector<RCComposerSegment>& segments, const platform::URL& destination,
    const std::optional<platform::URL>& waveformDestination, const RCMediaProgress& progress) {
  RCMediaRequest request;
  request.kind = RCMediaJobKind::Compose;
  request.url = destination;
  request.segments = segments;
  request.destination = waveformDestination;
  return statusOf(
      run(std::move(request), "composing " + destination.lastPathComponent(), progress));
}

platform::Status RCMediaWorkerClient::buildWaveform(const platform::URL& audio,
                                                    const platform::URL& destination,
                                                    const RCMediaProgress& progress) {
  RCMediaRequest request;
  request.kind = RCMediaJobKind::Waveform;
  request.url = audio;
  request.destination = destination;
  return statusOf(
      run(std::move(request), "computing the waveform of " + audio.lastPathComponent(), progress));
}

platform::Status RCMediaWorkerClient::writeTitle(const platform::URL& file,
                                                 const std::string& title,
                                                 const std::string& language) {
  RCMediaRequest request;
  request.kind = RCMediaJobKind::WriteTitle;
  request.url = file;
  request.title = title;
  request.language = language;
  return statusOf(
      run(std::move(request), "writing the title into " + file.lastPathComponent(), {}));
}

}  // namespace quorvel
