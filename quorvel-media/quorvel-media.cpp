// quorvel-media: the media worker. The daemon starts it with one end of a
// socket pair and sends it media jobs (probe, probe of many files, compose,
// waveform, title write), one at a time; it runs each with the in-process media engine and
// answers with progress, then a result or an error. Untrusted audio files are
// parsed only here, inside a sandbox, so a decoder that crashes or hangs
// costs the daemon one job.
//
// It exits when the socket reaches end of file (the daemon closed it or
// died), when the daemon dies (parent-death signal), or with status 0 after
// --idle-exit-after seconds without a request. Frames larger than the
// protocol's limit end it with status 2: the stream cannot be resynchronized.
//
// Usage (by the daemon only):
//   quorvel-media --socket-fd=N --parent-pid=PID [--idle-exit-after=SECONDS]
//                 [--nice=INCREMENT] [--allow=DIR]...
#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <climits>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/media/RCMediaProtocol.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
#include "QuorvelMedia/RCMediaInput.h"
#include "platform/Log.h"

#if QUORVEL_MEDIA_SANDBOX && __has_include("platform/Sandbox.h")
#include "platform/Sandbox.h"
#define QUORVEL_MEDIA_HAS_SANDBOX 1
#endif

namespace {

// Ends the confined process. It has nothing to clean up, and exit handlers
// may need what the sandbox forbids (the leak checker of sanitizer builds
// stops the world with ptrace), so it leaves without them.
[[noreturn]] void leave(int status) {
  std::fflush(nullptr);
  ::_exit(status);
}

using quorvel::RCMediaJobKind;

struct Options {
  int socketFd = -1;
  pid_t parentPid = 0;
  double idleExitAfter = 30;
  int nice = 0;
  std::vector<std::string> allowed;
};

bool parse(int argc, char** argv, Options& options) {
  for (int i = 1; i < argc; ++i) {
    std::string_view argument = argv[i];
    auto value = [&](std::string_view name) -> const char* {
      if (!argument.starts_with(name)) return nullptr;
      return argv[i] + name.size();
    };
    char* end = nullptr;
    if (const char* text = value("--socket-fd=")) {
      options.socketFd = int(std::strtol(text, &end, 10));
    } else if (const char* text = value("--parent-pid=")) {
      options.parentPid = pid_t(std::strtol(text, &end, 10));
    } else if (const char* text = value("--idle-exit-after=")) {
      options.idleExitAfter = std::strtod(text, &end);
    } else if (const char* text = value("--nice=")) {
      options.nice = int(std::strtol(text, &end, 10));
    } else if (const char* text = value("--allow=")) {
      options.allowed.emplace_back(text);
      continue;
    } else {
      return false;
    }
    if (!end || *end != '\0') return false;
  }
  return options.socketFd >= 0 && options.parentPid > 0 && options.idleExitAfter >= 0 &&
         std::isfinite(options.idleExitAfter);
}

// The worker's end of the socket. Single-threaded: the job runs on the same
// thread that reads requests and writes replies.
class Channel {
 public:
  explicit Channel(int fd) : fd_(fd) {}

  // Writes one frame; false when the daemon is gone. After the reply that
  // ends a job (`last`), receive() briefly looks for the next request
  // without sleeping.
  bool send(const std::string& body, bool last = false) {
    if (last) spinUntil_ = std::chrono::steady_clock::now() + std::chrono::microseconds(200);
    return write(std::exchange(queued_, {}) + quorvel::RCMediaEncodeFrame(body));
  }

  // Queues one frame, written with the next send() or once the first frame
  // queued has waited a few milliseconds: a batch's answers then cost the
  // daemon a wake-up per handful of files, not per file. False when the
  // daemon is gone.
  bool queue(const std::string& body) {
    const auto now = std::chrono::steady_clock::now();
    if (queued_.empty()) queuedAt_ = now;
    queued_ += quorvel::RCMediaEncodeFrame(body);
    return now - queuedAt_ < std::chrono::milliseconds(5) || write(std::exchange(queued_, {}));
  }

  // The next request's body; nullopt at end of file or after `idle` without
  // one. Exits the process on a frame over the limit.
  std::optional<std::string> receive(std::chrono::duration<double> idle) {
    for (;;) {
      auto body = reader_.next();
      if (!body) {
        QV_LOG(platform::kLogLevelError, "ERROR: {}", body.error().localizedDescription());
        leave(2);
      }
      if (*body) return std::move(**body);
      char buffer[65536];
      if (spinUntil_ && reader_.pendingBytes() == 0) {
        // Right after a reply the next request often follows at once (a
        // directory's files probed one after another); looking for it for a
        // moment saves sleeping and being woken for it.
        ssize_t n = ::recv(fd_, buffer, sizeof buffer, MSG_DONTWAIT);
        if (n > 0) {
          reader_.append(buffer, std::size_t(n));
          continue;
        }
        if (n == 0) return std::nullopt;
        if (errno == EAGAIN && std::chrono::steady_clock::now() < *spinUntil_) continue;
        spinUntil_.reset();
      }
      pollfd entry{fd_, POLLIN, 0};
      // A request begun is waited for without limit: the daemon is writing it.
      const int timeout = reader_.pendingBytes() > 0
                              ? -1
                              : int(std::min(std::ceil(idle.count() * 1000), double(INT_MAX)));
      const int ready = ::poll(&entry, 1, timeout);
      if (ready < 0 && errno == EINTR) continue;
      if (ready == 0) return std::nullopt;  // idle long enough
      ssize_t n = ::read(fd_, buffer, sizeof buffer);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return std::nullopt;
      reader_.append(buffer, std::size_t(n));
    }
  }

