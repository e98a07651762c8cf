#include "Quorvel/files/RCReplacementFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <random>
#include <utility>

#include "Quorvel/errors/RCMediaError.h"

namespace quorvel {
namespace {

std::string randomSuffix() {
  static constexpr char kAlphabet[] = "abcdefghijklmnopqrstuvwxyz0123456789";
  thread_local std::mt19937_64 generator{std::random_device{}()};
  std::string suffix(8, 'x');
  for (char& c : suffix) c = kAlphabet[generator() % (sizeof kAlphabet - 1)];
  return suffix;
}

std::string directoryOf(const std::string& path) {
  const auto slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

platform::Status fsyncPath(const std::string& path, int flags, std::string_view what) {
  const int fd = ::open(path.c_str(), flags | O_CLOEXEC);
  if (fd < 0) return platform::fail(platform::posixError(errno, what));
  const int result = ::fsync(fd);
  const int err = errno;
  ::close(fd);
  if (result != 0 && err != EINVAL) return platform::fail(platform::posixError(err, what));
  return {};
}

}  // namespace

RCReplacementFile::RCReplacementFile(std::string tempPath, std::string destinationPath)
    : tempPath_(std::move(tempPath)),
      destinationPath_(std::move(destinationPath)),
      pending_(true) {}

RCReplacementFile::RCReplacementFile(RCReplacementFile&& other) noexcept
    : tempPath_(std::move(other.tempPath_)),
      destinationPath_(std::move(other.destinationPath_)),
      pending_(std::exchange(other.pending_, false)) {}

RCReplacementFile& RCReplacementFile::operator=(RCReplacementFile&& other) noexcept {
  if (this != &other) {
    discard();
    tempPath_ = std::move(other.tempPath_);
    destinationPath_ = std::move(other.destinationPath_);
    pending_ = std::exchange(other.pending_, false);
  }
  return *this;
}

RCReplacementFile::~RCReplacementFile() { discard(); }

platform::Result<RCReplacementFile> RCReplacementFile::create(const platform::URL& destination) {
  const std::string& destinationPath = destination.path();
  const std::string directory = directoryOf(destinationPath);
  const std::string name = destination.lastPathComponent();
  for (int attempt = 0; attempt < 16; ++attempt) {
    std::string tempPath =
        fmt::format("{}/.{}.{}.tmp", directory == "/" ? "" : directory, name, randomSuffix());
    // 0666 so the umask decides, as for any new file.
    const int fd = ::open(tempPath.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
    if (fd >= 0) {
      ::close(fd);
      return RCReplacementFile(std::move(tempPath), destinationPath);
    }
    if (errno != EEXIST)
      return platform::fail(platform::posixError(
          errno, fmt::format("cannot create a temporary file in {}", directory)));
  }
  return platform::fail(
      RCMediaError(RCMediaErrorCode::FileSystem, "no free temporary file name in " + directory));
}

platform::Status RCReplacementFile::replace(const platform::URL& destination,
                                            std::string_view bytes) {
  auto file = create(destination);
  if (!file) return platform::fail(file.error());
  if (auto written = file->write(bytes); !written) return written;
  return file->commit();
}

platform::Status RCReplacementFile::write(std::string_view bytes) {
  const int fd = ::open(tempPath_.c_str(), O_WRONLY | O_TRUNC | O_CLOEXEC);
  if (fd < 0) return platform::fail(platform::posixError(errno, "cannot open " + tempPath_));
  while (!bytes.empty()) {
    const ssize_t written = ::write(fd, bytes.data(), bytes.size());
    if (written < 0) {
      if (errno == EINTR) continue;
      const int err = errno;
      ::close(fd);
      return platform::fail(platform::posixError(err, "cannot write " + tempPath_));
    }
    bytes.remove_prefix(static_cast<std::size_t>(written));
  }
  if (::close(fd) != 0)
    return platform::fail(platform::posixError(errno, "cannot write " + tempPath_));
  return {};
}

platform::Status RCReplacementFile::commit() {
  if (!pending_)
    return platform::fail(
        RCMediaError(RCMediaErrorCode::FileSystem, "the temporary file is gone or committed"));
  if (auto synced = fsyncPath(tempPath_, O_RDONLY, "cannot flush " + tempPath_); !synced) {
    discard();
    return synced;
  }
  if (::rename(tempPath_.c_str(), destinationPath_.c_str()) != 0) {
    const int err = errno;
    discard();
    return platform::fail(platform::posixError(err, "cannot rename over " + destinationPath_));
  }
  pending_ = false;
  // The rename is done; a directory that cannot be flushed does not undo it.
  (void)fsyncPath(directoryOf(destinationPath_), O_RDONLY | O_DIRECTORY, "flush directory");
  return {};
}

void RCReplacementFile::discard() {
  if (pending_) {
    ::unlink(tempPath_.c_str());
    pending_ = false;
  }
}

}  // namespace quorvel
