#include "Quorvel/files/RCFileCreationDate.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <chrono>

namespace quorvel {

std::optional<platform::Date> RCFileCreationDate(const std::string& path) {
  struct statx info {};
  if (::statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BTIME, &info) != 0 ||
      (info.stx_mask & STATX_BTIME) == 0) {
    return std::nullopt;
  }
  using namespace std::chrono;
  auto since = seconds(info.stx_btime.tv_sec) + nanoseconds(info.stx_btime.tv_nsec);
  return platform::Date(
      platform::Date::Clock::time_point(duration_cast<platform::Date::Clock::duration>(since)));
}

}  // namespace quorvel
