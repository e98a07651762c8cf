// How the daemon runs media jobs in worker processes.
//
// Starting. Workers are spawned from one long-lived thread of their own: the
// kernel's parent-death signal fires when the *thread* that created a child
// ends, and job threads (the global queue's, the metadata loader's) are not
// promised to live as long as the daemon. The worker's socket end is dup'ed
// to descriptor 3 in the child and every other descriptor from 3 up is
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
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cmath>
#include <cstring>
#include <filesystem>
#include <future>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "platform/Log.h"
#include "platform/SerialQueue.h"

extern char** environ;

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

platform::Error workerError(std::string text) {
  return RCMediaError(RCMediaErrorCodeWorkerFailed, std::move(text));
}

std::string signalName(int signal) {
  const char* abbreviation = ::sigabbrev_np(signal);
  return abbreviation ? std::string("SIG") + abbreviation : "signal " + std::to_string(signal);
}

std::string secondsText(std::chrono::duration<double> seconds) {
  return fmt::format("{:g} s", seconds.count());
}

platform::SerialQueue& spawnerQueue() {
  // Lives until the process ends: its thread is every worker's parent.
  static platform::SerialQueue* queue = new platform::SerialQueue("org.quorvel.media-spawner");
  return *queue;
}

}  // namespace

struct RCMediaWorkerClient::Worker {
  pid_t pid = -1;
  int fd = -1;
  bool reaped = false;
  int status = 0;

  ~Worker() {
    if (fd >= 0) ::close(fd);
    if (pid > 0 && !reaped) {
      ::kill(pid, SIGKILL);
      while (::waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
      }
    }
  }

  // Whether an idle worker has gone (exited on its idle timer, or died).
  bool hasEnded() const {
    pollfd entry{fd, POLLIN, 0};
    return ::poll(&entry, 1, 0) != 0;
  }

  // Kills (when `kill`) and reaps the process; its exit status lands in status.
  void reap(bool kill) {
    if (reaped || pid <= 0) return;
    if (kill) ::kill(pid, SIGKILL);
    while (::waitpid(pid, &status, 0) < 0) {
      if (errno != EINTR) break;
    }
    reaped = true;
  }

  std::string fate() const {
    if (WIFSIGNALED(status)) return "died with " + signalName(WTERMSIG(status));
    if (WIFEXITED(status)) return "exited with status " + std::to_string(WEXITSTATUS(status));
    return "ended";
  }
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
      workerPath_(options_.workerPath.empty() ? defaultWorkerPath() : options_.workerPath) {}

RCMediaWorkerClient::~RCMediaWorkerClient() {
  std::vector<std::unique_ptr<Worker>> idle;
  {
    std::lock_guard lock(mutex_);
    idle.swap(idle_);
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
  return pids_;
}

void RCMediaWorkerClient::setJobObserverForTesting(JobObserver observer) {
  std::lock_guard lock(mutex_);
  observer_ = std::move(observer);
}

platform::Result<std::unique_ptr<RCMediaWorkerClient::Worker>> RCMediaWorkerClient::spawn() {
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
  for (const std::string& directory : options_.extraSandboxDirectories) {
    arguments.push_back("--allow=" + directory);
  }
  std::vector<char*> argv;
  argv.reserve(arguments.size() + 1);
  for (std::string& argument : arguments) argv.push_back(argument.data());
  argv.push_back(nullptr);

  std::promise<int> spawned;
  pid_t pid = -1;
  spawnerQueue().async([&] {
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;
    posix_spawn_file_actions_init(&actions);
    posix_spawnattr_init(&attributes);
    posix_spawn_file_actions_adddup2(&actions, childEnd, kWorkerSocketFd);
    posix_spawn_file_actions_addclosefrom_np(&actions, kWorkerSocketFd + 1);
    sigset_t none, defaults;
    sigemptyset(&none);
    sigemptyset(&defaults);
    for (int signal : {SIGPIPE, SIGUSR1, SIGUSR2, SIGHUP, SIGINT, SIGTERM, SIGCHLD}) {
      sigaddset(&defaults, signal);
    }
    posix_spawnattr_setsigmask(&attributes, &none);
    posix_spawnattr_setsigdefault(&attributes, &defaults);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
    int result = ::posix_spawn(&pid, argv[0], &actions, &attributes, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attributes);
    spawned.set_value(result);
  });
  const int result = spawned.get_future().get();
  ::close(childEnd);
  if (result != 0) {
    return platform::fail(workerError(
        fmt::format("cannot start the media worker {}: {}", workerPath_, std::strerror(result))));
  }
  worker->pid = pid;
  QV_LOG(platform::kLogLevelDebug, "Started {} (pid {})", kWorkerName, pid);
  return worker;
}

platform::Result<std::unique_ptr<RCMediaWorkerClient::Worker>> RCMediaWorkerClient::acquire() {
  std::vector<std::unique_ptr<Worker>> ended;
  std::unique_lock lock(mutex_);
  for (;;) {
    while (!idle_.empty()) {
      std::unique_ptr<Worker> worker = std::move(idle_.back());
      idle_.pop_back();
      if (!worker->hasEnded()) {
        lock.unlock();
        return worker;
      }
      std::erase(pids_, worker->pid);
      ended.push_back(std::move(worker));  // reaped below, outside the lock
    }
    if (pids_.size() + starting_ < std::max<std::size_t>(1, options_.maxWorkers)) break;
    available_.wait(lock);
  }
  ++starting_;
  lock.unlock();
  for (auto& worker : ended) worker->reap(false);
  ended.clear();
  auto worker = spawn();
  lock.lock();
  --starting_;
  if (worker) {
    pids_.push_back((*worker)->pid);
  } else {
    available_.notify_one();
  }
  return worker;
}

void RCMediaWorkerClient::release(std::unique_ptr<Worker> worker) {
  std::lock_guard lock(mutex_);
  idle_.push_back(std::move(worker));
  available_.notify_one();
}

void RCMediaWorkerClient::discard(std::unique_ptr<Worker> worker) {
  worker->reap(true);
  std::lock_guard lock(mutex_);
  std::erase(pids_, worker->pid);
  available_.notify_one();
}

platform::Result<RCMediaReply> RCMediaWorkerClient::run(RCMediaRequest request,
                                                        const std::string& doing,
                                                        const RCMediaProgress& progress) {
  for (int attempt = 1;; ++attempt) {
    auto acquired = acquire();
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
      release(std::move(worker));
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
    bool replied = false;  // any reply, progress included
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
        if (reply->kind == RCMediaReply::Kind::Progress) {
          deadline = std::chrono::steady_clock::now() +
                     std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                         options_.noProgressTimeout);
          if (progress) progress(reply->progress);
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
      if (!replied && attempt < kAttempts && WIFEXITED(worker->status) &&
          WEXITSTATUS(worker->status) == 0) {
        break;  // exited idle under the request, which it never read
      }
      failure = workerError(fmt::format("{} {} while {}", kWorkerName, worker->fate(), doing));
    }
    if (final) {
      release(std::move(worker));
      return std::move(*final);
    }
    discard(std::move(worker));
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
