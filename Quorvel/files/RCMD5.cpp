#include "Quorvel/files/RCMD5.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <memory>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFile.h"

namespace quorvel {
namespace {

// 1 MiB reads: few system calls, and the buffer still sits in L2.
constexpr std::size_t kChunkSize = 1 << 20;

struct DigestContextDeleter {
  void operator()(EVP_MD_CTX* context) const { EVP_MD_CTX_free(context); }
};

const EVP_MD* md5Algorithm() {
  // Fetched once: EVP_MD_fetch looks the provider up on every call otherwise.
  static EVP_MD* algorithm = EVP_MD_fetch(nullptr, "MD5", nullptr);
  return algorithm != nullptr ? algorithm : EVP_md5();
}

struct AlignedFree {
  void operator()(std::uint8_t* p) const { std::free(p); }
};

}  // namespace

std::string RCMD5HexString(const RCMD5Digest& digest) {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string text;
  text.reserve(32);
  for (std::uint8_t byte : digest) {
    text.push_back(kHex[byte >> 4]);
    text.push_back(kHex[byte & 0xF]);
  }
  return text;
}

RCMD5Digest RCMD5DigestOfBytes(std::string_view bytes) {
  RCMD5Digest digest{};
  unsigned int length = 0;
  EVP_Digest(bytes.data(), bytes.size(), digest.data(), &length, md5Algorithm(), nullptr);
  return digest;
}

platform::Result<std::optional<RCMD5Digest>> RCMD5DigestOfFile(const std::string& path) {
  struct stat info {};
  if (::stat(path.c_str(), &info) != 0) return std::optional<RCMD5Digest>();
  if (S_ISREG(info.st_mode) && info.st_size == 0) return std::optional<RCMD5Digest>();

  // O_NONBLOCK keeps a FIFO from blocking the open; reading one fails below.
  RCScopedFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  if (!file) return platform::fail(platform::posixError(errno, "open " + path));
  const int fd = file.get();
  if (::fstat(fd, &info) != 0) return platform::fail(platform::posixError(errno, "fstat " + path));
  if (!S_ISREG(info.st_mode)) {
    return platform::fail(platform::posixError(S_ISDIR(info.st_mode) ? EISDIR : EINVAL,
                                               "not a regular file: " + path));
  }
  if (info.st_size == 0) return std::optional<RCMD5Digest>();
  ::posix_fadvise(fd, 0, 0, POSIX_FADV_SEQUENTIAL);

  std::unique_ptr<EVP_MD_CTX, DigestContextDeleter> context(EVP_MD_CTX_new());
  if (!context || EVP_DigestInit_ex(context.get(), md5Algorithm(), nullptr) != 1) {
    return platform::fail(
        platform::Error(kRCMD5ErrorDomain, RCMD5ErrorCodeUnavailable, "MD5 unavailable"));
  }
  std::unique_ptr<std::uint8_t, AlignedFree> buffer(
      static_cast<std::uint8_t*>(std::aligned_alloc(4096, kChunkSize)));
  std::uint64_t total = 0;
  for (;;) {
    auto got = RCReadFully(fd, buffer.get(), kChunkSize, path);
    if (!got) return platform::fail(got.error());
    if (*got == 0) break;
    EVP_DigestUpdate(context.get(), buffer.get(), *got);
    total += std::uint64_t(*got);
  }
  // A file emptied between the size check and the read has nothing to digest.
  if (total == 0) return std::optional<RCMD5Digest>();
  RCMD5Digest digest{};
  unsigned int length = 0;
  EVP_DigestFinal_ex(context.get(), digest.data(), &length);
  return std::optional<RCMD5Digest>(digest);
}

std::optional<RCMD5Digest> RCMD5DataForPath(const std::string& path) {
  auto digest = RCMD5DigestOfFile(path);
  if (!digest) return std::nullopt;
  return *digest;
}

}  // namespace quorvel
