#include "Quorvel/errors/RCErrors.h"

namespace quorvel {

namespace {
constexpr const char* kGenericDescription = "The operation could not be completed.";
}  // namespace

platform::Error RCError(RCErrorCode code, std::string description) {
  return platform::Error(RCErrorDomain, code, std::move(description));
}

platform::Error RCGenericError() {
  return platform::Error(RCErrorDomain, RCErrorCodeGeneric, kGenericDescription);
}

platform::Error RCGenericErrorWithUnderlyingError(const platform::Error& underlying) {
  return platform::Error(RCErrorDomain, RCErrorCodeGeneric, kGenericDescription, underlying);
}

platform::Error RCMediaError(RCMediaErrorCode code, std::string description) {
  return platform::Error(kRCMediaErrorDomain, code, std::move(description));
}

bool RCIsAudioDataError(const platform::Error& error) {
  if (error.domain() == kRCAudioAssetErrorDomain) return true;
  if (error.domain() != kRCMediaErrorDomain) return false;
  switch (error.code()) {
    case RCMediaErrorCodeCannotOpen:
    case RCMediaErrorCodeNoAudioStream:
    case RCMediaErrorCodeDecodeFailed:
    case RCMediaErrorCodeTruncated:
      return true;
    default:
      return false;
  }
}

platform::Error RCComposerSegmentError(std::size_t segmentIndex,
                                       const platform::Error& underlying) {
  return platform::Error(kRCComposerSegmentErrorDomain, static_cast<long>(segmentIndex),
                         "segment " + std::to_string(segmentIndex) + " cannot be read", underlying);
}

std::optional<std::size_t> RCComposerFailedSegment(const platform::Error& error) {
  if (error.domain() != kRCComposerSegmentErrorDomain || error.code() < 0) return std::nullopt;
  return static_cast<std::size_t>(error.code());
}

}  // namespace quorvel
