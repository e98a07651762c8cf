// RCListDirectory: the entries of one directory, each with what a look at it
// (not following links) found, in the order the file system gives them.
// "." and ".." are left out; a name the filter refuses is not looked at. An
// entry that went between the listing and its look has a status whose
// error is ENOENT.
//
// Blocks on the file system; any thread.
#pragma once

#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "Quorvel/files/RCFileStatus.h"
#include "platform/Error.h"

namespace quorvel {

struct RCDirectoryEntry {
  std::string name;
  RCFileStatus status;
};

struct RCDirectoryListingOptions {
  // Refuse to list through a symbolic link (the directory itself must be
  // one, not lead to one).
  bool noFollow = false;
  // Which names to look at; all when empty.
  std::function<bool(std::string_view name)> filter;
};

// The directory at `path`; an error when it cannot be opened or read.
platform::Result<std::vector<RCDirectoryEntry>> RCListDirectory(
    const std::string& path, const RCDirectoryListingOptions& options = {});
// The directory `name` inside the directory open as `parentFd`, never
// through a link; `fd`, when given, receives a descriptor of it to use with
// the entries' names (the caller closes it).
platform::Result<std::vector<RCDirectoryEntry>> RCListDirectoryAt(
    int parentFd, const std::string& name, const RCDirectoryListingOptions& options = {},
    int* fd = nullptr);

}  // namespace quorvel
