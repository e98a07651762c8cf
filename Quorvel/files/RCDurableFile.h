// Durable small-file I/O for manifests: atomic replacement (readers of the
// file see the old contents or the new ones, never a mix, and a crash at
// any point leaves one of the two) and reads that never follow a link.
// Plain functions; safe to call from any thread (two writers of one file:
// the last rename wins).
#pragma once

#include <string>
#include <string_view>

#include "platform/Error.h"

namespace quorvel {

// Writes `contents` to a new temporary file in `directory`, flushes it to
// disk, renames it over `directory`/`name` and flushes the directory. The
// directory itself must not be a symbolic link, and `name` must be a plain
// file name. On failure the temporary file is removed and the old file is
// untouched.
platform::Status RCWriteFileAtomically(std::string_view directory, std::string_view name,
                                       std::string_view contents);

// Reads the regular file `directory`/`name` without following a symbolic link
// in either; fails for anything larger than `maximumSize` bytes.
platform::Result<std::string> RCReadFileNoFollow(std::string_view directory, std::string_view name,
                                                 std::size_t maximumSize);

}  // namespace quorvel
