// RCRemoveSettledFile: the one way a file that someone else may still be
// writing is deleted. A sync tool or `cp` writing a recording into the
// directory leaves, for a while, a file that is not playable yet (an m4a's
// index comes last); deleting it then would cost the user that recording.
//
// So the file is removed only when, looked at through a descriptor of its
// own right before the removal:
//   - it is still the file that was examined: same device, inode, size and
//     modification time (nothing replaced or wrote it in between);
//   - no other process has it open: the kernel grants a write lease only to
//     the one descriptor of a file, and the lease is held across the
//     removal, so a writer that opens it meanwhile waits for the removal to
//     end and then finds it gone rather than half-deleted. Where a lease
//     cannot be had for another reason (a file system without leases, a file
//     of another owner), the file must instead have been neither written nor
//     changed for `minimumQuietSeconds`;
//   - `stillUnwanted()` agrees, asked last (say, the database once more).
// Symbolic links and anything but regular files are never removed.
//
// A plain function without state of its own; safe to call from any thread.
// Taking a lease makes the kernel signal the process with SIGIO when another
// process opens the file; the first call therefore ignores SIGIO when it is
// at its default (which would end the process).
#pragma once

#include <functional>
#include <string>
#include <string_view>

#include "Quorvel/files/RCFileVersion.h"
#include "platform/Error.h"

namespace quorvel {

enum class RCSettledRemoval {
  Removed,
  // Nothing by that name any more.
  Missing,
  // A link, a directory or another kind of file.
  NotARegularFile,
  // Replaced or written since `examined`.
  Changed,
  // Another process has it open.
  OpenElsewhere,
  // No lease could be had, and it changed less than `minimumQuietSeconds` ago.
  TooRecent,
  // stillUnwanted() said no.
  Wanted,
};

// What `outcome` means, for a log line ("is open in another process").
std::string_view RCSettledRemovalDescription(RCSettledRemoval outcome);

// Removes the regular file `name` directly inside `directory` when it is
// settled as described above. An error only when the directory or the file
// cannot be looked at, or the removal itself fails; the file stays then.
platform::Result<RCSettledRemoval> RCRemoveSettledFile(const std::string& directory,
                                                       const std::string& name,
                                                       const RCFileVersion& examined,
                                                       double minimumQuietSeconds,
                                                       const std::function<bool()>& stillUnwanted);

}  // namespace quorvel
