#include "Quorvel/files/RCFile.h"

#include <unistd.h>

#include <cerrno>
#include <random>
#include <utility>

namespace quorvel {
namespace {

constexpr std::string_view kTempAlphabet = "abcdefghijklmnopqrstuvwxyz0123456789";
constexpr std::size_t kTempRandomLength = 8;
constexpr std::string_view kTempSuffix = ".tmp";

}  // namespace

RCScopedFd& RCScopedFd::operator=(RCScopedFd&& other) noexcept {
  if (this != &other) reset(other.release());
  return *this;
}

int RCScopedFd::release() { return std::exchange(fd_, -1); }

void RCScopedFd::reset(int fd) {
  // close() is not retried after EINTR: on Linux the descriptor is gone
  // either way, and a retry could close one another thread just opened.
  if (fd_ >= 0 && fd_ != fd) ::close(fd_);
  fd_ = fd;
}

platform::Status RCScopedFd::close() {
  if (fd_ < 0) return {};
  const int result = ::close(release());
  if (result != 0 && errno != EINTR) return platform::fail(platform::posixError(errno, "close"));
  return {};
}

platform::Status RCWriteFully(int fd, std::string_view bytes, std::string_view what) {
  while (!bytes.empty()) {
    const ssize_t written = ::write(fd, bytes.data(), bytes.size());
    if (written < 0) {
      if (errno == EINTR) continue;
      return platform::fail(platform::posixError(errno, fmt::format("cannot write {}", what)));
    }
    if (written == 0) {
      return platform::fail(platform::posixError(EIO, fmt::format("cannot write {}", what)));
    }
    bytes.remove_prefix(static_cast<std::size_t>(written));
  }
  return {};
}

platform::Result<std::size_t> RCReadFully(int fd, void* out, std::size_t size,
                                          std::string_view what) {
  auto* cursor = static_cast<char*>(out);
  std::size_t done = 0;
  while (done < size) {
    const ssize_t got = ::read(fd, cursor + done, size - done);
    if (got < 0) {
      if (errno == EINTR) continue;
      return platform::fail(platform::posixError(errno, fmt::format("cannot read {}", what)));
    }
    if (got == 0) break;
    done += static_cast<std::size_t>(got);
  }
  return done;
}

bool RCPreadFully(int fd, std::uint64_t offset, std::size_t size, void* out) {
  auto* cursor = static_cast<char*>(out);
  while (size > 0) {
    const ssize_t got = ::pread(fd, cursor, size, static_cast<off_t>(offset));
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) {
      if (got == 0) errno = 0;
      return false;
    }
    cursor += got, offset += static_cast<std::uint64_t>(got), size -= static_cast<std::size_t>(got);
  }
  return true;
}

std::string RCAtomicReplaceTempName(std::string_view fileName) {
  thread_local std::mt19937_64 generator{std::random_device{}()};
  std::string random(kTempRandomLength, 'x');
  for (char& c : random) c = kTempAlphabet[generator() % kTempAlphabet.size()];
  return fmt::format(".{}.{}{}", fileName, random, kTempSuffix);
}

bool RCIsAtomicReplaceTempName(std::string_view fileName) {
  // "." + at least one character of the name + "." + random + ".tmp"
  constexpr std::size_t kFixed = 1 + 1 + kTempRandomLength + kTempSuffix.size();
  if (fileName.size() <= kFixed || fileName.front() != '.' || !fileName.ends_with(kTempSuffix)) {
    return false;
  }
  fileName.remove_suffix(kTempSuffix.size());
  const std::string_view random = fileName.substr(fileName.size() - kTempRandomLength);
  if (random.find_first_not_of(kTempAlphabet) != std::string_view::npos) return false;
  return fileName[fileName.size() - kTempRandomLength - 1] == '.';
}

}  // namespace quorvel
