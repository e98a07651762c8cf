// The MP4/QuickTime atom reader and writer for titles.
//
// Titles live in the movie atom: QuickTime-style `udta`/`©nam` atoms, each
// holding text entries with a language code (several atoms side by side give
// several languages), and iTunes-style `udta`/`meta`/`ilst`/`©nam`/`data`
// items without a language. The reader reports every one of them as stored,
// decoded to UTF-8 as the container says: a text entry under a Macintosh
// language code is Mac Roman, one under an ISO code is UTF-16 after a
// byte-order mark and UTF-8 otherwise; a `data` item's type field says UTF-8
// or UTF-16 (big-endian), and items of other types are no titles. Invalid
// sequences read as U+FFFD. The writer stores UTF-8 under an ISO code: it
// replaces the title of one language (or the untagged title) and
// keeps the others, fixing the sizes of the enclosing atoms and, when the
// movie atom comes before the media data, the chunk offsets (`stco`/`co64`)
// so the audio is untouched.
//
// The in-memory functions are pure (any thread) and never trust the bytes:
// every size is checked before it is used. The file functions read with
// pread and replace the file atomically (temporary file in the same
// directory, fsync, rename); they may block and belong on a worker thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/media/RCMetadataItem.h"
#include "platform/Error.h"

namespace quorvel {

struct RCMP4Atom {
  std::string type;  // four characters, bytes as stored (©nam starts with 0xA9)
  std::uint64_t offset = 0;
  std::uint64_t size = 0;  // header included
  std::uint32_t headerSize = 8;
};

// Reads `size` bytes at `offset` into `out`; false when that is not possible.
using RCMP4ReadAt = std::function<bool(std::uint64_t offset, std::size_t size, std::uint8_t* out)>;

// The top-level atoms of a file of `fileSize` bytes, in order. An atom whose
// size runs past the end stops the scan with kRCMP4ErrorMalformed unless it is
// the last one, which is reported with the size that is really there.
platform::Result<std::vector<RCMP4Atom>> RCMP4TopLevelAtoms(std::uint64_t fileSize,
                                                            const RCMP4ReadAt& readAt);

// The title items of a whole `moov` atom (header included), in file order.
platform::Result<std::vector<RCMetadataItem>> RCMP4TitleItemsInMovie(
    std::span<const std::uint8_t> movieAtom);

// A new `moov` atom with `title` stored for `language` (3-letter ISO 639-2
// code, or empty for the untagged title): the entry of that language is
// replaced, other languages stay; writing the untagged title also drops the
// iTunes-style title so the file holds one untagged title. The entries of
// other languages are kept byte for byte, whatever their encoding; a title
// that is not valid UTF-8 is refused. Chunk offsets at
// or beyond the old movie atom's end are moved by the change in size.
// `movieOffset` is where the atom starts in the file.
platform::Result<std::vector<std::uint8_t>> RCMP4MovieWithTitle(
    std::span<const std::uint8_t> movieAtom, std::uint64_t movieOffset, std::string_view title,
    std::string_view language);

// A whole file image with the title written (for tests and fuzzing; the
// file function below streams instead).
platform::Result<std::vector<std::uint8_t>> RCMP4FileImageWithTitle(
    std::span<const std::uint8_t> file, std::string_view title, std::string_view language);
platform::Result<std::vector<RCMetadataItem>> RCMP4TitleItemsInFileImage(
    std::span<const std::uint8_t> file);

// The title items of the MP4/QuickTime file at `path`.
platform::Result<std::vector<RCMetadataItem>> RCMP4ReadTitleItems(const std::string& path);

// Writes `title` for `language` ("deu", "ger", or a BCP-47 tag such as "de"
// which becomes its ISO 639-2/T code; empty for the untagged title) into the
// MP4/QuickTime file at `path`, replacing it atomically.
platform::Status RCMP4WriteTitle(const std::string& path, std::string_view title,
                                 std::string_view language);

}  // namespace quorvel
