// Feeds arbitrary bytes to the MP4 atom reader and writer as a whole file.
// Besides not crashing, a title that was written must read back, and the
// bytes outside the movie atom must survive.
#include <cstdint>
#include <cstdlib>
#include <span>
#include <string>

#include "QuorvelMedia/RCMP4Atoms.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::span<const std::uint8_t> file(data, size);
  (void)quorvel::RCMP4TitleItemsInFileImage(file);

  for (const char* language : {"deu", ""}) {
    auto written = quorvel::RCMP4FileImageWithTitle(file, "Fuzzed title", language);
    if (!written) continue;
    auto items = quorvel::RCMP4TitleItemsInFileImage(*written);
    if (!items) std::abort();
    bool found = false;
    for (const auto& item : *items) {
      if (item.stringValue == "Fuzzed title" && item.language == language) found = true;
    }
    if (!found) std::abort();
    // Writing the same title again changes nothing.
    auto again = quorvel::RCMP4FileImageWithTitle(*written, "Fuzzed title", language);
    if (!again || *again != *written) std::abort();
  }
  return 0;
}
