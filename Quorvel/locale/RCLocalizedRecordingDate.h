// Localized rendering of a recording's date, used as the title of recordings
// that have none. The options value is a bit set: 2 renders the date in the
// medium style ("12 Mar 2024"), 1 adds the time in the short style; so 2 is
// the date alone and 3 the date and time. 0 is taken as 2.
//
// The language is the first of the user's preferred languages that ICU has
// date formats for (ICU would otherwise silently use the process default),
// else English. The time zone is the process's (TZ). Any thread.
#pragma once

#include <string>
#include <vector>

#include "platform/Date.h"

namespace quorvel {

inline constexpr int kRCRecordingDateOptionTime = 1;
inline constexpr int kRCRecordingDateOptionDate = 2;

std::string RCLocalizedRecordingDateWithOptions(const platform::Date& date, int options);

// The same with explicit languages (BCP-47 tags, most preferred first) and
// an optional time zone ID ("Europe/Berlin"; empty for the process's).
std::string RCLocalizedRecordingDateWithOptions(const platform::Date& date, int options,
                                                const std::vector<std::string>& languages,
                                                const std::string& timeZoneID = {});

// The first language of `languages` that ICU can render dates in, as an ICU
// locale name ("de_CH"); "en" when none can.
std::string RCDateRenderingLocale(const std::vector<std::string>& languages);

}  // namespace quorvel
