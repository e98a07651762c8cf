// The information embedded in the quorveld binary: what `quorveld --info`
// prints, and the environment entries main() applies at start. Constant data;
// usable from any thread.
#pragma once

#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace quorvel {

struct ProcessInfo {
  std::string_view bundleExecutable;
  std::string_view bundleIdentifier;
  std::string_view infoDictionaryVersion;
  bool allowMixedLocalizations;
  // LSEnvironment: variables set for the daemon's process.
  std::vector<std::pair<std::string_view, std::string_view>> environment;
};

const ProcessInfo& embeddedProcessInfo();

// The information as a JSON object, keys in their fixed order.
std::string processInfoJSON(const ProcessInfo& info);

// Sets each environment entry that the caller has not set already.
void applyProcessEnvironment(const ProcessInfo& info);

}  // namespace quorvel
