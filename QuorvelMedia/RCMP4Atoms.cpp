#include "QuorvelMedia/RCMP4Atoms.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unicode/ucnv.h>
#include <unicode/unistr.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <limits>
#include <optional>

#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCFileStatus.h"
#include "Quorvel/files/RCReplacementFile.h"

namespace quorvel {
namespace {

using Bytes = std::vector<std::uint8_t>;
using View = std::span<const std::uint8_t>;

constexpr std::uint16_t kUndeterminedLanguage = 0x55C4;  // "und", packed
// Language codes below this are Macintosh language codes, above it packed
// ISO 639-2 codes.
constexpr std::uint16_t kFirstISOLanguageCode = 0x400;
// The type field of an iTunes-style `data` atom for text values.
constexpr std::uint32_t kDataTypeUTF8 = 1;
constexpr std::uint32_t kDataTypeUTF16 = 2;  // big-endian
constexpr std::uint64_t kMaxMovieAtomSize = 512ull << 20;
constexpr std::size_t kMaxTopLevelAtoms = 1u << 20;

platform::Error mp4Error(long code, std::string text) {
  return platform::Error(kRCMP4ErrorDomain, code, std::move(text));
}

std::uint16_t be16(const std::uint8_t* p) { return std::uint16_t(p[0] << 8 | p[1]); }
std::uint32_t be32(const std::uint8_t* p) {
  return std::uint32_t(p[0]) << 24 | std::uint32_t(p[1]) << 16 | std::uint32_t(p[2]) << 8 | p[3];
}
std::uint64_t be64(const std::uint8_t* p) { return std::uint64_t(be32(p)) << 32 | be32(p + 4); }
void putBE16(Bytes& out, std::uint16_t v) {
  out.push_back(std::uint8_t(v >> 8));
  out.push_back(std::uint8_t(v));
}
void putBE32(Bytes& out, std::uint32_t v) {
  for (int shift = 24; shift >= 0; shift -= 8) out.push_back(std::uint8_t(v >> shift));
}
void putBE64(Bytes& out, std::uint64_t v) {
  putBE32(out, std::uint32_t(v >> 32));
  putBE32(out, std::uint32_t(v));
}
void storeBE32(std::uint8_t* p, std::uint32_t v) {
  p[0] = std::uint8_t(v >> 24), p[1] = std::uint8_t(v >> 16), p[2] = std::uint8_t(v >> 8),
  p[3] = std::uint8_t(v);
}
void storeBE64(std::uint8_t* p, std::uint64_t v) {
  storeBE32(p, std::uint32_t(v >> 32));
  storeBE32(p + 4, std::uint32_t(v));
}

constexpr std::string_view kTitleType = "\xA9nam";

// One child atom inside a parent's payload; offsets are into the whole buffer.
struct Child {
  std::string type;
  std::size_t offset;
  std::size_t size;
  std::size_t header;
  View payload(View buffer) const { return buffer.subspan(offset + header, size - header); }
  View whole(View buffer) const { return buffer.subspan(offset, size); }
};

struct Children {
  std::vector<Child> atoms;
  std::size_t tail;  // where parsing stopped; bytes [tail, end) are not atoms
};

// The atoms in [begin, end) of `buffer`. Parsing stops at the first header
// that does not fit; `strict` makes that an error unless fewer than 8 bytes
// are left (QuickTime ends some containers with a 32-bit zero).
platform::Result<Children> parseChildren(View buffer, std::size_t begin, std::size_t end,
                                         bool strict) {
  Children result{{}, begin};
  std::size_t pos = begin;
  while (end - pos >= 8) {
    std::uint64_t size = be32(&buffer[pos]);
    std::size_t header = 8;
    if (size == 1) {
      if (end - pos < 16) break;
      size = be64(&buffer[pos + 8]);
      header = 16;
    } else if (size == 0) {
      size = end - pos;
    }
    if (size < header || size > end - pos) break;
    result.atoms.push_back(Child{std::string(reinterpret_cast<const char*>(&buffer[pos + 4]), 4),
                                 pos, std::size_t(size), header});
    pos += std::size_t(size);
  }
  result.tail = pos;
  if (strict && end - pos >= 8) {
    return platform::fail(mp4Error(kRCMP4ErrorMalformed, "atom sizes do not add up"));
  }
  return result;
}

// Where a `meta` atom's children start: MP4 makes it a full atom (4 bytes of
// version and flags first), QuickTime does not.
std::size_t metaChildrenOffset(View payload) {
  if (payload.size() >= 8 && std::memcmp(&payload[4], "hdlr", 4) == 0) return 0;
  if (payload.size() >= 4 && be32(&payload[0]) == 0) return 4;
  return 0;
}

void appendAtom(Bytes& out, std::string_view type, View payload) {
  const std::uint64_t size = payload.size() + 8;
  if (size > std::numeric_limits<std::uint32_t>::max()) {
    putBE32(out, 1);
    out.insert(out.end(), type.begin(), type.end());
    putBE64(out, size + 8);
  } else {
    putBE32(out, std::uint32_t(size));
    out.insert(out.end(), type.begin(), type.end());
  }
  out.insert(out.end(), payload.begin(), payload.end());
}

// Copies a child atom as it is, except that a size of 0 ("up to the end of
// the parent") becomes the real size: whatever follows it in the new parent
// must not be swallowed.
void appendChild(Bytes& out, View buffer, const Child& child) {
  View whole = child.whole(buffer);
  const std::size_t at = out.size();
  out.insert(out.end(), whole.begin(), whole.end());
  if (be32(&out[at]) == 0) storeBE32(&out[at], std::uint32_t(child.size));
}

// Macintosh language codes that QuickTime used before ISO codes.
constexpr std::array<const char*, 33> kMacLanguages = {
    "eng", "fra", "deu", "ita", "nld", "swe", "spa", "dan", "por", "nor", "heb",
    "jpn", "ara", "fin", "ell", "isl", "mlt", "tur", "hrv", "zho", "urd", "hin",
    "tha", "kor", "lit", "pol", "hun", "est", "lav", "sme", "fao", "fas", "rus"};

std::string decodeLanguage(std::uint16_t code) {
  if (code == 0x7FFF || code == kUndeterminedLanguage) return {};
  if (code < kFirstISOLanguageCode) {
    return code < kMacLanguages.size() ? kMacLanguages[code] : std::string();
  }
  std::string letters;
  for (int shift = 10; shift >= 0; shift -= 5) {
    const int value = (code >> shift) & 0x1F;
    if (value < 1 || value > 26) return {};
    letters.push_back(char(0x60 + value));
  }
  return letters;
}

// Longer title texts are not read: no real title comes near it, and it keeps
// every count below within ICU's 32-bit lengths.
constexpr std::size_t kMaxTitleTextBytes = 1u << 24;

// `bytes` in the ICU charset `charset`, as UTF-8. Invalid and cut-off
// sequences become U+FFFD (the converter's default substitution), so the
// result is always valid UTF-8. Nothing when the text is too long or ICU
// fails.
std::optional<std::string> decodeText(View bytes, const char* charset) {
  if (bytes.size() > kMaxTitleTextBytes) return std::nullopt;
  UErrorCode status = U_ZERO_ERROR;
  icu::LocalUConverterPointer converter(ucnv_open(charset, &status));
  if (U_FAILURE(status)) return std::nullopt;
  const icu::UnicodeString text(reinterpret_cast<const char*>(bytes.data()),
                                std::int32_t(bytes.size()), converter.getAlias(), status);
  if (U_FAILURE(status) || text.isBogus()) return std::nullopt;
  std::string utf8;
  text.toUTF8String(utf8);  // anything that is not a whole character becomes U+FFFD
  return utf8;
}

// Writers pad some titles with NULs; they are not part of the title.
std::string withoutTrailingNuls(std::string text) {
  while (!text.empty() && text.back() == '\0') text.pop_back();
  return text;
}

// Whether a `©nam` payload holds `data` atoms rather than text entries. The
// first atom's size must fit: a text entry whose text begins with "data"
// reads as a size of at least 64 KiB there, more than the entry holds.
bool isITunesStyle(View payload) {
  if (payload.size() < 16 || std::memcmp(&payload[4], "data", 4) != 0) return false;
  const std::uint32_t size = be32(&payload[0]);
  return size == 0 || (size >= 16 && size <= payload.size());
}

// `©nam` (or any item) holding `data` children: each is type, locale, value.
// The type says how the value is encoded; values of types that are not text
// (numbers, images) are no titles.
void collectDataItems(View buffer, const Child& item, std::vector<RCMetadataItem>& out) {
  auto children = parseChildren(buffer, item.offset + item.header, item.offset + item.size, false);
  if (!children) return;
  for (const Child& data : children->atoms) {
    if (data.type != "data" || data.size - data.header < 8) continue;
    View payload = data.payload(buffer);
    const std::uint32_t type = be32(&payload[0]);
    const char* charset = type == kDataTypeUTF8    ? "UTF-8"
                          : type == kDataTypeUTF16 ? "UTF-16BE"
                                                   : nullptr;
    if (charset == nullptr) continue;
    if (auto text = decodeText(payload.subspan(8), charset)) {
      out.push_back(RCMetadataItem{withoutTrailingNuls(std::move(*text)), {}});
    }
  }
}

struct TextEntry {
  std::string language;
  std::uint16_t code;
  View text;
};

// QuickTime text entries: 16-bit length, 16-bit language, then the text.
std::vector<TextEntry> textEntries(View payload) {
  std::vector<TextEntry> entries;
  std::size_t pos = 0;
  while (payload.size() - pos >= 4) {
    const std::size_t length = be16(&payload[pos]);
    const std::uint16_t code = be16(&payload[pos + 2]);
    pos += 4;
    if (length > payload.size() - pos) break;
    entries.push_back(TextEntry{decodeLanguage(code), code, payload.subspan(pos, length)});
    pos += length;
  }
  return entries;
}

// A text entry's text: under a Macintosh language code it is Mac Roman;
// under an ISO code it is UTF-16 in the order of a leading byte-order mark
// (which is not part of the title), else UTF-8.
std::optional<std::string> entryText(const TextEntry& entry) {
  View text = entry.text;
  if (entry.code < kFirstISOLanguageCode) return decodeText(text, "macintosh");
  if (text.size() >= 2 && text[0] == 0xFE && text[1] == 0xFF) {
    return decodeText(text.subspan(2), "UTF-16BE");
  }
  if (text.size() >= 2 && text[0] == 0xFF && text[1] == 0xFE) {
    return decodeText(text.subspan(2), "UTF-16LE");
  }
  return decodeText(text, "UTF-8");
}

void collectIlst(View buffer, const Child& ilst, std::vector<RCMetadataItem>& out) {
  auto items = parseChildren(buffer, ilst.offset + ilst.header, ilst.offset + ilst.size, false);
  if (!items) return;
  for (const Child& item : items->atoms) {
    if (item.type == kTitleType) collectDataItems(buffer, item, out);
  }
}

void collectMeta(View buffer, const Child& meta, std::vector<RCMetadataItem>& out) {
  const std::size_t begin = meta.offset + meta.header + metaChildrenOffset(meta.payload(buffer));
  auto children = parseChildren(buffer, begin, meta.offset + meta.size, false);
  if (!children) return;
  for (const Child& child : children->atoms) {
    if (child.type == "ilst") collectIlst(buffer, child, out);
  }
}

void collectUdta(View buffer, const Child& udta, std::vector<RCMetadataItem>& out) {
  auto children = parseChildren(buffer, udta.offset + udta.header, udta.offset + udta.size, false);
  if (!children) return;
  for (const Child& child : children->atoms) {
    if (child.type == kTitleType) {
      View payload = child.payload(buffer);
      if (isITunesStyle(payload)) {
        collectDataItems(buffer, child, out);
      } else {
        for (const TextEntry& entry : textEntries(payload)) {
          if (auto text = entryText(entry)) {
            out.push_back(RCMetadataItem{withoutTrailingNuls(std::move(*text)), entry.language});
          }
        }
      }
    } else if (child.type == "meta") {
      collectMeta(buffer, child, out);
    }
  }
}

platform::Result<Child> movieHeader(View movie) {
  auto top = parseChildren(movie, 0, movie.size(), false);
  if (!top || top->atoms.size() != 1 || top->atoms[0].type != "moov" ||
      top->atoms[0].size != movie.size()) {
    return platform::fail(mp4Error(kRCMP4ErrorNoMovie, "not a movie atom"));
  }
  return top->atoms[0];
}

// ---- writing ----

struct TitleEdit {
  std::string language;  // normalized ISO 639-2/T, empty for untagged
  std::string title;
};

bool sameLanguage(const std::string& stored, const std::string& wanted) {
  if (stored.empty() || wanted.empty()) return stored.empty() && wanted.empty();
  return stored == wanted || RCISO639TerminologyCode(stored) == wanted;
}

std::uint16_t encodeLanguage(const std::string& language) {
  if (language.empty()) return kUndeterminedLanguage;
  return std::uint16_t((language[0] - 0x60) << 10 | (language[1] - 0x60) << 5 |
                       (language[2] - 0x60));
}

void appendTitleAtom(Bytes& out, std::uint16_t code, View text) {
  Bytes payload;
  putBE16(payload, std::uint16_t(text.size()));
  putBE16(payload, code);
  payload.insert(payload.end(), text.begin(), text.end());
  appendAtom(out, kTitleType, payload);
}

// An `ilst` without iTunes-style titles.
Bytes ilstWithoutTitles(View buffer, const Child& ilst) {
  auto items = parseChildren(buffer, ilst.offset + ilst.header, ilst.offset + ilst.size, false);
  Bytes payload;
  std::size_t tail = ilst.offset + ilst.header;
  if (items) {
    for (const Child& item : items->atoms) {
      if (item.type != kTitleType) {
        appendChild(payload, buffer, item);
      }
    }
    tail = items->tail;
  }
  payload.insert(payload.end(), buffer.begin() + tail, buffer.begin() + ilst.offset + ilst.size);
  Bytes out;
  appendAtom(out, "ilst", payload);
  return out;
}

Bytes metaWithoutTitles(View buffer, const Child& meta) {
  const std::size_t skip = metaChildrenOffset(meta.payload(buffer));
  const std::size_t begin = meta.offset + meta.header + skip;
  const std::size_t end = meta.offset + meta.size;
  auto children = parseChildren(buffer, begin, end, false);
  Bytes payload(buffer.begin() + meta.offset + meta.header, buffer.begin() + begin);
  std::size_t tail = begin;
  if (children) {
    for (const Child& child : children->atoms) {
      if (child.type == "ilst") {
        Bytes ilst = ilstWithoutTitles(buffer, child);
        payload.insert(payload.end(), ilst.begin(), ilst.end());
      } else {
        appendChild(payload, buffer, child);
      }
    }
    tail = children->tail;
  }
  payload.insert(payload.end(), buffer.begin() + tail, buffer.begin() + end);
  Bytes out;
  appendAtom(out, "meta", payload);
  return out;
}

platform::Result<Bytes> udtaWithTitle(View buffer, const Child* udta, const TitleEdit& edit) {
  Bytes payload;
  // The new entry takes the place of the one it replaces; a new language goes
  // after the last title.
  std::optional<std::size_t> replaceAt;
  std::optional<std::size_t> afterLastTitle;
  View tailBytes;
  if (udta != nullptr) {
    auto children =
        parseChildren(buffer, udta->offset + udta->header, udta->offset + udta->size, true);
    if (!children) return platform::fail(children.error());
    for (const Child& child : children->atoms) {
      View payloadView = child.payload(buffer);
      if (child.type == kTitleType && !isITunesStyle(payloadView)) {
        // Every entry that stays gets an atom of its own: readers that only
        // look at an atom's first entry then still see each language.
        for (const TextEntry& entry : textEntries(payloadView)) {
          if (sameLanguage(entry.language, edit.language)) {
            if (!replaceAt) replaceAt = payload.size();
          } else {
            appendTitleAtom(payload, entry.code, entry.text);
          }
        }
        afterLastTitle = payload.size();
      } else if (child.type == kTitleType && edit.language.empty()) {
        if (!replaceAt) replaceAt = payload.size();
      } else if (child.type == "meta" && edit.language.empty()) {
        Bytes meta = metaWithoutTitles(buffer, child);
        payload.insert(payload.end(), meta.begin(), meta.end());
      } else {
        appendChild(payload, buffer, child);
      }
    }
    tailBytes = buffer.subspan(children->tail, udta->offset + udta->size - children->tail);
  }
  Bytes title;
  appendTitleAtom(
      title, encodeLanguage(edit.language),
      View(reinterpret_cast<const std::uint8_t*>(edit.title.data()), edit.title.size()));
  const std::size_t insertAt = replaceAt.value_or(afterLastTitle.value_or(payload.size()));
  payload.insert(payload.begin() + std::ptrdiff_t(insertAt), title.begin(), title.end());
  payload.insert(payload.end(), tailBytes.begin(), tailBytes.end());
  Bytes out;
  appendAtom(out, "udta", payload);
  return out;
}

// Moves every chunk offset at or beyond `from` by `delta`, in place.
platform::Status shiftChunkOffsets(std::span<std::uint8_t> movie, std::uint64_t from,
                                   std::int64_t delta) {
  View view(movie.data(), movie.size());
  std::vector<Child> stack;
  auto top = parseChildren(view, 0, view.size(), false);
  if (!top) return platform::fail(top.error());
  stack = top->atoms;
  while (!stack.empty()) {
    Child atom = stack.back();
    stack.pop_back();
    if (atom.type == "moov" || atom.type == "trak" || atom.type == "mdia" || atom.type == "minf" ||
        atom.type == "stbl") {
      auto children =
          parseChildren(view, atom.offset + atom.header, atom.offset + atom.size, false);
      if (children) stack.insert(stack.end(), children->atoms.begin(), children->atoms.end());
      continue;
    }
    const bool wide = atom.type == "co64";
    if (!wide && atom.type != "stco") continue;
    const std::size_t entrySize = wide ? 8 : 4;
    const std::size_t payloadSize = atom.size - atom.header;
    if (payloadSize < 8) continue;
    std::uint8_t* payload = movie.data() + atom.offset + atom.header;
    const std::uint64_t count =
        std::min<std::uint64_t>(be32(payload + 4), (payloadSize - 8) / entrySize);
    for (std::uint64_t i = 0; i < count; ++i) {
      std::uint8_t* entry = payload + 8 + i * entrySize;
      const std::uint64_t offset = wide ? be64(entry) : be32(entry);
      if (offset < from) continue;
      const std::uint64_t moved = offset + std::uint64_t(delta);
      if (delta < 0 && moved > offset) {
        return platform::fail(mp4Error(kRCMP4ErrorMalformed, "chunk offset before the file"));
      }
      if (wide) {
        storeBE64(entry, moved);
      } else if (moved > std::numeric_limits<std::uint32_t>::max()) {
        return platform::fail(mp4Error(kRCMP4ErrorTooLarge, "chunk offset does not fit stco"));
      } else {
        storeBE32(entry, std::uint32_t(moved));
      }
    }
  }
  return {};
}

platform::Result<TitleEdit> normalizeEdit(std::string_view title, std::string_view language) {
  if (title.size() > 0xFFFF) {
    return platform::fail(mp4Error(kRCMP4ErrorBadArgument, "title longer than 65535 bytes"));
  }
  // The title is stored as UTF-8 under an ISO code; anything else would not
  // read back as it was written.
  auto asRead =
      decodeText(View(reinterpret_cast<const std::uint8_t*>(title.data()), title.size()), "UTF-8");
  if (!asRead || *asRead != title) {
    return platform::fail(mp4Error(kRCMP4ErrorBadArgument, "title is not valid UTF-8"));
  }
  TitleEdit edit{{}, std::string(title)};
  if (!language.empty() && language != "und") {
    edit.language = RCISO639TerminologyCode(language);
    const bool letters =
        edit.language.size() == 3 && std::all_of(edit.language.begin(), edit.language.end(),
                                                 [](char c) { return c >= 'a' && c <= 'z'; });
    if (!letters) {
      return platform::fail(mp4Error(kRCMP4ErrorBadArgument,
                                     "no ISO 639-2 code for language " + std::string(language)));
    }
  }
  return edit;
}

// ---- files ----

// kRCMP4ErrorIO for a failure the file layer reported.
platform::Error ioErrorFrom(const platform::Error& cause) {
  return platform::Error(kRCMP4ErrorDomain, kRCMP4ErrorIO, cause.localizedDescription(), cause);
}

platform::Error ioError(int err, const std::string& what) {
  return platform::Error(kRCMP4ErrorDomain, kRCMP4ErrorIO, what + ": " + std::strerror(err),
                         platform::posixError(err, what));
}

struct LoadedMovie {
  std::uint64_t fileSize;
  std::uint64_t offset;
  Bytes bytes;
};

platform::Result<LoadedMovie> loadMovie(int fd) {
  const RCFileStatus status = RCFileStatus::ofDescriptor(fd);
  if (!status.exists()) return platform::fail(ioError(status.error, "fstat"));
  if (!status.isRegularFile()) return platform::fail(mp4Error(kRCMP4ErrorIO, "not a regular file"));
  const std::uint64_t fileSize = std::uint64_t(status.info.st_size);
  auto atoms =
      RCMP4TopLevelAtoms(fileSize, [fd](std::uint64_t offset, std::size_t size, std::uint8_t* out) {
        return RCPreadFully(fd, offset, size, out);
      });
  if (!atoms) return platform::fail(atoms.error());
  for (const RCMP4Atom& atom : *atoms) {
    if (atom.type != "moov") continue;
    if (atom.size > kMaxMovieAtomSize) {
      return platform::fail(mp4Error(kRCMP4ErrorTooLarge, "movie atom too large"));
    }
    Bytes bytes(std::size_t(atom.size));
    if (!RCPreadFully(fd, atom.offset, bytes.size(), bytes.data())) {
      return platform::fail(ioError(errno ? errno : EIO, "read movie atom"));
    }
    // The movie atom on disk may say "to the end of the file" (size 0) or
    // use the wide form; the in-memory parser wants its real size.
    if (be32(bytes.data()) == 0) {
      if (atom.size > std::numeric_limits<std::uint32_t>::max()) {
        return platform::fail(mp4Error(kRCMP4ErrorTooLarge, "movie atom too large"));
      }
      storeBE32(bytes.data(), std::uint32_t(atom.size));
    }
    return LoadedMovie{fileSize, atom.offset, std::move(bytes)};
  }
  return platform::fail(mp4Error(kRCMP4ErrorNoMovie, "no movie atom"));
}

platform::Status writeAll(int fd, View bytes) {
  auto written = RCWriteFully(
      fd, std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()), "the copy");
  if (!written) return platform::fail(ioErrorFrom(written.error()));
  return {};
}

platform::Status copyRange(int from, std::uint64_t offset, std::uint64_t length, int to) {
  loff_t in = loff_t(offset);
  while (length > 0) {
    const ssize_t copied = ::copy_file_range(from, &in, to, nullptr, length, 0);
    if (copied < 0 && errno == EINTR) continue;
    if (copied > 0) {
      length -= std::uint64_t(copied);
      continue;
    }
    if (copied == 0) return platform::fail(mp4Error(kRCMP4ErrorIO, "file shrank while copying"));
    if (errno != EXDEV && errno != ENOSYS && errno != EINVAL && errno != EOPNOTSUPP) {
      return platform::fail(ioError(errno, "copy_file_range"));
    }
    // Plain copy where the kernel cannot do it for us.
    Bytes buffer(1 << 20);
    while (length > 0) {
      const std::size_t chunk = std::size_t(std::min<std::uint64_t>(length, buffer.size()));
      if (!RCPreadFully(from, std::uint64_t(in), chunk, buffer.data())) {
        return platform::fail(ioError(errno ? errno : EIO, "read"));
      }
      if (auto s = writeAll(to, View(buffer.data(), chunk)); !s) return s;
      in += loff_t(chunk), length -= chunk;
    }
  }
  return {};
}

}  // namespace

