// SignalSource: a thread polling the signal's signalfd, a process-wide
// eventfd fed by a forwarding signal handler (for threads that do not block
// the signal), and a stop eventfd.
//
// The handler runs through one queued task at a time: a delivery queues the
// task unless one is queued or running; a delivery that arrives while the
// handler runs marks the task to run the handler once more when it returns.
// So deliveries before the handler starts merge into its run, and the
// handler never runs twice at once even on the concurrent global queue.
//
// The forwarding eventfd of a signal is created once and never closed: the
// signal handler may read its number at any moment, and a closed and reused
// descriptor would receive its writes.
#include "platform/SignalSource.h"

#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <cstring>
#include <mutex>
#include <thread>

#include "platform/Log.h"

namespace platform {
namespace {

constexpr int kSignalLimit = 65;

// The forwarding eventfd of each signal plus one (zero: none yet).
std::array<std::atomic<int>, kSignalLimit> gForwardFdPlusOne{};

void forwardSignal(int signo) {
  const int savedErrno = errno;
  if (signo > 0 && signo < kSignalLimit) {
    const int fd = gForwardFdPlusOne[signo].load() - 1;
    if (fd >= 0) {
      const std::uint64_t one = 1;
      [[maybe_unused]] ssize_t written = ::write(fd, &one, sizeof one);
    }
  }
  errno = savedErrno;
}

int forwardFdFor(int signo) {
  static std::mutex mutex;
  std::lock_guard lock(mutex);
  int fd = gForwardFdPlusOne[signo].load() - 1;
  if (fd < 0) {
    fd = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (fd < 0) return -1;
    gForwardFdPlusOne[signo].store(fd + 1);
  }
  return fd;
}

sigset_t setOf(int signo) {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, signo);
  return set;
}

}  // namespace

struct SignalSource::State {
  State(int s, std::function<void()> h, DispatchQueue& q)
      : signo(s), handler(std::move(h)), queue(q) {}

  const int signo;
  const std::function<void()> handler;
  DispatchQueue& queue;

  mutable std::mutex mutex;
  mutable std::condition_variable receivedChanged;
  std::uint64_t received = 0;
  bool scheduled = false;  // the handler task is queued or running
  bool again = false;      // a delivery came while the handler ran
  bool cancelled = false;

  int signalFd = -1;
  int forwardFd = -1;
  int stopFd = -1;
  std::thread thread;
};

namespace {

// Runs the handler until no delivery came during its last run.
template <class StateT>
void runHandler(const std::shared_ptr<StateT>& state) {
  std::unique_lock lock(state->mutex);
  for (;;) {
    if (state->cancelled) {
      state->scheduled = false;
      return;
    }
    state->again = false;
    lock.unlock();
    state->handler();
    lock.lock();
    if (!state->again) {
      state->scheduled = false;
      return;
    }
  }
}

template <class StateT>
void deliver(const std::shared_ptr<StateT>& state, std::uint64_t count) {
  std::lock_guard lock(state->mutex);
  if (state->scheduled) {
    state->again = true;
  } else if (!state->cancelled) {
    state->scheduled = true;
    state->queue.async([weak = std::weak_ptr<StateT>(state)] {
      if (auto strong = weak.lock()) runHandler(strong);
    });
  }
  state->received += count;
  state->receivedChanged.notify_all();
}

template <class StateT>
void watch(const std::shared_ptr<StateT>& state) {
  const sigset_t mask = setOf(state->signo);
  pthread_sigmask(SIG_BLOCK, &mask, nullptr);
  pollfd fds[3] = {
      {state->signalFd, POLLIN, 0}, {state->forwardFd, POLLIN, 0}, {state->stopFd, POLLIN, 0}};
  for (;;) {
    if (::poll(fds, 3, -1) < 0) {
      if (errno == EINTR) continue;
      QV_LOG(kLogLevelError, "poll failed for signal {}: {}", state->signo, std::strerror(errno));
      return;
    }
    if (fds[2].revents != 0) return;
    std::uint64_t count = 0;
    if (fds[0].revents & POLLIN) {
      signalfd_siginfo infos[8];
      const ssize_t got = ::read(state->signalFd, infos, sizeof infos);
      if (got > 0) count += static_cast<std::uint64_t>(got) / sizeof(signalfd_siginfo);
    }
    if (fds[1].revents & POLLIN) {
      std::uint64_t forwarded = 0;
      if (::read(state->forwardFd, &forwarded, sizeof forwarded) == sizeof forwarded) {
        count += forwarded;
      }
    }
    if (count > 0) deliver(state, count);
  }
}

}  // namespace

void SignalSource::blockInThisThread(int signo) {
  const sigset_t mask = setOf(signo);
  pthread_sigmask(SIG_BLOCK, &mask, nullptr);
}

SignalSource::SignalSource(int signo, std::function<void()> handler, DispatchQueue& queue)
    : state_(std::make_shared<State>(signo, std::move(handler), queue)) {
  State& state = *state_;
  if (signo <= 0 || signo >= kSignalLimit) {
    QV_LOG(kLogLevelError, "cannot watch signal {}", signo);
    state.cancelled = true;
    return;
  }
  const sigset_t mask = setOf(signo);
  state.signalFd = ::signalfd(-1, &mask, SFD_CLOEXEC | SFD_NONBLOCK);
  if (state.signalFd < 0) {
    QV_LOG(kLogLevelError, "signalfd for signal {} failed: {}", signo, std::strerror(errno));
  }
  state.forwardFd = forwardFdFor(signo);
  if (state.forwardFd >= 0) {
    std::uint64_t stale = 0;  // forwarded while no source watched
    [[maybe_unused]] ssize_t got = ::read(state.forwardFd, &stale, sizeof stale);
  }
  state.stopFd = ::eventfd(0, EFD_CLOEXEC);
  // Deliveries to a thread that does not block the signal are forwarded,
  // never left to the default action.
  struct sigaction action {};
  action.sa_handler = forwardSignal;
  sigemptyset(&action.sa_mask);
  action.sa_flags = SA_RESTART;
  ::sigaction(signo, &action, nullptr);
  state.thread = std::thread([state = state_] { watch(state); });
}

SignalSource::~SignalSource() { cancel(); }

void SignalSource::cancel() {
  State& state = *state_;
  {
    std::lock_guard lock(state.mutex);
    state.cancelled = true;
  }
  if (state.thread.joinable()) {
    const std::uint64_t one = 1;
    [[maybe_unused]] ssize_t written = ::write(state.stopFd, &one, sizeof one);
    state.thread.join();
  }
  if (state.signalFd >= 0) ::close(state.signalFd);
  if (state.stopFd >= 0) ::close(state.stopFd);
  state.signalFd = state.stopFd = -1;
}

std::uint64_t SignalSource::receivedCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->received;
}

void SignalSource::waitUntilReceived(std::uint64_t count) const {
  std::unique_lock lock(state_->mutex);
  state_->receivedChanged.wait(lock, [&] { return state_->received >= count; });
}

}  // namespace platform
