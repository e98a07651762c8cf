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

}  // namespace quorvel
