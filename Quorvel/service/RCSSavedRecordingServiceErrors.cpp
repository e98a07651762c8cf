#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"

#include <charconv>
#include <optional>

#include "Quorvel/errors/RCErrors.h"

namespace quorvel {
namespace {

constexpr std::string_view kDomainPrefix = "Error Domain=";
constexpr std::string_view kCodeMarker = " Code=";
constexpr std::string_view kUnderlyingMarker = " (underlying error: ";

struct NamedCode {
  const char* name;
  long code;
};

constexpr NamedCode kServiceErrors[] = {
    {RCSDBusErrorMissingCompositionAVURL, RCSSavedRecordingServiceErrorMissingCompositionAVURL},
    {RCSDBusErrorConflictingSession, RCSSavedRecordingServiceErrorConflictingSession},
    {RCSDBusErrorDeferredRequestSuperseded, RCSSavedRecordingServiceErrorDeferredRequestSuperseded},
    {RCSDBusErrorCompositionFailed, RCSSavedRecordingServiceErrorCompositionFailed},
};

// Parses the form Error::description() writes. Domain and code are required;
// a tail that does not fit the form is ignored rather than failing the whole.
std::optional<platform::Error> parseDescription(std::string_view text, int depth) {
  if (depth > 32 || !text.starts_with(kDomainPrefix)) return std::nullopt;
  text.remove_prefix(kDomainPrefix.size());
  std::size_t codeAt = text.find(kCodeMarker);
  if (codeAt == std::string_view::npos || codeAt == 0) return std::nullopt;
  std::string domain(text.substr(0, codeAt));
  text.remove_prefix(codeAt + kCodeMarker.size());
  long code = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), code);
  if (ec != std::errc() || end == text.data()) return std::nullopt;
  text.remove_prefix(static_cast<std::size_t>(end - text.data()));

  std::string description;
  std::optional<platform::Error> underlying;
  if (text.starts_with(" \"")) {
    std::string_view quoted = text.substr(2);
    std::size_t marker = quoted.find(std::string("\"") + std::string(kUnderlyingMarker));
    if (marker != std::string_view::npos) {
      description = std::string(quoted.substr(0, marker));
      text = quoted.substr(marker + 1);
    } else if (!quoted.empty() && quoted.back() == '"') {
      description = std::string(quoted.substr(0, quoted.size() - 1));
      text = {};
    } else {
      text = {};
    }
  }
  if (text.starts_with(kUnderlyingMarker) && text.ends_with(')')) {
    std::string_view inner = text.substr(kUnderlyingMarker.size());
    inner.remove_suffix(1);
    underlying = parseDescription(inner, depth + 1);
  }
  if (underlying)
    return platform::Error(std::move(domain), code, std::move(description), *underlying);
  return platform::Error(std::move(domain), code, std::move(description));
}

}  // namespace

platform::Error RCSSavedRecordingServiceError(RCSSavedRecordingServiceErrorCode code) {
  return platform::Error(RCSSavedRecordingServiceErrorDomain, code);
}

RCSDBusError RCSDBusErrorFromError(const platform::Error& error) {
  RCSDBusError reply{RCSDBusErrorGeneric, error.description()};
  if (error.domain() == RCSSavedRecordingServiceErrorDomain) {
    for (const NamedCode& known : kServiceErrors) {
      if (known.code == error.code()) reply.name = known.name;
    }
  }
  return reply;
}

platform::Error RCSErrorFromDBusError(std::string_view name, std::string_view message) {
  if (auto parsed = parseDescription(message, 0)) return *parsed;
  for (const NamedCode& known : kServiceErrors) {
    if (name == known.name) return platform::Error(RCSSavedRecordingServiceErrorDomain, known.code);
  }
  if (name == RCSDBusErrorGeneric) {
    return platform::Error(RCErrorDomain, RCErrorCodeGeneric, std::string(message));
  }
  return platform::Error(std::string(name), 0, std::string(message));
}

}  // namespace quorvel