platform::Result<std::vector<RCMP4Atom>> RCMP4TopLevelAtoms(std::uint64_t fileSize,
                                                            const RCMP4ReadAt& readAt) {
  std::vector<RCMP4Atom> atoms;
  std::uint64_t pos = 0;
  while (fileSize - pos >= 8) {
    if (atoms.size() >= kMaxTopLevelAtoms) {
      return platform::fail(mp4Error(kRCMP4ErrorMalformed, "too many top-level atoms"));
    }
    std::uint8_t header[16];
    if (!readAt(pos, 8, header)) return platform::fail(mp4Error(kRCMP4ErrorIO, "read failed"));
    RCMP4Atom atom{std::string(reinterpret_cast<const char*>(header + 4), 4), pos, be32(header), 8};
    if (atom.size == 1) {
      if (fileSize - pos < 16 || !readAt(pos + 8, 8, header + 8)) {
        return platform::fail(mp4Error(kRCMP4ErrorMalformed, "cut-off atom header"));
      }
      atom.size = be64(header + 8);
      atom.headerSize = 16;
    } else if (atom.size == 0) {
      atom.size = fileSize - pos;
    }
    if (atom.size < atom.headerSize) {
      return platform::fail(mp4Error(kRCMP4ErrorMalformed, "atom smaller than its header"));
    }
    if (atom.size > fileSize - pos) {
      // A cut-off last atom (an interrupted recording) is reported, shortened
      // to what is there, but never as the movie.
      atom.size = fileSize - pos;
      if (atom.type == "moov") atom.type = "moov-truncated";
      atoms.push_back(atom);
      break;
    }
    atoms.push_back(atom);
    pos += atom.size;
  }
  return atoms;
}

