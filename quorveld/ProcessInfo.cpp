#include "quorveld/ProcessInfo.h"

#include <fmt/format.h>
#include <stdlib.h>

#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"

namespace quorvel {

const ProcessInfo& embeddedProcessInfo() {
  static const ProcessInfo info{
      .bundleExecutable = "quorveld",
      .bundleIdentifier = RCSSavedRecordingServiceBundleIdentifier,
      .infoDictionaryVersion = "6.0",
      .allowMixedLocalizations = true,
      .environment = {{"SQLITE_AUTO_TRACE", "1"}},
  };
  return info;
}

std::string processInfoJSON(const ProcessInfo& info) {
  std::string environment;
  for (const auto& [name, value] : info.environment) {
    if (!environment.empty()) environment += ", ";
    environment += fmt::format("\"{}\": \"{}\"", name, value);
  }
  return fmt::format(
      "{{\n"
      "  \"CFBundleExecutable\": \"{}\",\n"
      "  \"CFBundleIdentifier\": \"{}\",\n"
      "  \"CFBundleInfoDictionaryVersion\": \"{}\",\n"
      "  \"CFBundleAllowMixedLocalizations\": {},\n"
      "  \"LSEnvironment\": {{{}}}\n"
      "}}\n",
      info.bundleExecutable, info.bundleIdentifier, info.infoDictionaryVersion,
      info.allowMixedLocalizations, environment);
}

void applyProcessEnvironment(const ProcessInfo& info) {
  for (const auto& [name, value] : info.environment) {
    setenv(std::string(name).c_str(), std::string(value).c_str(), /*overwrite=*/0);
  }
}

}  // namespace quorvel
