// MD5 digests (RFC 1321) of whole files, for finding duplicate recordings.
//
// The file is read in large chunks with sequential read-ahead, never loaded
// whole, so a long recording costs a fixed amount of memory. Blocking file
// I/O: call it where blocking is allowed. Thread-safe.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Error.h"

namespace quorvel {

using RCMD5Digest = std::array<std::uint8_t, 16>;

// Lower-case hexadecimal form, 32 characters.
std::string RCMD5HexString(const RCMD5Digest& digest);

// The digest of the contents of the file at `path`:
// - nullopt value: the file has no attributes (missing) or is empty;
// - an error: the file exists but could not be read (no permission, a
//   directory, a read error);
// - otherwise its 16-byte digest.
platform::Result<std::optional<RCMD5Digest>> RCMD5DigestOfFile(const std::string& path);

// Same, folding a read failure into nullopt as well.
std::optional<RCMD5Digest> RCMD5DataForPath(const std::string& path);

// The digest of bytes in memory.
RCMD5Digest RCMD5DigestOfBytes(std::string_view bytes);

}  // namespace quorvel