platform::Result<std::vector<RCMetadataItem>> RCMP4TitleItemsInMovie(View movieAtom) {
  auto movie = movieHeader(movieAtom);
  if (!movie) return platform::fail(movie.error());
  std::vector<RCMetadataItem> items;
  auto children = parseChildren(movieAtom, movie->header, movie->size, false);
  if (!children) return platform::fail(children.error());
  for (const Child& child : children->atoms) {
    if (child.type == "udta") collectUdta(movieAtom, child, items);
    if (child.type == "meta") collectMeta(movieAtom, child, items);
  }
  return items;
}

platform::Result<std::vector<std::uint8_t>> RCMP4MovieWithTitle(View movieAtom,
                                                                std::uint64_t movieOffset,
                                                                std::string_view title,
                                                                std::string_view language) {
  auto edit = normalizeEdit(title, language);
  if (!edit) return platform::fail(edit.error());
  auto movie = movieHeader(movieAtom);
  if (!movie) return platform::fail(movie.error());
  auto children = parseChildren(movieAtom, movie->header, movie->size, true);
  if (!children) return platform::fail(children.error());

  Bytes payload;
  bool wroteTitle = false;
  for (const Child& child : children->atoms) {
    if (child.type == "udta" && !wroteTitle) {
      auto udta = udtaWithTitle(movieAtom, &child, *edit);
      if (!udta) return platform::fail(udta.error());
      payload.insert(payload.end(), udta->begin(), udta->end());
      wroteTitle = true;
    } else if (child.type == "meta" && edit->language.empty()) {
      Bytes meta = metaWithoutTitles(movieAtom, child);
      payload.insert(payload.end(), meta.begin(), meta.end());
    } else {
      appendChild(payload, movieAtom, child);
    }
  }
  if (!wroteTitle) {
    auto udta = udtaWithTitle(movieAtom, nullptr, *edit);
    if (!udta) return platform::fail(udta.error());
    payload.insert(payload.end(), udta->begin(), udta->end());
  }
  payload.insert(payload.end(), movieAtom.begin() + std::ptrdiff_t(children->tail),
                 movieAtom.end());
  Bytes out;
  appendAtom(out, "moov", payload);

  const std::int64_t delta = std::int64_t(out.size()) - std::int64_t(movieAtom.size());
  if (delta != 0) {
    if (auto shifted = shiftChunkOffsets(out, movieOffset + movieAtom.size(), delta); !shifted) {
      return platform::fail(shifted.error());
    }
  }
  return out;
}

