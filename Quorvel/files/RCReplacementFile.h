// RCReplacementFile: the framework's one atomic file replacement. The new
// contents are written beside the destination under a hidden temporary name
// (RCAtomicReplaceTempName(): ".<name>.<random>.tmp" in the same directory)
// and moved over the destination only when complete, so readers see the old
// file or the new one and a crash leaves one of the two, never half of one.
// Used for outputs that libraries write by path (the composer's muxer) as well
// as for small files (manifests, waveforms) and in-place edits (titles).
//
// The owner writes to tempPath() (directly, by handing the path to a library,
// or through fd()), then calls commit(), which flushes the data to disk,
// renames the temporary file over the destination and flushes the directory.
// Destroying an uncommitted RCReplacementFile removes the temporary file. Not
// thread-safe: one owner uses it on one thread at a time; distinct instances
// are independent.
#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>

#include "Quorvel/files/RCFile.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

class RCReplacementFile {
 public:
  // Creates the (empty) temporary file beside `destination`, with `mode`
  // limited by the umask. Fails when the directory does not exist or is not
  // writable.
  static platform::Result<RCReplacementFile> create(const platform::URL& destination,
                                                    mode_t mode = 0666);
  // The same for `directory`/`name`, refusing a `directory` that is itself a
  // symbolic link. `name` must be a single path component.
  static platform::Result<RCReplacementFile> createInDirectory(std::string_view directory,
                                                               std::string_view name,
                                                               mode_t mode = 0666);
  // create(), write(bytes), commit().
  static platform::Status replace(const platform::URL& destination, std::string_view bytes);

  RCReplacementFile(RCReplacementFile&& other) noexcept;
  RCReplacementFile& operator=(RCReplacementFile&& other) noexcept;
  RCReplacementFile(const RCReplacementFile&) = delete;
  RCReplacementFile& operator=(const RCReplacementFile&) = delete;
  ~RCReplacementFile();

  const std::string& tempPath() const { return tempPath_; }
  const std::string& destinationPath() const { return destinationPath_; }
  // The temporary file, open for reading and writing; owned by this object.
  int fd() const { return file_.get(); }

  // Replaces the temporary file's content with `bytes`.
  platform::Status write(std::string_view bytes);
  // fsync, rename over the destination, fsync the directory. After a failure
  // the temporary file is gone and the destination is untouched.
  platform::Status commit();
  // The identity of a file: device and inode.
  struct Identity {
    dev_t device = 0;
    ino_t inode = 0;
    friend bool operator==(const Identity&, const Identity&) = default;
  };
  // commit(), but only over the file `expected` that the new contents were
  // made from: when someone replaced the destination meanwhile (a compose
  // and a title write of one recording), nothing changes and the result is
  // RCErrorCodeChangedMeanwhile; the temporary file stays, so the caller can
  // bring it up to date and try again. The check and the replacement are
  // one atomic exchange of the two names, undone when the file taken out is
  // not `expected`.
  platform::Status commitReplacing(Identity expected);

  // Removes the temporary file now (also done by the destructor).
  void discard();

 private:
  RCReplacementFile(RCScopedFd directory, RCScopedFd file, std::string directoryPath,
                    std::string tempName, std::string destinationName);
  static platform::Result<RCReplacementFile> createIn(RCScopedFd directory,
                                                      std::string directoryPath,
                                                      std::string_view name, mode_t mode);

  RCScopedFd directory_;
  RCScopedFd file_;
  std::string tempName_;
  std::string destinationName_;
  std::string tempPath_;
  std::string destinationPath_;
  bool pending_ = false;
};

}  // namespace quorvel
