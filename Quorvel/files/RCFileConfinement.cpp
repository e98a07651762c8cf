// Removal walks the path from the recordings directory with one openat per
// component, each with O_NOFOLLOW, and removes the last component relative
// to its parent's descriptor. So a component swapped for a symbolic link
// between checks still cannot lead the removal out of the directory: the
// kernel refuses to follow it.
#include "Quorvel/files/RCFileConfinement.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCDirectoryListing.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCRecordingsDirectory.h"

namespace quorvel {
namespace {

constexpr int kMaximumTreeDepth = 64;

std::string standardizedDirectoryPath(std::string_view directory) {
  return platform::URL::fileURLWithPath(directory).URLByStandardizingPath().path();
}

std::vector<std::string> splitPath(std::string_view path) {
  std::vector<std::string> parts;
  while (!path.empty()) {
    std::size_t slash = path.find('/');
    std::string_view part = path.substr(0, slash);
    if (!part.empty()) parts.emplace_back(part);
    if (slash == std::string_view::npos) break;
    path.remove_prefix(slash + 1);
  }
  return parts;
}

// Removes everything inside the directory `name` of `parent`, then the
// directory. Keeps going after a failure and reports the first one.
platform::Status removeTree(int parent, const std::string& name, int depth) {
  if (depth > kMaximumTreeDepth) {
    return platform::fail(RCError(RCErrorCodeNotConfined, "directory tree too deep to remove"));
  }
  int opened = -1;
  auto entries = RCListDirectoryAt(parent, name, {.noFollow = true}, &opened);
  if (!entries) return platform::fail(entries.error());
  RCScopedFd fd(opened);
  platform::Status first;
  for (const RCDirectoryEntry& entry : *entries) {
    platform::Status status;
    if (!entry.status.exists()) {
      if (entry.status.error != ENOENT)
        status = platform::fail(platform::posixError(entry.status.error, entry.name));
    } else if (entry.status.isDirectory()) {
      status = removeTree(fd.get(), entry.name, depth + 1);
    } else if (::unlinkat(fd.get(), entry.name.c_str(), 0) != 0 && errno != ENOENT) {
      status = platform::fail(platform::posixError(errno, "remove " + entry.name));
    }
    if (!status && first) first = status;
  }
  if (::unlinkat(parent, name.c_str(), AT_REMOVEDIR) != 0 && first) {
    first = platform::fail(platform::posixError(errno, "remove " + name));
  }
  return first;
}

}  // namespace

std::optional<std::string> RCPathRelativeToDirectory(const platform::URL& url,
                                                     std::string_view directory) {
  std::string root = standardizedDirectoryPath(directory);
  std::string path = url.URLByStandardizingPath().path();
  if (root != "/") root += '/';
  if (path.size() <= root.size() || path.compare(0, root.size(), root) != 0) return std::nullopt;
  return path.substr(root.size());
}

bool RCIsURLDirectlyInsideDirectory(const platform::URL& url, std::string_view directory) {
  auto relative = RCPathRelativeToDirectory(url, directory);
  return relative && relative->find('/') == std::string::npos;
}

bool RCIsPlainFileName(std::string_view name) {
  return !name.empty() && name != "." && name != ".." &&
         name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

platform::Status RCRemoveItemConfinedToDirectory(const platform::URL& url,
                                                 std::string_view directory) {
  auto relative = RCPathRelativeToDirectory(url, directory);
  if (!relative) {
    return platform::fail(
        RCError(RCErrorCodeNotConfined,
                "refusing to remove " + url.path() + ": not inside " + std::string(directory)));
  }
  std::vector<std::string> parts = splitPath(*relative);
  if (parts.empty()) {
    return platform::fail(RCError(RCErrorCodeNotConfined, "refusing to remove " + url.path()));
  }
  std::string root = standardizedDirectoryPath(directory);
  RCScopedFd current(::open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (current.get() < 0) return platform::fail(platform::posixError(errno, "open " + root));
  for (std::size_t i = 0; i + 1 < parts.size(); ++i) {
    int next =
        ::openat(current.get(), parts[i].c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (next < 0) {
      if (errno == ELOOP || errno == ENOTDIR) {
        return platform::fail(RCError(RCErrorCodeNotConfined,
                                      "refusing to remove " + url.path() +
                                          ": its path passes through a symbolic link or file"));
      }
      return platform::fail(platform::posixError(errno, "open " + parts[i]));
    }
    current.reset(next);
  }
  const std::string& name = parts.back();
  struct stat info {};
  if (::fstatat(current.get(), name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) {
    return platform::fail(platform::posixError(errno, "remove " + url.path()));
  }
  if (S_ISDIR(info.st_mode)) return removeTree(current.get(), name, 0);
  if (::unlinkat(current.get(), name.c_str(), 0) != 0) {
    return platform::fail(platform::posixError(errno, "remove " + url.path()));
  }
  return {};
}

platform::Status RCRemoveItemInSavedRecordingsDirectory(const platform::URL& url) {
  return RCRemoveItemConfinedToDirectory(url, RCSavedRecordingsDirectory());
}

}  // namespace quorvel
