#include "Quorvel/service/RCSSavedRecordingAccessToken.h"

#include <fmt/format.h>

namespace quorvel {

RCSSavedRecordingAccessToken::RCSSavedRecordingAccessToken(
    std::string accessName, std::int32_t accessType, std::optional<platform::URL> compositionAVURL,
    platform::UUID identifier)
    : accessName_(std::move(accessName)),
      accessType_(accessType),
      compositionAVURL_(std::move(compositionAVURL)),
      identifier_(identifier) {}

RCSSavedRecordingAccessToken RCSSavedRecordingAccessToken::tokenWithName(
    std::string accessName, std::int32_t accessType, platform::URL compositionAVURL) {
  return RCSSavedRecordingAccessToken(std::move(accessName), accessType,
                                      std::move(compositionAVURL), platform::UUID::random());
}

std::optional<RCSSavedRecordingAccessToken> RCSSavedRecordingAccessToken::fromTuple(
    const Tuple& tuple) {
  const auto& [name, type, urlString, identifierString] = tuple;
  auto identifier = platform::UUID::fromString(identifierString);
  if (!identifier) return std::nullopt;
  std::optional<platform::URL> url;
  if (!urlString.empty()) {
    url = platform::URL::fileURLFromString(urlString);
    if (!url) return std::nullopt;
  }
  return RCSSavedRecordingAccessToken(name, type, std::move(url), *identifier);
}

RCSSavedRecordingAccessToken::Tuple RCSSavedRecordingAccessToken::toTuple() const {
  return Tuple{accessName_, accessType_,
               compositionAVURL_ ? compositionAVURL_->absoluteString() : std::string(),
               identifier_.string()};
}

std::string RCSSavedRecordingAccessToken::debugDescription() const {
  const char* kind = accessType_ == RCSSavedRecordingAccessTypeShared      ? " (shared)"
                     : accessType_ == RCSSavedRecordingAccessTypeExclusive ? " (exclusive)"
                                                                           : "";
  return fmt::format(
      "<RCSSavedRecordingAccessToken name={} type={}{} compositionAVURL={} "
      "identifier={}>",
      accessName_, accessType_, kind,
      compositionAVURL_ ? compositionAVURL_->absoluteString() : "(null)", identifier_.string());
}

}  // namespace quorvel
