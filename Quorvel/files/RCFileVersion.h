// RCFileVersion: which version of a file a path named when it was looked at:
// its device, inode, size and modification time. Two equal versions mean the
// file was neither replaced nor written in between, as far as the file
// system's clock can tell (it is coarse: a write in the same tick as the look
// keeps the time). A plain value; any thread.
#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <optional>
#include <string>

namespace quorvel {

struct RCFileVersion {
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = 0;
  std::int64_t modifiedNanoseconds = 0;

  static RCFileVersion of(const struct stat& info) {
    return RCFileVersion{info.st_dev, info.st_ino, info.st_size,
                         std::int64_t{info.st_mtim.tv_sec} * 1'000'000'000 + info.st_mtim.tv_nsec};
  }
  // The version of what `path` names (the link itself, not its target);
  // nullopt when it cannot be looked at.
  static std::optional<RCFileVersion> atPath(const std::string& path) {
    struct stat info {};
    if (::lstat(path.c_str(), &info) != 0) return std::nullopt;
    return of(info);
  }

  friend bool operator==(const RCFileVersion&, const RCFileVersion&) = default;
};

}  // namespace quorvel
