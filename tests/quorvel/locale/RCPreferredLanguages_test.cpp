// Preferred languages from the environment, matching titles' 3-letter codes
// to BCP-47 languages, and the localized recording date.
#include <gtest/gtest.h>

#include <map>

#include "Quorvel/locale/RCLocalizedRecordingDate.h"
#include "Quorvel/locale/RCPreferredLanguages.h"
#include "Quorvel/media/RCMetadataItem.h"

namespace quorvel {
namespace {

std::vector<std::string> languagesFor(std::map<std::string, std::string> environment) {
  return RCPreferredLanguagesFromEnvironment(
      [&](std::string_view name) -> std::optional<std::string> {
        auto found = environment.find(std::string(name));
        if (found == environment.end()) return std::nullopt;
        return found->second;
      });
}

using Languages = std::vector<std::string>;

TEST(RCPreferredLanguagesTest, FollowTheGettextOrder) {
  EXPECT_EQ(languagesFor({}), Languages{});
  EXPECT_EQ(languagesFor({{"LANG", "de_CH.UTF-8"}}), Languages{"de-CH"});
  EXPECT_EQ(languagesFor({{"LANG", "C.UTF-8"}}), Languages{});
  EXPECT_EQ(languagesFor({{"LANG", "POSIX"}}), Languages{});
  // LC_ALL wins over LC_MESSAGES wins over LANG; an empty value is skipped.
  EXPECT_EQ(languagesFor({{"LC_ALL", ""}, {"LC_MESSAGES", "fr_FR@euro"}, {"LANG", "de_DE"}}),
            Languages{"fr-FR"});
  EXPECT_EQ(languagesFor({{"LC_ALL", "it_IT.ISO-8859-1"}, {"LANG", "de_DE"}}), Languages{"it-IT"});
  // LANGUAGE comes first, in its order, without duplicates or empty entries.
  EXPECT_EQ(languagesFor({{"LANGUAGE", "sv:de_AT::C:sv"}, {"LANG", "de_AT.UTF-8"}}),
            (Languages{"sv", "de-AT"}));
  EXPECT_EQ(RCLanguageTagFromLocaleName("sr_RS.UTF-8@latin"), "sr-RS");
}

TEST(RCMetadataItemTest, ThreeLetterCodesMatchTheLanguageInBothForms) {
  const std::vector<RCMetadataItem> items = {{"Untagged", ""}, {"B", "ger"}, {"T", "deu"},
                                             {"F", "fre"},     {"E", "eng"}, {"Z", "chi"}};
  EXPECT_EQ(RCMetadataItemsWithLocale(items, "de-CH"),
            (std::vector<RCMetadataItem>{{"B", "ger"}, {"T", "deu"}}));
  EXPECT_EQ(RCMetadataItemsWithLocale(items, "de_DE"), RCMetadataItemsWithLocale(items, "de"));
  EXPECT_EQ(RCMetadataItemsWithLocale(items, "fr").size(), 1u);
  EXPECT_EQ(RCMetadataItemsWithLocale(items, "zh-Hant-TW").size(), 1u);
  EXPECT_EQ(RCMetadataItemsWithLocale(items, "en-GB").front().stringValue, "E");
  EXPECT_TRUE(RCMetadataItemsWithLocale(items, "ja").empty());
  EXPECT_TRUE(RCMetadataItemsWithLocale(items, "").empty());
  EXPECT_TRUE(RCMetadataItemsWithLocale(items, "und").empty());
  EXPECT_TRUE(RCLanguageCodeMatchesLocale("ger", "de"));
  EXPECT_FALSE(RCLanguageCodeMatchesLocale("", "de"));
  EXPECT_EQ(RCISO639TerminologyCode("ger"), "deu");
  EXPECT_EQ(RCISO639TerminologyCode("de-CH"), "deu");
  EXPECT_EQ(RCISO639TerminologyCode("el"), "ell");
}

TEST(RCLocalizedRecordingDateTest, UsesTheFirstLanguageICUReallySupports) {
  // 2024-03-05 14:07:00 UTC.
  const platform::Date date = platform::Date::dateWithTimeIntervalSince1970(1709647620.0);
  const std::string german = RCLocalizedRecordingDateWithOptions(date, 2, {"de-DE"}, "UTC");
  const std::string english = RCLocalizedRecordingDateWithOptions(date, 2, {"en-US"}, "UTC");
  EXPECT_EQ(german, "05.03.2024");
  EXPECT_EQ(english, "Mar 5, 2024");
  // Klingon and a made-up language have no date formats: the next one is used
  // rather than whatever the process default is.
  EXPECT_EQ(RCLocalizedRecordingDateWithOptions(date, 2, {"tlh", "xx-YY", "de"}, "UTC"), german);
  EXPECT_EQ(RCDateRenderingLocale({"tlh", "fr-CA"}), "fr_CA");
  EXPECT_EQ(RCDateRenderingLocale({"tlh"}), "en");
  EXPECT_EQ(RCDateRenderingLocale({}), "en");

  // Options 3 add the short time, in the requested zone.
  const std::string withTime = RCLocalizedRecordingDateWithOptions(date, 3, {"de"}, "UTC");
  EXPECT_EQ(withTime.rfind(german, 0), 0u) << withTime;
  EXPECT_NE(withTime.find("14:07"), std::string::npos) << withTime;
  const std::string berlin = RCLocalizedRecordingDateWithOptions(date, 3, {"de"}, "Europe/Berlin");
  EXPECT_NE(berlin.find("15:07"), std::string::npos) << berlin;
  EXPECT_EQ(RCLocalizedRecordingDateWithOptions(date, 0, {"de"}, "UTC"), german);
}

}  // namespace
}  // namespace quorvel
