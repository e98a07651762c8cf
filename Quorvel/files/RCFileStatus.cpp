#include "Quorvel/files/RCFileStatus.h"

#include <fcntl.h>

#include <cerrno>

namespace quorvel {
namespace {

RCFileStatus from(int result, const struct stat& info) {
  RCFileStatus status;
  if (result == 0) {
    status.error = 0;
    status.info = info;
  } else {
    status.error = errno;
  }
  return status;
}

}  // namespace

RCFileStatus RCFileStatus::atPath(const std::string& path) {
  struct stat info {};
  return from(::lstat(path.c_str(), &info), info);
}

RCFileStatus RCFileStatus::atPathFollowing(const std::string& path) {
  struct stat info {};
  return from(::stat(path.c_str(), &info), info);
}

RCFileStatus RCFileStatus::at(int directoryFd, const char* name) {
  struct stat info {};
  return from(::fstatat(directoryFd, name, &info, AT_SYMLINK_NOFOLLOW), info);
}

RCFileStatus RCFileStatus::ofDescriptor(int fd) {
  struct stat info {};
  return from(::fstat(fd, &info), info);
}

}  // namespace quorvel
