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

namespace {

std::string describe(std::string_view name, std::int32_t type, std::string_view url,
                     std::string_view identifier) {
  const char* kind = type == RCSSavedRecordingAccessTypeShared      ? " (shared)"
                     : type == RCSSavedRecordingAccessTypeExclusive ? " (exclusive)"
                                                                    : "";
  return fmt::format(
      "<RCSSavedRecordingAccessToken name={} type={}{} compositionAVURL={} "
      "identifier={}>",
      name, type, kind, url, identifier);
}

}  // namespace

std::string RCSSavedRecordingAccessToken::debugDescription() const {
  return describe(accessName_, accessType_,
                  compositionAVURL_ ? compositionAVURL_->absoluteString() : "(null)",
                  identifier_.string());
}

std::string RCSSavedRecordingAccessToken::debugDescriptionOfTuple(const Tuple& tuple) {
  const auto& [name, type, url, identifier] = tuple;
  return describe(name, type, url.empty() ? "(null)" : url, identifier);
}

}  // namespace quorvel
