// The long-lived spawning thread. A child that set PR_SET_PDEATHSIG gets its
// signal when the thread that spawned it ends, so such children are spawned
// from one thread of our own. The thread stays while at least one of them is
// unreaped, and then ends: an idle process keeps no thread for it, and the
// next such spawn starts a new one.
#include "platform/Subprocess.h"

#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <spawn.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <condition_variable>
#include <deque>
#include <functional>
#include <future>
#include <mutex>
#include <thread>
#include <utility>

extern char** environ;

namespace platform {
namespace {

class SpawningThread {
 public:
  static SpawningThread& instance() {
    static SpawningThread* thread = new SpawningThread();  // outlives every static
    return *thread;
  }

  // Runs `spawn` on the thread and returns once it has run; when it answers
  // true, one more child is counted until childReaped().
  void run(std::function<bool()> spawn) {
    std::promise<void> ran;
    std::future<void> done = ran.get_future();
    {
      std::lock_guard lock(mutex_);
      tasks_.push_back({std::move(spawn), &ran});
      if (!running_) {
        // Detached: once it has left its loop it touches nothing but the
        // mutex of this never-destroyed instance, and a process that exits
        // while it lingers has nothing to join.
        running_ = true;
        std::thread([this] { loop(); }).detach();
      } else {
        wake_.notify_one();
      }
    }
    done.wait();
  }

  void childReaped() {
    std::lock_guard lock(mutex_);
    --children_;
    wake_.notify_one();
  }

 private:
  struct Task {
    std::function<bool()> spawn;
    std::promise<void>* ran;
  };

  void loop() {
    pthread_setname_np(pthread_self(), "spawner");
    std::unique_lock lock(mutex_);
    for (;;) {
      wake_.wait(lock, [this] { return !tasks_.empty() || children_ == 0; });
      if (tasks_.empty()) break;
      Task task = std::move(tasks_.front());
      tasks_.pop_front();
      lock.unlock();
      const bool spawned = task.spawn();
      lock.lock();
      if (spawned) ++children_;
      task.ran->set_value();
    }
    running_ = false;
  }

  std::mutex mutex_;  // guards the fields below
  std::condition_variable wake_;
  std::deque<Task> tasks_;
  std::size_t children_ = 0;  // spawned here and not yet reaped
  bool running_ = false;
};

std::vector<char*> pointersTo(std::vector<std::string>& strings) {
  std::vector<char*> pointers;
  pointers.reserve(strings.size() + 1);
  for (std::string& text : strings) pointers.push_back(text.data());
  pointers.push_back(nullptr);
  return pointers;
}

int spawnNow(const SpawnOptions& options, pid_t& pid) {
  std::vector<std::string> arguments = options.arguments;
  std::vector<std::string> environment;
  if (options.environment) environment = *options.environment;
  auto argv = pointersTo(arguments);
  auto envp = pointersTo(environment);

  posix_spawn_file_actions_t actions;
  posix_spawnattr_t attributes;
  posix_spawn_file_actions_init(&actions);
  posix_spawnattr_init(&attributes);
  int highest = 2;
  for (const auto& [child, parent] : options.descriptors) {
    if (parent == Subprocess::kDevNull) {
      posix_spawn_file_actions_addopen(&actions, child, "/dev/null",
                                       child == 0 ? O_RDONLY : O_WRONLY, 0);
    } else {
      posix_spawn_file_actions_adddup2(&actions, parent, child);
    }
    highest = std::max(highest, child);
  }
  if (options.closeFrom) {
    posix_spawn_file_actions_addclosefrom_np(&actions, std::max(*options.closeFrom, highest + 1));
  }
  sigset_t none, defaults;
  sigemptyset(&none);
  sigemptyset(&defaults);
  for (int signal : {SIGPIPE, SIGUSR1, SIGUSR2, SIGHUP, SIGINT, SIGQUIT, SIGTERM, SIGCHLD}) {
    sigaddset(&defaults, signal);
  }
  posix_spawnattr_setsigmask(&attributes, &none);
  posix_spawnattr_setsigdefault(&attributes, &defaults);
  posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  char* const* env = options.environment ? envp.data() : environ;
  const int result = options.searchPath
                         ? ::posix_spawnp(&pid, argv[0], &actions, &attributes, argv.data(), env)
                         : ::posix_spawn(&pid, argv[0], &actions, &attributes, argv.data(), env);
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attributes);
  return result;
}

}  // namespace

Result<Subprocess> Subprocess::spawn(const SpawnOptions& options) {
  if (options.arguments.empty()) return fail(posixError(EINVAL, "spawn without a program"));
  pid_t pid = -1;
  int result = 0;
  if (options.outlivesSpawningThread) {
    SpawningThread::instance().run([&] {
      result = spawnNow(options, pid);
      return result == 0;
    });
  } else {
    result = spawnNow(options, pid);
  }
  if (result != 0) return fail(posixError(result, "spawn " + options.arguments.front()));
  return Subprocess(pid, options.outlivesSpawningThread);
}

Subprocess::Subprocess(Subprocess&& other) noexcept
    : pid_(std::exchange(other.pid_, -1)),
      counted_(std::exchange(other.counted_, false)),
      reaped_(other.reaped_),
      status_(other.status_) {}

Subprocess& Subprocess::operator=(Subprocess&& other) noexcept {
  if (this != &other) {
    this->~Subprocess();
    new (this) Subprocess(std::move(other));
  }
  return *this;
}

Subprocess::~Subprocess() {
  if (pid_ <= 0 || reaped_) return;
  kill(SIGKILL);
  wait();
}

void Subprocess::kill(int signal) const {
  if (pid_ > 0 && !reaped_) ::kill(pid_, signal);
}

void Subprocess::markReaped(int status) {
  reaped_ = true;
  status_ = status;
  if (counted_) {
    counted_ = false;
    SpawningThread::instance().childReaped();
  }
}

int Subprocess::wait() {
  if (reaped_ || pid_ <= 0) return status_;
  int status = 0;
  while (::waitpid(pid_, &status, 0) < 0) {
    if (errno != EINTR) break;  // ECHILD: reaped elsewhere; nothing more to learn
  }
  markReaped(status);
  return status_;
}

std::optional<int> Subprocess::poll() {
  if (reaped_ || pid_ <= 0) return status_;
  int status = 0;
  const pid_t ended = ::waitpid(pid_, &status, WNOHANG);
  if (ended == 0) return std::nullopt;
  markReaped(ended < 0 ? 0 : status);
  return status_;
}

std::string Subprocess::signalName(int signal) {
  const char* abbreviation = ::sigabbrev_np(signal);
  return abbreviation ? std::string("SIG") + abbreviation : "signal " + std::to_string(signal);
}

std::string Subprocess::describeStatus(int status) {
  if (WIFSIGNALED(status)) return "died with " + signalName(WTERMSIG(status));
  if (WIFEXITED(status)) return "exited with status " + std::to_string(WEXITSTATUS(status));
  return "ended";
}

int Subprocess::exitCode(int status) {
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return 1;
}

}  // namespace platform
