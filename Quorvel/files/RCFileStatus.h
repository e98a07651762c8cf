// RCFileStatus: what one look at a path (or descriptor) found, and the
// questions the framework asks of it: does it exist, is it a regular file, a
// directory, a symbolic link, an empty file. The looks never follow a link
// unless they say so. A plain value; any thread.
#pragma once

#include <sys/stat.h>

#include <cerrno>
#include <string>

namespace quorvel {

struct RCFileStatus {
  // The errno of a look that failed, 0 when it worked; a status not taken
  // from a look says nothing is there.
  int error = ENOENT;
  struct stat info {};

  // What `path` names itself (lstat), or, with the "Following" variant,
  // what a link there leads to (stat).
  static RCFileStatus atPath(const std::string& path);
  static RCFileStatus atPathFollowing(const std::string& path);
  // `name` in the directory open as `directoryFd`, not following a link.
  static RCFileStatus at(int directoryFd, const char* name);
  static RCFileStatus ofDescriptor(int fd);

  bool exists() const { return error == 0; }
  bool isRegularFile() const { return exists() && S_ISREG(info.st_mode); }
  bool isEmptyRegularFile() const { return isRegularFile() && info.st_size == 0; }
  bool isDirectory() const { return exists() && S_ISDIR(info.st_mode); }
  bool isSymbolicLink() const { return exists() && S_ISLNK(info.st_mode); }
};

}  // namespace quorvel
