// Waveform files come from disk and may be damaged or hostile: parsing any
// bytes must give a waveform or an error, never a crash or a huge allocation,
// and whatever parses must encode back to the same bytes (version 2 files).
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <span>

#include "Quorvel/waveform/RCWaveformFile.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  auto parsed = quorvel::RCDecodeWaveformFile(std::span<const std::uint8_t>(data, size));
  if (!parsed) return 0;
  const bool version2 = size >= 4 && data[0] == 2 && data[1] == 0 && data[2] == 0 && data[3] == 0;
  if (version2) {
    const std::string encoded = quorvel::RCEncodeWaveformFile(*parsed);
    if (encoded.size() != size ||
        encoded.compare(0, size, reinterpret_cast<const char*>(data), size) != 0)
      std::abort();
  }
  const std::string reencoded = quorvel::RCEncodeWaveformFile(*parsed);
  auto again = quorvel::RCDecodeWaveformFile(std::span<const std::uint8_t>(
      reinterpret_cast<const std::uint8_t*>(reencoded.data()), reencoded.size()));
  if (!again || !(*again == *parsed)) std::abort();
  return 0;
}