namespace {

// The movie atom of an in-memory file image: where it stands, and a copy of
// its bytes with a to-the-end size (0) made explicit.
struct MovieInImage {
  RCMP4Atom atom;
  Bytes movie;
};

platform::Result<MovieInImage> movieInFileImage(View file) {
  auto atoms = RCMP4TopLevelAtoms(
      file.size(), [file](std::uint64_t offset, std::size_t size, std::uint8_t* out) {
        if (offset > file.size() || size > file.size() - offset) return false;
        std::memcpy(out, file.data() + offset, size);
        return true;
      });
  if (!atoms) return platform::fail(atoms.error());
  for (const RCMP4Atom& atom : *atoms) {
    if (atom.type != "moov") continue;
    Bytes movie(file.begin() + std::ptrdiff_t(atom.offset),
                file.begin() + std::ptrdiff_t(atom.offset + atom.size));
    if (be32(movie.data()) == 0) storeBE32(movie.data(), std::uint32_t(movie.size()));
    return MovieInImage{atom, std::move(movie)};
  }
  return platform::fail(mp4Error(kRCMP4ErrorNoMovie, "no movie atom"));
}

}  // namespace

platform::Result<std::vector<std::uint8_t>> RCMP4FileImageWithTitle(View file,
                                                                    std::string_view title,
                                                                    std::string_view language) {
  auto found = movieInFileImage(file);
  if (!found) return platform::fail(found.error());
  const RCMP4Atom& atom = found->atom;
  auto rewritten = RCMP4MovieWithTitle(found->movie, atom.offset, title, language);
  if (!rewritten) return platform::fail(rewritten.error());
  Bytes out(file.begin(), file.begin() + std::ptrdiff_t(atom.offset));
  out.insert(out.end(), rewritten->begin(), rewritten->end());
  out.insert(out.end(), file.begin() + std::ptrdiff_t(atom.offset + atom.size), file.end());
  return out;
}

