// Client-supplied URL strings: parsing never crashes, and whatever parses
// round-trips through its canonical string and standardizes idempotently.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/URL.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string_view text(reinterpret_cast<const char*>(data), size);
  auto url = platform::URL::fromFileURLStringOrPath(text);
  if (!url) return 0;
  auto again = platform::URL::fileURLFromString(url->absoluteString());
  if (!again || *again != *url) std::abort();
  platform::URL standardized = url->URLByStandardizingPath();
  if (standardized.URLByStandardizingPath() != standardized) std::abort();
  (void)url->lastPathComponent();
  (void)url->URLByDeletingPathExtension();
  return 0;
}
