#include "Quorvel/errors/RCMediaError.h"

extern "C" {
#include <libavutil/error.h>
}

namespace quorvel {

platform::Error RCMediaError(RCMediaErrorCode code, std::string description) {
  return platform::Error(kRCMediaErrorDomain, static_cast<long>(code), std::move(description));
}

platform::Error RCMediaErrorFromAV(RCMediaErrorCode code, int averror, std::string_view what) {
  char text[AV_ERROR_MAX_STRING_SIZE] = {};
  av_strerror(averror, text, sizeof text);
  return RCMediaError(code, fmt::format("{}: {}", what, text));
}

}  // namespace quorvel
