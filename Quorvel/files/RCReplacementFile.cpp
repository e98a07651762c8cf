#include "Quorvel/files/RCReplacementFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <optional>
#include <utility>

#include "Quorvel/errors/RCErrors.h"

namespace quorvel {
namespace {

std::string directoryOf(const std::string& path) {
  const auto slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

std::string joined(const std::string& directory, std::string_view name) {
  return fmt::format("{}/{}", directory == "/" ? "" : directory, name);
}

// fsync that treats "this file system cannot sync this kind of file" as done.
platform::Status syncFd(int fd, std::string_view what) {
  if (::fsync(fd) != 0 && errno != EINVAL) {
    return platform::fail(platform::posixError(errno, fmt::format("cannot flush {}", what)));
  }
  return {};
}

}  // namespace

RCReplacementFile::RCReplacementFile(RCScopedFd directory, RCScopedFd file,
                                     std::string directoryPath, std::string tempName,
                                     std::string destinationName)
    : directory_(std::move(directory)),
      file_(std::move(file)),
      tempName_(std::move(tempName)),
      destinationName_(std::move(destinationName)),
      tempPath_(joined(directoryPath, tempName_)),
      destinationPath_(joined(directoryPath, destinationName_)),
      pending_(true) {}

RCReplacementFile::RCReplacementFile(RCReplacementFile&& other) noexcept
    : directory_(std::move(other.directory_)),
      file_(std::move(other.file_)),
      tempName_(std::move(other.tempName_)),
      destinationName_(std::move(other.destinationName_)),
      tempPath_(std::move(other.tempPath_)),
      destinationPath_(std::move(other.destinationPath_)),
      pending_(std::exchange(other.pending_, false)) {}

RCReplacementFile& RCReplacementFile::operator=(RCReplacementFile&& other) noexcept {
  if (this != &other) {
    discard();
    directory_ = std::move(other.directory_);
    file_ = std::move(other.file_);
    tempName_ = std::move(other.tempName_);
    destinationName_ = std::move(other.destinationName_);
    tempPath_ = std::move(other.tempPath_);
    destinationPath_ = std::move(other.destinationPath_);
    pending_ = std::exchange(other.pending_, false);
  }
  return *this;
}

RCReplacementFile::~RCReplacementFile() { discard(); }

platform::Result<RCReplacementFile> RCReplacementFile::createIn(RCScopedFd directory,
                                                                std::string directoryPath,
                                                                std::string_view name,
                                                                mode_t mode) {
  if (name.empty() || name == "." || name == ".." || name.find('/') != std::string_view::npos) {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeInvalidArgument, fmt::format("not a file name: {}", name)));
  }
  for (int attempt = 0; attempt < 16; ++attempt) {
    std::string tempName = RCAtomicReplaceTempName(name);
    RCScopedFd file(::openat(directory.get(), tempName.c_str(),
                             O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode));
    if (file) {
      return RCReplacementFile(std::move(directory), std::move(file), std::move(directoryPath),
                               std::move(tempName), std::string(name));
    }
    if (errno != EEXIST) {
      return platform::fail(platform::posixError(
          errno, fmt::format("cannot create a temporary file in {}", directoryPath)));
    }
  }
  return platform::fail(
      RCMediaError(RCMediaErrorCodeFileSystem, "no free temporary file name in " + directoryPath));
}

