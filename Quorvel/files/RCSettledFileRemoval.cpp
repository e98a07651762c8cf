#include "Quorvel/files/RCSettledFileRemoval.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <ctime>
#include <mutex>
#include <tuple>

#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCFileStatus.h"

namespace quorvel {
namespace {

void ignoreLeaseBreakSignal() {
  static std::once_flag once;
  std::call_once(once, [] {
    struct sigaction current {};
    if (::sigaction(SIGIO, nullptr, &current) == 0 && current.sa_handler == SIG_DFL &&
        !(current.sa_flags & SA_SIGINFO)) {
      struct sigaction ignore {};
      ignore.sa_handler = SIG_IGN;
      ::sigemptyset(&ignore.sa_mask);
      ::sigaction(SIGIO, &ignore, nullptr);
    }
  });
}

double secondsSinceLastChange(const struct stat& info) {
  struct timespec now {};
  ::clock_gettime(CLOCK_REALTIME, &now);
  // The change time too: a copy that kept its source's modification time
  // (cp -p) is still new.
  const struct timespec& last = std::tie(info.st_ctim.tv_sec, info.st_ctim.tv_nsec) >
                                        std::tie(info.st_mtim.tv_sec, info.st_mtim.tv_nsec)
                                    ? info.st_ctim
                                    : info.st_mtim;
  return double(now.tv_sec - last.tv_sec) + double(now.tv_nsec - last.tv_nsec) / 1e9;
}

// Holds a write lease on a descriptor, given up when it goes.
class ScopedLease {
 public:
  explicit ScopedLease(int fd) : fd_(fd) {}
  ~ScopedLease() {
    if (held_) ::fcntl(fd_, F_SETLEASE, F_UNLCK);
  }
  ScopedLease(const ScopedLease&) = delete;
  ScopedLease& operator=(const ScopedLease&) = delete;
  // 0 when taken, else the errno.
  int take() {
    held_ = ::fcntl(fd_, F_SETLEASE, F_WRLCK) == 0;
    return held_ ? 0 : errno;
  }

 private:
  int fd_;
  bool held_ = false;
};

bool sameFile(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

}  // namespace

std::string_view RCSettledRemovalDescription(RCSettledRemoval outcome) {
  switch (outcome) {
    case RCSettledRemoval::Removed:
      return "was removed";
    case RCSettledRemoval::Missing:
      return "is gone";
    case RCSettledRemoval::NotARegularFile:
      return "is not a regular file";
    case RCSettledRemoval::Changed:
      return "changed during the run";
    case RCSettledRemoval::OpenElsewhere:
      return "is open in another process";
    case RCSettledRemoval::TooRecent:
      return "changed less than a minute ago";
    case RCSettledRemoval::Wanted:
      return "is wanted again";
  }
  return "";
}

platform::Result<RCSettledRemoval> RCRemoveSettledFile(const std::string& directory,
                                                       const std::string& name,
                                                       const RCFileVersion& examined,
                                                       double minimumQuietSeconds,
                                                       const std::function<bool()>& stillUnwanted) {
  RCScopedFd parent(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!parent) return platform::fail(platform::posixError(errno, "open " + directory));
  const RCFileStatus named = RCFileStatus::at(parent.get(), name.c_str());
  if (named.error == ENOENT) return RCSettledRemoval::Missing;
  if (!named.exists()) return platform::fail(platform::posixError(named.error, "stat " + name));
  // Never opened unless regular: opening a FIFO or a device has effects.
  if (!named.isRegularFile()) return RCSettledRemoval::NotARegularFile;
  RCScopedFd file(
      ::openat(parent.get(), name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!file) {
    if (errno == ENOENT) return RCSettledRemoval::Missing;
    if (errno == ELOOP) return RCSettledRemoval::NotARegularFile;
    return platform::fail(platform::posixError(errno, "open " + name));
  }

  ignoreLeaseBreakSignal();
  ScopedLease lease(file.get());
  const int refused = lease.take();
  if (refused == EAGAIN || refused == EBUSY) return RCSettledRemoval::OpenElsewhere;

  const RCFileStatus opened = RCFileStatus::ofDescriptor(file.get());
  if (!opened.exists()) return platform::fail(platform::posixError(opened.error, "stat " + name));
  if (!opened.isRegularFile()) return RCSettledRemoval::NotARegularFile;
  if (RCFileVersion::of(opened.info) != examined) return RCSettledRemoval::Changed;
  if (refused != 0 && secondsSinceLastChange(opened.info) < minimumQuietSeconds) {
    return RCSettledRemoval::TooRecent;
  }
  if (stillUnwanted && !stillUnwanted()) return RCSettledRemoval::Wanted;

  // The name must still lead to the descriptor's file: a rename over it
  // since the open would otherwise remove the newcomer.
  const RCFileStatus now = RCFileStatus::at(parent.get(), name.c_str());
  if (!now.exists() || !sameFile(now.info, opened.info)) {
    return RCSettledRemoval::Changed;
  }
  if (::unlinkat(parent.get(), name.c_str(), 0) != 0) {
    if (errno == ENOENT) return RCSettledRemoval::Missing;
    return platform::fail(platform::posixError(errno, "remove " + name));
  }
  return RCSettledRemoval::Removed;
}

}  // namespace quorvel
