#include "platform/Error.h"

#include <cstring>
#include <ostream>

namespace platform {

Error::Error(std::string domain, long code, std::string description)
    : domain_(std::move(domain)), code_(code), description_(std::move(description)) {}

Error::Error(std::string domain, long code, std::string description, Error underlying)
    : domain_(std::move(domain)),
      code_(code),
      description_(std::move(description)),
      underlying_(std::make_shared<const Error>(std::move(underlying))) {}

std::string Error::description() const {
  std::string text = fmt::format("Error Domain={} Code={}", domain_, code_);
  if (!description_.empty()) text += fmt::format(" \"{}\"", description_);
  if (underlying_) text += fmt::format(" (underlying error: {})", underlying_->description());
  return text;
}

std::ostream& operator<<(std::ostream& out, const Error& error) {
  return out << error.description();
}

Error posixError(int err, std::string_view what) {
  char buffer[256];
  const char* message = strerror_r(err, buffer, sizeof buffer);
  return Error(kPOSIXErrorDomain, err, fmt::format("{}: {}", what, message));
}

}  // namespace platform