platform::Result<RCReplacementFile> RCReplacementFile::create(const platform::URL& destination,
                                                              mode_t mode) {
  std::string directoryPath = directoryOf(destination.path());
  RCScopedFd directory(::open(directoryPath.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!directory) {
    return platform::fail(platform::posixError(
        errno, fmt::format("cannot create a temporary file in {}", directoryPath)));
  }
  return createIn(std::move(directory), std::move(directoryPath), destination.lastPathComponent(),
                  mode);
}

platform::Result<RCReplacementFile> RCReplacementFile::createInDirectory(std::string_view directory,
                                                                         std::string_view name,
                                                                         mode_t mode) {
  std::string directoryPath(directory);
  RCScopedFd directoryFd(
      ::open(directoryPath.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!directoryFd) return platform::fail(platform::posixError(errno, "open " + directoryPath));
  return createIn(std::move(directoryFd), std::move(directoryPath), name, mode);
}

platform::Status RCReplacementFile::replace(const platform::URL& destination,
                                            std::string_view bytes) {
  auto file = create(destination);
  if (!file) return platform::fail(file.error());
  if (auto written = file->write(bytes); !written) return written;
  return file->commit();
}

platform::Status RCReplacementFile::write(std::string_view bytes) {
  if (!pending_) {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeFileSystem, "the temporary file is gone or committed"));
  }
  if (::ftruncate(file_.get(), 0) != 0 || ::lseek(file_.get(), 0, SEEK_SET) != 0) {
    return platform::fail(platform::posixError(errno, "cannot write " + tempPath_));
  }
  return RCWriteFully(file_.get(), bytes, tempPath_);
}

platform::Status RCReplacementFile::commit() {
  if (!pending_) {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeFileSystem, "the temporary file is gone or committed"));
  }
  // A library that wrote by path may have replaced the file it was given, so
  // the flush goes to whatever now has the temporary name.
  RCScopedFd written(
      ::openat(directory_.get(), tempName_.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  platform::Status status =
      written ? syncFd(written.get(), tempPath_)
              : platform::fail(platform::posixError(errno, "cannot open " + tempPath_));
  if (status && ::renameat(directory_.get(), tempName_.c_str(), directory_.get(),
                           destinationName_.c_str()) != 0) {
    status = platform::fail(platform::posixError(errno, "cannot rename over " + destinationPath_));
  }
  if (!status) {
    discard();
    return status;
  }
  pending_ = false;
  file_.reset();
  // The rename is done; a directory that cannot be flushed does not undo it.
  (void)syncFd(directory_.get(), "directory");
  directory_.reset();
  return {};
}

platform::Status RCReplacementFile::commitReplacing(Identity expected) {
  if (!pending_) {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeFileSystem, "the temporary file is gone or committed"));
  }
  RCScopedFd written(
      ::openat(directory_.get(), tempName_.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  if (!written) return platform::fail(platform::posixError(errno, "cannot open " + tempPath_));
  if (auto synced = syncFd(written.get(), tempPath_); !synced) return synced;
  auto exchange = [&] {
    return ::renameat2(directory_.get(), tempName_.c_str(), directory_.get(),
                       destinationName_.c_str(), RENAME_EXCHANGE) == 0;
  };
  auto changed = [&] {
    return platform::fail(RCError(RCErrorCodeChangedMeanwhile,
                                  destinationPath_ + " was replaced while it was being rewritten"));
  };
  auto identityOf = [&](const std::string& name) -> std::optional<Identity> {
    struct stat info {};
    if (::fstatat(directory_.get(), name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) {
      return std::nullopt;
    }
    return Identity{info.st_dev, info.st_ino};
  };
  if (!exchange()) {
    if (errno == ENOENT) return changed();
    if (errno != EINVAL) {
      return platform::fail(
          platform::posixError(errno, "cannot exchange " + tempPath_ + " and " + destinationPath_));
    }
    // A file system without exchange: check, then rename (a narrow window).
    if (identityOf(destinationName_) != expected) return changed();
    return commit();
  }
  if (identityOf(tempName_) != expected) {
    exchange();  // put the other writer's file back
    return changed();
  }
  ::unlinkat(directory_.get(), tempName_.c_str(), 0);  // the file it replaced
  pending_ = false;
  file_.reset();
  (void)syncFd(directory_.get(), "directory");
  directory_.reset();
  return {};
}

void RCReplacementFile::discard() {
  if (pending_) {
    ::unlinkat(directory_.get(), tempName_.c_str(), 0);
    pending_ = false;
  }
  file_.reset();
  directory_.reset();
}

}  // namespace quorvel
