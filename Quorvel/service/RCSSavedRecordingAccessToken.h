// RCSSavedRecordingAccessToken: the value that names one open access session
// (access name, access type, composition AVURL, random identifier). The
// session registry creates it; it travels to the client as the (siss) tuple
// and comes back the same way. A value type: copyable, immutable, safe to
// share across threads.
//
// Equality compares all four fields, so a token that made the trip through
// the tuple compares equal to the one kept, and two tokens made separately
// never do (their identifiers differ), even for the same name and recording.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <tuple>

#include "platform/URL.h"
#include "platform/UUID.h"

namespace quorvel {

enum RCSSavedRecordingAccessType : std::int32_t {
  RCSSavedRecordingAccessTypeShared = 1,
  RCSSavedRecordingAccessTypeExclusive = 2,
};

class RCSSavedRecordingAccessToken {
 public:
  // The wire form: (access name, access type, composition AVURL absolute
  // string, identifier string); "no token" is ("", 0, "", "").
  using Tuple = std::tuple<std::string, std::int32_t, std::string, std::string>;

  // A new token with a fresh random identifier.
  static RCSSavedRecordingAccessToken tokenWithName(std::string accessName, std::int32_t accessType,
                                                    platform::URL compositionAVURL);

  // The token a tuple stands for; nullopt for "no token" and for a tuple whose
  // identifier is not a UUID or whose URL is neither empty nor a file URL.
  static std::optional<RCSSavedRecordingAccessToken> fromTuple(const Tuple& tuple);
  // The tuple of "no token".
  static Tuple noTokenTuple() { return Tuple{"", 0, "", ""}; }

  Tuple toTuple() const;

  const std::string& accessName() const { return accessName_; }
  // 1 shared, 2 exclusive.
  std::int32_t accessType() const { return accessType_; }
  // The recording the session is for; nullopt only for a token read from a
  // tuple without a URL.
  const std::optional<platform::URL>& compositionAVURL() const { return compositionAVURL_; }
  const platform::UUID& identifier() const { return identifier_; }

  // "<RCSSavedRecordingAccessToken name=capture type=2 (exclusive) compositionAVURL=file:///…
  // identifier=E621E1F8-…>"
  std::string debugDescription() const;
  // The same for a tuple that may name no token at all (an identifier that
  // is not a UUID, say), as a client sent it.
  static std::string debugDescriptionOfTuple(const Tuple& tuple);

  friend bool operator==(const RCSSavedRecordingAccessToken&,
                         const RCSSavedRecordingAccessToken&) = default;

 private:
  RCSSavedRecordingAccessToken(std::string accessName, std::int32_t accessType,
                               std::optional<platform::URL> compositionAVURL,
                               platform::UUID identifier);

  std::string accessName_;
  std::int32_t accessType_;
  std::optional<platform::URL> compositionAVURL_;
  platform::UUID identifier_;
};

}  // namespace quorvel
