#include "Quorvel/files/RCDurableFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "Quorvel/errors/RCError.h"
#include "Quorvel/files/RCFileConfinement.h"
#include "platform/UUID.h"

namespace quorvel {
namespace {

class ScopedFD {
 public:
  explicit ScopedFD(int fd) : fd_(fd) {}
  ~ScopedFD() {
    if (fd_ >= 0) ::close(fd_);
  }
  ScopedFD(const ScopedFD&) = delete;
  ScopedFD& operator=(const ScopedFD&) = delete;
  int get() const { return fd_; }

 private:
  int fd_;
};

platform::Status writeAll(int fd, std::string_view contents) {
  while (!contents.empty()) {
    ssize_t n = ::write(fd, contents.data(), contents.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return platform::fail(platform::posixError(errno, "write"));
    }
    contents.remove_prefix(static_cast<std::size_t>(n));
  }
  return {};
}

}  // namespace

platform::Status RCWriteFileAtomically(std::string_view directory, std::string_view name,
                                       std::string_view contents) {
  if (!RCIsPlainFileName(name)) {
    return platform::fail(RCError(RCErrorCodeNotConfined, "not a plain file name"));
  }
  std::string dirPath(directory);
  ScopedFD dir(::open(dirPath.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (dir.get() < 0) return platform::fail(platform::posixError(errno, "open " + dirPath));

  std::string target(name);
  std::string temporary = "." + target + ".tmp-" + platform::UUID::random().string();
  ScopedFD file(::openat(dir.get(), temporary.c_str(),
                         O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
  if (file.get() < 0) return platform::fail(platform::posixError(errno, "create " + temporary));

  platform::Status status = writeAll(file.get(), contents);
  if (status && ::fsync(file.get()) != 0) {
    status = platform::fail(platform::posixError(errno, "fsync " + temporary));
  }
  if (status && ::renameat(dir.get(), temporary.c_str(), dir.get(), target.c_str()) != 0) {
    status = platform::fail(platform::posixError(errno, "rename " + temporary));
  }
  if (!status) {
    ::unlinkat(dir.get(), temporary.c_str(), 0);
    return status;
  }
  // The rename is durable once the directory is; a failure here leaves the
  // new file in place, so it is not reported.
  ::fsync(dir.get());
  return {};
}

platform::Result<std::string> RCReadFileNoFollow(std::string_view directory, std::string_view name,
                                                 std::size_t maximumSize) {
  std::string dirPath(directory);
  ScopedFD dir(::open(dirPath.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (dir.get() < 0) return platform::fail(platform::posixError(errno, "open " + dirPath));
  std::string fileName(name);
  ScopedFD file(::openat(dir.get(), fileName.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  if (file.get() < 0) return platform::fail(platform::posixError(errno, "open " + fileName));
  struct stat info {};
  if (::fstat(file.get(), &info) != 0) {
    return platform::fail(platform::posixError(errno, "stat " + fileName));
  }
  if (!S_ISREG(info.st_mode)) {
    return platform::fail(RCError(RCErrorCodeNotConfined, fileName + " is not a regular file"));
  }
  if (static_cast<std::size_t>(info.st_size) > maximumSize) {
    return platform::fail(RCError(RCErrorCodeInvalidManifest, fileName + " is too large"));
  }
  std::string contents;
  char buffer[16384];
  for (;;) {
    ssize_t n = ::read(file.get(), buffer, sizeof buffer);
    if (n < 0) {
      if (errno == EINTR) continue;
      return platform::fail(platform::posixError(errno, "read " + fileName));
    }
    if (n == 0) break;
    contents.append(buffer, static_cast<std::size_t>(n));
    if (contents.size() > maximumSize) {
      return platform::fail(RCError(RCErrorCodeInvalidManifest, fileName + " is too large"));
    }
  }
  return contents;
}

}  // namespace quorvel
