// A file's creation date: its birth time, as statx reports it. Filesystems
// that keep none (and kernels or file systems that cannot say) give no date,
// which is not an error: callers fall back as they see fit. Symbolic links
// are not followed. Blocking file-system call; any thread.
#pragma once

#include <optional>
#include <string>

#include "platform/Date.h"

namespace quorvel {

std::optional<platform::Date> RCFileCreationDate(const std::string& path);

}  // namespace quorvel
