#include "Quorvel/media/RCMetadataItem.h"

#include <unicode/locid.h>

#include <algorithm>
#include <cctype>

namespace quorvel {
namespace {

// The canonical 2-letter (or, without one, 3-letter) language of a code or
// tag: "ger", "deu", "de", "de-CH" and "de_CH" all give "de".
std::string canonicalLanguage(std::string_view text) {
  if (text.empty() || text.size() > 64) return {};
  std::string tag(text);
  std::replace(tag.begin(), tag.end(), '_', '-');
  UErrorCode status = U_ZERO_ERROR;
  icu::Locale parsed = icu::Locale::forLanguageTag(tag, status);
  if (U_FAILURE(status) || parsed.isBogus()) return {};
  // forLanguageTag keeps bibliographic codes ("ger") as they are; the
  // canonicalization's alias data maps them to the language proper.
  icu::Locale canonical = icu::Locale::createCanonical(parsed.getName());
  std::string language = canonical.getLanguage();
  std::transform(language.begin(), language.end(), language.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  if (language == "und") return {};
  return language;
}

}  // namespace

bool RCLanguageCodeMatchesLocale(std::string_view iso639, std::string_view localeIdentifier) {
  if (iso639.empty()) return false;
  const std::string itemLanguage = canonicalLanguage(iso639);
  const std::string wanted = canonicalLanguage(localeIdentifier);
  return !itemLanguage.empty() && itemLanguage == wanted;
}

std::vector<RCMetadataItem> RCMetadataItemsWithLocale(const std::vector<RCMetadataItem>& items,
                                                      std::string_view localeIdentifier) {
  std::vector<RCMetadataItem> matching;
  const std::string wanted = canonicalLanguage(localeIdentifier);
  if (wanted.empty()) return matching;
  for (const RCMetadataItem& item : items) {
    if (!item.language.empty() && canonicalLanguage(item.language) == wanted) {
      matching.push_back(item);
    }
  }
  return matching;
}

std::string RCISO639TerminologyCode(std::string_view language) {
  std::string canonical = canonicalLanguage(language);
  if (canonical.empty()) return {};
  if (canonical.size() == 3) return canonical;
  icu::Locale locale(canonical.c_str());
  const char* iso3 = locale.getISO3Language();
  return iso3 != nullptr ? std::string(iso3) : std::string();
}

}  // namespace quorvel
