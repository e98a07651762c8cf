// RCFile: the framework's POSIX file I/O primitives. RCScopedFd owns one file
// descriptor and closes it exactly once; RCWriteFully / RCReadFully move whole
// buffers through a descriptor, retrying after EINTR and short transfers; the
// temporary-name functions define the one hidden name under which every atomic
// replacement (RCReplacementFile) writes its new contents, so a recovery run
// can recognise and sweep leftovers of a crash.
// RCScopedFd is not thread-safe: one owner uses it on one thread at a time.
// The free functions are safe to call from any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Error.h"

namespace quorvel {

class RCScopedFd {
 public:
  RCScopedFd() = default;
  // Takes ownership of `fd` (-1 for none).
  explicit RCScopedFd(int fd) : fd_(fd) {}
  RCScopedFd(RCScopedFd&& other) noexcept : fd_(other.release()) {}
  RCScopedFd& operator=(RCScopedFd&& other) noexcept;
  RCScopedFd(const RCScopedFd&) = delete;
  RCScopedFd& operator=(const RCScopedFd&) = delete;
  ~RCScopedFd() { reset(); }

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  explicit operator bool() const { return valid(); }
  // Gives up ownership without closing; the caller closes the result.
  int release();
  // Closes the owned descriptor (if any) and owns `fd` instead.
  void reset(int fd = -1);
  // Closes now and reports close()'s failure (a delayed write error on some
  // file systems); the descriptor is gone either way.
  platform::Status close();

 private:
  int fd_ = -1;
};

// Writes all of `bytes` to `fd`, continuing after short writes and EINTR.
// `what` names the file in the error.
platform::Status RCWriteFully(int fd, std::string_view bytes, std::string_view what);

// Reads from `fd` until `size` bytes are in `out` or the file ends; returns
// how many bytes were read. Continues after short reads and EINTR.
platform::Result<std::size_t> RCReadFully(int fd, void* out, std::size_t size,
                                          std::string_view what);

// Reads `size` bytes at `offset` without moving the file position; false on an
// error or when the file ends first (errno is 0 then).
bool RCPreadFully(int fd, std::uint64_t offset, std::size_t size, void* out);

// A fresh temporary name for replacing the file `fileName`:
// ".<fileName>.<8 random letters or digits>.tmp".
std::string RCAtomicReplaceTempName(std::string_view fileName);

// Whether `fileName` (a last path component) has the form that
// RCAtomicReplaceTempName() produces.
bool RCIsAtomicReplaceTempName(std::string_view fileName);

}  // namespace quorvel
