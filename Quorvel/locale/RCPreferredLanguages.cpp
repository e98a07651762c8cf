#include "Quorvel/locale/RCPreferredLanguages.h"

#include <algorithm>
#include <cstdlib>

namespace quorvel {

std::string RCLanguageTagFromLocaleName(std::string_view localeName) {
  std::string_view name = localeName;
  name = name.substr(0, name.find_first_of(".@"));
  if (name.empty() || name == "C" || name == "POSIX") return {};
  std::string tag(name);
  std::replace(tag.begin(), tag.end(), '_', '-');
  return tag;
}

std::vector<std::string> RCPreferredLanguagesFromEnvironment(const RCEnvironmentLookup& lookup) {
  std::vector<std::string> languages;
  auto add = [&languages](std::string_view name) {
    std::string tag = RCLanguageTagFromLocaleName(name);
    if (!tag.empty() && std::find(languages.begin(), languages.end(), tag) == languages.end()) {
      languages.push_back(std::move(tag));
    }
  };
  if (auto list = lookup("LANGUAGE"); list && !list->empty()) {
    std::string_view rest = *list;
    while (!rest.empty()) {
      const std::size_t colon = rest.find(':');
      add(rest.substr(0, colon));
      if (colon == std::string_view::npos) break;
      rest.remove_prefix(colon + 1);
    }
  }
  for (const char* variable : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
    if (auto value = lookup(variable); value && !value->empty()) {
      add(*value);
      break;
    }
  }
  return languages;
}

std::vector<std::string> RCPreferredLanguages() {
  return RCPreferredLanguagesFromEnvironment([](std::string_view name) {
    const char* value = std::getenv(std::string(name).c_str());
    return value != nullptr ? std::optional<std::string>(value) : std::nullopt;
  });
}

}  // namespace quorvel
