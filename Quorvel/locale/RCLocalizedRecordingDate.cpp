#include "Quorvel/locale/RCLocalizedRecordingDate.h"

#include <unicode/datefmt.h>
#include <unicode/locid.h>
#include <unicode/timezone.h>
#include <unicode/unistr.h>

#include <memory>

#include "Quorvel/locale/RCPreferredLanguages.h"

namespace quorvel {
namespace {

std::unique_ptr<icu::DateFormat> makeFormat(int options, const icu::Locale& locale) {
  if ((options & (kRCRecordingDateOptionDate | kRCRecordingDateOptionTime)) == 0) {
    options = kRCRecordingDateOptionDate;
  }
  const auto dateStyle =
      (options & kRCRecordingDateOptionDate) ? icu::DateFormat::kMedium : icu::DateFormat::kNone;
  const auto timeStyle =
      (options & kRCRecordingDateOptionTime) ? icu::DateFormat::kShort : icu::DateFormat::kNone;
  return std::unique_ptr<icu::DateFormat>(
      icu::DateFormat::createDateTimeInstance(dateStyle, timeStyle, locale));
}

// Whether ICU has its own date formats for `locale`'s language, rather than
// falling back to the default locale or the root.
bool hasDateFormats(const icu::Locale& locale) {
  std::unique_ptr<icu::DateFormat> format = makeFormat(kRCRecordingDateOptionDate, locale);
  if (!format) return false;
  UErrorCode status = U_ZERO_ERROR;
  const icu::Locale actual = format->getLocale(ULOC_ACTUAL_LOCALE, status);
  if (U_FAILURE(status)) return false;
  return std::string_view(actual.getLanguage()) == locale.getLanguage() &&
         !std::string_view(locale.getLanguage()).empty();
}

}  // namespace

std::string RCDateRenderingLocale(const std::vector<std::string>& languages) {
  for (const std::string& language : languages) {
    if (language.size() > 64) continue;
    UErrorCode status = U_ZERO_ERROR;
    icu::Locale locale = icu::Locale::forLanguageTag(language, status);
    if (U_FAILURE(status) || locale.isBogus()) continue;
    locale = icu::Locale::createCanonical(locale.getName());
    if (hasDateFormats(locale)) return locale.getName();
  }
  return "en";
}

std::string RCLocalizedRecordingDateWithOptions(const platform::Date& date, int options,
                                                const std::vector<std::string>& languages,
                                                const std::string& timeZoneID) {
  const icu::Locale locale(RCDateRenderingLocale(languages).c_str());
  std::unique_ptr<icu::DateFormat> format = makeFormat(options, locale);
  if (!format) return date.ISO8601String();
  if (!timeZoneID.empty()) {
    format->adoptTimeZone(icu::TimeZone::createTimeZone(icu::UnicodeString::fromUTF8(timeZoneID)));
  }
  const UDate milliseconds = date.timeIntervalSince1970() * 1000.0;
  icu::UnicodeString text;
  format->format(milliseconds, text);
  std::string utf8;
  text.toUTF8String(utf8);
  return utf8;
}

std::string RCLocalizedRecordingDateWithOptions(const platform::Date& date, int options) {
  return RCLocalizedRecordingDateWithOptions(date, options, RCPreferredLanguages());
}

}  // namespace quorvel
