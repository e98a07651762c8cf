// Signature checking: any byte string is either refused or split into
// complete types that concatenate back to it, each of which describes a
// value BusValue can hold. Method and signal signatures pass through this
// check before they are published.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "platform/dbus/BusValue.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string_view signature(reinterpret_cast<const char*>(data), size);
  auto types = platform::splitSignature(signature);
  if (platform::isSupportedSignature(signature) != types.has_value()) std::abort();
  if (!types) return 0;
  std::string joined;
  for (std::string_view type : *types) {
    if (type.empty()) std::abort();
    auto again = platform::splitSignature(type);
    if (!again || again->size() != 1 || (*again)[0] != type) std::abort();
    joined += type;
  }
  if (joined != signature) std::abort();
  return 0;
}
