// Composition manifests come from disk, written by apps or left half-written
// by a crash: any bytes must parse or fail cleanly, and whatever parses must
// write back to text that parses to the same manifest.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "Quorvel/composition/RCCompositionManifest.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string_view text(reinterpret_cast<const char*>(data), size);
  auto manifest = quorvel::RCCompositionManifest::parse(text);
  if (!manifest) return 0;
  manifest->recomputeTimeRanges();
  auto again = quorvel::RCCompositionManifest::parse(manifest->serialize());
  if (!again || !(*again == *manifest)) std::abort();
  return 0;
}
