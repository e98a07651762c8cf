#include "Quorvel/files/RCDurableFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCFileConfinement.h"
#include "Quorvel/files/RCFileStatus.h"
#include "Quorvel/files/RCReplacementFile.h"

namespace quorvel {

platform::Status RCWriteFileAtomically(std::string_view directory, std::string_view name,
                                       std::string_view contents) {
  if (!RCIsPlainFileName(name)) {
    return platform::fail(RCError(RCErrorCodeNotConfined, "not a plain file name"));
  }
  auto file = RCReplacementFile::createInDirectory(directory, name, 0644);
  if (!file) return platform::fail(file.error());
  if (auto written = file->write(contents); !written) return written;
  return file->commit();
}

platform::Result<std::string> RCReadFileNoFollow(std::string_view directory, std::string_view name,
                                                 std::size_t maximumSize) {
  std::string dirPath(directory);
  RCScopedFd dir(::open(dirPath.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!dir) return platform::fail(platform::posixError(errno, "open " + dirPath));
  std::string fileName(name);
  RCScopedFd file(::openat(dir.get(), fileName.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  if (!file) return platform::fail(platform::posixError(errno, "open " + fileName));
  const RCFileStatus status = RCFileStatus::ofDescriptor(file.get());
  if (!status.exists()) {
    return platform::fail(platform::posixError(status.error, "stat " + fileName));
  }
  if (!status.isRegularFile()) {
    return platform::fail(RCError(RCErrorCodeNotConfined, fileName + " is not a regular file"));
  }
  const struct stat& info = status.info;
  if (static_cast<std::size_t>(info.st_size) > maximumSize) {
    return platform::fail(RCError(RCErrorCodeInvalidManifest, fileName + " is too large"));
  }
  std::string contents;
  char buffer[16384];
  for (;;) {
    auto got = RCReadFully(file.get(), buffer, sizeof buffer, fileName);
    if (!got) return platform::fail(got.error());
    contents.append(buffer, *got);
    if (contents.size() > maximumSize) {
      return platform::fail(RCError(RCErrorCodeInvalidManifest, fileName + " is too large"));
    }
    if (*got < sizeof buffer) break;
  }
  return contents;
}

}  // namespace quorvel
