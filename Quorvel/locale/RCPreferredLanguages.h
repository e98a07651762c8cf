// The user's preferred languages, most preferred first, as BCP-47 tags
// ("de-CH", "en"), following the gettext convention: the colon-separated
// LANGUAGE list first, then the locale of LC_ALL, else LC_MESSAGES, else LANG.
// Codesets and modifiers are dropped ("de_CH.UTF-8@euro" -> "de-CH"); "C"
// and "POSIX" name no language; duplicates are kept once.
//
// Reads the environment on each call; any thread (the environment must not
// be changed concurrently, as always with getenv).
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace quorvel {

std::vector<std::string> RCPreferredLanguages();

// The same from any source of variables (tests pass a table).
using RCEnvironmentLookup = std::function<std::optional<std::string>(std::string_view name)>;
std::vector<std::string> RCPreferredLanguagesFromEnvironment(const RCEnvironmentLookup& lookup);

// "de_CH.UTF-8@euro" -> "de-CH"; "" for "C", "POSIX" and empty names.
std::string RCLanguageTagFromLocaleName(std::string_view localeName);

}  // namespace quorvel
