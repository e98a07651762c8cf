#include "Quorvel/files/RCDirectoryListing.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

namespace quorvel {
namespace {

// Reads the directory open as `fd` (which stays open for the caller).
platform::Result<std::vector<RCDirectoryEntry>> list(int fd, const std::string& what,
                                                     const RCDirectoryListingOptions& options) {
  const int streamFd = ::dup(fd);
  DIR* stream = streamFd < 0 ? nullptr : ::fdopendir(streamFd);
  if (!stream) {
    const int error = errno;
    if (streamFd >= 0) ::close(streamFd);
    return platform::fail(platform::posixError(error, "list " + what));
  }
  std::vector<RCDirectoryEntry> entries;
  errno = 0;
  while (const dirent* item = ::readdir(stream)) {
    const std::string_view name = item->d_name;
    if (name == "." || name == ".." || (options.filter && !options.filter(name))) continue;
    entries.push_back({std::string(name), RCFileStatus::at(fd, item->d_name)});
    errno = 0;
  }
  const int error = errno;
  ::closedir(stream);
  if (error != 0) return platform::fail(platform::posixError(error, "list " + what));
  return entries;
}

}  // namespace

platform::Result<std::vector<RCDirectoryEntry>> RCListDirectory(
    const std::string& path, const RCDirectoryListingOptions& options) {
  return RCListDirectoryAt(AT_FDCWD, path, options);
}

platform::Result<std::vector<RCDirectoryEntry>> RCListDirectoryAt(
    int parentFd, const std::string& name, const RCDirectoryListingOptions& options, int* fd) {
  const int flags = O_RDONLY | O_DIRECTORY | O_CLOEXEC | (options.noFollow ? O_NOFOLLOW : 0);
  const int opened = ::openat(parentFd, name.c_str(), flags);
  if (opened < 0) return platform::fail(platform::posixError(errno, "open " + name));
  auto entries = list(opened, name, options);
  if (fd && entries) {
    *fd = opened;
  } else {
    ::close(opened);
  }
  return entries;
}

}  // namespace quorvel