 private:
  bool write(const std::string& frame) {
    std::size_t sent = 0;
    while (sent < frame.size()) {
      ssize_t n = ::send(fd_, frame.data() + sent, frame.size() - sent, MSG_NOSIGNAL);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return false;
      sent += std::size_t(n);
    }
    return true;
  }

  int fd_;
  quorvel::RCMediaFrameReader reader_;
  std::optional<std::chrono::steady_clock::time_point> spinUntil_;
  std::string queued_;
  std::chrono::steady_clock::time_point queuedAt_;
};

void serve(Channel& channel, quorvel::RCMediaEngine& engine, std::chrono::duration<double> idle) {
  // A worker is started for a request that is on its way: the first one is
  // waited for without the idle limit (end of file still ends the wait), so
  // a short idle time cannot make a new worker leave before its first job.
  std::chrono::duration<double> wait = std::chrono::hours(24);
  while (std::optional<std::string> body = channel.receive(std::exchange(wait, idle))) {
    auto request = quorvel::RCMediaDecodeRequest(*body);
    if (!request) {
      // No id to answer to: the daemon will see its job end with the worker.
      QV_LOG(platform::kLogLevelError, "ERROR: {}", request.error().localizedDescription());
      leave(2);
    }
    const std::uint64_t id = request->id;
    bool connected = true;
    quorvel::RCMediaProgress progress = [&](double fraction) {
      if (connected) connected = channel.send(quorvel::RCMediaEncodeProgress(id, fraction));
    };
    std::string reply;
    switch (request->kind) {
      case RCMediaJobKind::Probe: {
        auto probe = engine.probe(request->url);
        reply = probe ? quorvel::RCMediaEncodeResult(id, &*probe)
                      : quorvel::RCMediaEncodeError(id, probe.error());
        break;
      }
      case RCMediaJobKind::ProbeMany: {
        // Each file's answer goes out within milliseconds of being known: it
        // tells the daemon the batch is moving, and survives this process
        // dying on a later file.
        for (std::size_t index = 0; index < request->urls.size() && connected; ++index) {
          connected = channel.queue(
              quorvel::RCMediaEncodeItem(id, index, engine.probe(request->urls[index])));
        }
        reply = quorvel::RCMediaEncodeResult(id, nullptr);
        break;
      }
      case RCMediaJobKind::Compose:
      case RCMediaJobKind::Waveform:
      case RCMediaJobKind::WriteTitle: {
        platform::Status status;
        if (request->kind == RCMediaJobKind::Compose) {
          status = engine.compose(request->segments, request->url, request->destination, progress);
        } else if (request->kind == RCMediaJobKind::Waveform) {
          status = engine.buildWaveform(request->url, *request->destination, progress);
        } else {
          status = engine.writeTitle(request->url, request->title, request->language);
        }
        reply = status ? quorvel::RCMediaEncodeResult(id, nullptr)
                       : quorvel::RCMediaEncodeError(id, status.error());
        break;
      }
    }
    if (!connected || !channel.send(reply, true)) return;
  }
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  if (!parse(argc, argv, options)) {
    std::fprintf(stderr,
                 "quorvel-media: the daemon's media worker; not meant to be run by hand\n"
                 "usage: quorvel-media --socket-fd=N --parent-pid=PID "
                 "[--idle-exit-after=SECONDS] [--nice=INCREMENT] [--allow=DIR]...\n");
    return 64;
  }
  // Lowered first, while this is the process's only thread: Linux keeps a
  // nice value per thread, and every thread started later inherits it.
  if (options.nice != 0 &&
      ::setpriority(PRIO_PROCESS, 0, ::getpriority(PRIO_PROCESS, 0) + options.nice) != 0) {
    std::fprintf(stderr, "quorvel-media: cannot lower its priority: %s\n", std::strerror(errno));
  }
  // Die with the daemon, even when it dies before this line ran.
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (::getppid() != options.parentPid) return 1;
  ::signal(SIGPIPE, SIG_IGN);

  platform::setLogIdentifier("quorvel-media");
  platform::logInitialize();

  // Sent before the sandbox: the journal's socket opens with the first line,
  // and the confined process may not create sockets.
  QV_LOG(platform::kLogLevelNotice, "quorvel-media {} serving media jobs for {}", ::getpid(),
         options.parentPid);
#ifdef QUORVEL_MEDIA_HAS_SANDBOX
  {
    platform::SandboxPolicy policy;
    policy.readPaths = options.allowed;
    policy.writePaths = options.allowed;
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    policy.addressSpaceLimitBytes = 0;  // the sanitizers reserve terabytes of address space
#else
    policy.addressSpaceLimitBytes = std::uint64_t(4) << 30;
#endif
    QV_LOG(platform::kLogLevelNotice, "quorvel-media {}", platform::applySandbox(policy));
  }
#else
  QV_LOG(platform::kLogLevelDebug, "quorvel-media: built without a sandbox");
#endif
  quorvel::RCRestrictMediaInputs();

  Channel channel(options.socketFd);
  quorvel::RCInProcessMediaEngine engine;
  serve(channel, engine, std::chrono::duration<double>(options.idleExitAfter));
  leave(0);
}
