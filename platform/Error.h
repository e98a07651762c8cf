// Error: an error value with a domain, a code, a human-readable description
// and an optional underlying error. Immutable; copyable; safe to share across
// threads. Results of fallible operations are Result<T> / Status.
#pragma once

#include <fmt/format.h>

#include <iosfwd>
#include <memory>
#include <string>

#include "platform/Expected.h"

namespace platform {

class Error {
 public:
  Error(std::string domain, long code, std::string description = {});
  Error(std::string domain, long code, std::string description, Error underlying);

  const std::string& domain() const { return domain_; }
  long code() const { return code_; }
  // The text given at creation; may be empty.
  const std::string& localizedDescription() const { return description_; }
  // The error this one wraps, or nullptr.
  const Error* underlyingError() const { return underlying_.get(); }

  // "Error Domain=<domain> Code=<code> "<description>"" followed by the
  // underlying error's description, as shown in logs.
  std::string description() const;

  // Two errors are equal when domain and code are.
  friend bool operator==(const Error& a, const Error& b) {
    return a.code_ == b.code_ && a.domain_ == b.domain_;
  }

 private:
  std::string domain_;
  long code_;
  std::string description_;
  std::shared_ptr<const Error> underlying_;
};

std::ostream& operator<<(std::ostream& out, const Error& error);

template <class T>
using Result = expected<T, Error>;
using Status = expected<void, Error>;

// `return platform::fail(error);` from a function returning Result or Status.
inline unexpected<Error> fail(Error error) { return unexpected<Error>(std::move(error)); }

// The domain of errors that come from the operating system (code = errno).
inline constexpr const char* kPOSIXErrorDomain = "org.quorvel.POSIXError";
// An Error for errno value `err`, described as "<what>: <strerror>".
Error posixError(int err, std::string_view what);

}  // namespace platform

template <>
struct fmt::formatter<platform::Error> : fmt::formatter<std::string> {
  auto format(const platform::Error& error, fmt::format_context& ctx) const {
    return fmt::formatter<std::string>::format(error.description(), ctx);
  }
};
