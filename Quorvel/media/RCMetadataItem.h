// RCMetadataItem: one item of an audio file's common metadata (a title),
// with the language it is tagged with. A value type.
//
// RCMetadataItemsWithLocale filters items by a BCP-47 language ("de-CH"):
// an item matches when its 3-letter code names the same language, in either
// the terminology or the bibliographic form ("deu" and "ger" both match "de").
// Untagged items match no locale. Pure functions; any thread.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace quorvel {

struct RCMetadataItem {
  std::string stringValue;
  // ISO 639-2 code as stored in the file ("deu", "ger", "eng"); empty when
  // the item carries no language.
  std::string language;

  friend bool operator==(const RCMetadataItem&, const RCMetadataItem&) = default;
};

// Whether the 3-letter code `iso639` names the language of the BCP-47 tag
// `localeIdentifier` (region, script and variants are ignored).
bool RCLanguageCodeMatchesLocale(std::string_view iso639, std::string_view localeIdentifier);

// The items whose language matches `localeIdentifier`, in their order.
std::vector<RCMetadataItem> RCMetadataItemsWithLocale(const std::vector<RCMetadataItem>& items,
                                                      std::string_view localeIdentifier);

// The ISO 639-2/T code for a language given as a 2- or 3-letter code or a
// BCP-47 tag ("de-CH" -> "deu", "ger" -> "deu"); empty when ICU knows none.
std::string RCISO639TerminologyCode(std::string_view language);

}  // namespace quorvel
