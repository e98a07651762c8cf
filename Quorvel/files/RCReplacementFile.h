// RCReplacementFile: a file written beside its destination under a hidden
// temporary name (".<name>.<random>.tmp" in the same directory) and moved over
// the destination only when complete, so a crash leaves either the old file
// or the new one, never half of one. Used for outputs that libraries write by
// path (the composer's muxer) as well as for small files.
//
// The owner writes to tempPath() (directly, or by handing the path to a
// library), then calls commit(), which flushes the data to disk, renames the
// temporary file over the destination and flushes the directory. Destroying an
// uncommitted RCReplacementFile removes the temporary file. Not thread-safe:
// one owner uses it on one thread at a time; distinct instances are independent.
#pragma once

#include <string>
#include <string_view>

#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

class RCReplacementFile {
 public:
  // Creates the (empty) temporary file beside `destination`. Fails when the
  // directory does not exist or is not writable.
  static platform::Result<RCReplacementFile> create(const platform::URL& destination);
  // create(), write(bytes), commit().
  static platform::Status replace(const platform::URL& destination, std::string_view bytes);

  RCReplacementFile(RCReplacementFile&& other) noexcept;
  RCReplacementFile& operator=(RCReplacementFile&& other) noexcept;
  RCReplacementFile(const RCReplacementFile&) = delete;
  RCReplacementFile& operator=(const RCReplacementFile&) = delete;
  ~RCReplacementFile();

  const std::string& tempPath() const { return tempPath_; }
  const std::string& destinationPath() const { return destinationPath_; }

  // Replaces the temporary file's content with `bytes`.
  platform::Status write(std::string_view bytes);
  // fsync, rename over the destination, fsync the directory. After a failure
  // the temporary file is gone and the destination is untouched.
  platform::Status commit();
  // Removes the temporary file now (also done by the destructor).
  void discard();

 private:
  RCReplacementFile(std::string tempPath, std::string destinationPath);
  std::string tempPath_;
  std::string destinationPath_;
  bool pending_ = false;
};

}  // namespace quorvel