platform::Result<std::vector<RCMetadataItem>> RCMP4TitleItemsInFileImage(View file) {
  auto found = movieInFileImage(file);
  if (!found) return platform::fail(found.error());
  return RCMP4TitleItemsInMovie(found->movie);
}

platform::Result<std::vector<RCMetadataItem>> RCMP4ReadTitleItems(const std::string& path) {
  RCScopedFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  if (!file) return platform::fail(ioError(errno, "open " + path));
  auto movie = loadMovie(file.get());
  if (!movie) return platform::fail(movie.error());
  return RCMP4TitleItemsInMovie(movie->bytes);
}

namespace {

platform::Status writeTitleOnce(const std::string& path, std::string_view title,
                                std::string_view language) {
  RCScopedFd source(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  if (!source) return platform::fail(ioError(errno, "open " + path));
  struct stat info {};
  if (::fstat(source.get(), &info) != 0) return platform::fail(ioError(errno, "fstat"));
  auto movie = loadMovie(source.get());
  if (!movie) return platform::fail(movie.error());
  auto rewritten = RCMP4MovieWithTitle(movie->bytes, movie->offset, title, language);
  if (!rewritten) return platform::fail(rewritten.error());

  auto target = RCReplacementFile::create(platform::URL::fileURLWithPath(path), 0600);
  if (!target) return platform::fail(ioErrorFrom(target.error()));
  if (::fchmod(target->fd(), info.st_mode & 07777) != 0) {
    return platform::fail(ioError(errno, "fchmod"));
  }
  if (auto s = copyRange(source.get(), 0, movie->offset, target->fd()); !s) return s;
  if (auto s = writeAll(target->fd(), *rewritten); !s) return s;
  const std::uint64_t after = movie->offset + movie->bytes.size();
  if (auto s = copyRange(source.get(), after, movie->fileSize - after, target->fd()); !s) return s;
  // Only over the file the title was written into: a compose that replaced
  // it meanwhile keeps its new audio, and the title is written again into it.
  if (auto committed = target->commitReplacing({info.st_dev, info.st_ino}); !committed) {
    if (committed.error().domain() == RCErrorDomain &&
        committed.error().code() == RCErrorCodeChangedMeanwhile) {
      return committed;
    }
    return platform::fail(ioErrorFrom(committed.error()));
  }
  return {};
}

}  // namespace

platform::Status RCMP4WriteTitle(const std::string& path, std::string_view title,
                                 std::string_view language) {
  constexpr int kAttempts = 5;
  platform::Status status;
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    status = writeTitleOnce(path, title, language);
    if (status || status.error().domain() != RCErrorDomain ||
        status.error().code() != RCErrorCodeChangedMeanwhile) {
      break;
    }
  }
  return status;
}

}  // namespace quorvel
