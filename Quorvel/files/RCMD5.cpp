#include "Quorvel/files/RCMD5.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <memory>
#include <type_traits>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCFileStatus.h"
#include "platform/Log.h"

namespace quorvel {
namespace {

// 1 MiB reads: few system calls, and the buffer still sits in L2.
constexpr std::size_t kChunkSize = 1 << 20;

// libcrypto is loaded when the first digest is asked for: a daemon that never
// digests a file (most runs) does not carry the library's megabyte and more
// of resident memory from start-up on. nullptr when it cannot be loaded.
struct Crypto {
  decltype(&EVP_MD_CTX_new) contextNew = nullptr;
  decltype(&EVP_MD_CTX_free) contextFree = nullptr;
  decltype(&EVP_MD_fetch) fetch = nullptr;
  decltype(&EVP_DigestInit_ex) init = nullptr;
  decltype(&EVP_DigestUpdate) update = nullptr;
  decltype(&EVP_DigestFinal_ex) final = nullptr;
  const EVP_MD* md5 = nullptr;  // fetched once: a fetch looks the provider up
};

const Crypto* crypto() {
  static const Crypto* const loaded = []() -> const Crypto* {
    void* library = ::dlopen("libcrypto.so.3", RTLD_NOW | RTLD_LOCAL);
    if (library == nullptr) {
      QV_LOG(platform::kLogLevelError, "ERROR: cannot load libcrypto for MD5: {}", ::dlerror());
      return nullptr;
    }
    auto functions = std::make_unique<Crypto>();
    bool found = true;
    auto bind = [&](auto& function, const char* name) {
      function =
          reinterpret_cast<std::remove_reference_t<decltype(function)>>(::dlsym(library, name));
      found = found && function != nullptr;
    };
    bind(functions->contextNew, "EVP_MD_CTX_new");
    bind(functions->contextFree, "EVP_MD_CTX_free");
    bind(functions->fetch, "EVP_MD_fetch");
    bind(functions->init, "EVP_DigestInit_ex");
    bind(functions->update, "EVP_DigestUpdate");
    bind(functions->final, "EVP_DigestFinal_ex");
    if (found) functions->md5 = functions->fetch(nullptr, "MD5", nullptr);
    if (functions->md5 == nullptr) {
      QV_LOG(platform::kLogLevelError, "ERROR: libcrypto offers no MD5");
      return nullptr;
    }
    return functions.release();  // for the life of the process
  }();
  return loaded;
}

// A digest context; unusable (nullptr) when MD5 is unavailable.
class Digest {
 public:
  Digest() : crypto_(crypto()) {
    if (crypto_ != nullptr) context_ = crypto_->contextNew();
    if (context_ != nullptr && crypto_->init(context_, crypto_->md5, nullptr) != 1) {
      crypto_->contextFree(context_);
      context_ = nullptr;
    }
  }
  ~Digest() {
    if (context_ != nullptr) crypto_->contextFree(context_);
  }
  Digest(const Digest&) = delete;
  Digest& operator=(const Digest&) = delete;

  bool usable() const { return context_ != nullptr; }
  void update(const void* bytes, std::size_t size) { crypto_->update(context_, bytes, size); }
  RCMD5Digest finish() {
    RCMD5Digest digest{};
    unsigned int length = 0;
    crypto_->final(context_, digest.data(), &length);
    return digest;
  }

 private:
  const Crypto* crypto_;
  EVP_MD_CTX* context_ = nullptr;
};

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
  Digest digest;
  if (!digest.usable()) return {};
  digest.update(bytes.data(), bytes.size());
  return digest.finish();
}

platform::Result<std::optional<RCMD5Digest>> RCMD5DigestOfFile(const std::string& path) {
  const RCFileStatus named = RCFileStatus::atPathFollowing(path);
  if (!named.exists() || named.isEmptyRegularFile()) return std::optional<RCMD5Digest>();

  // O_NONBLOCK keeps a FIFO from blocking the open; reading one fails below.
  RCScopedFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  if (!file) return platform::fail(platform::posixError(errno, "open " + path));
  const int fd = file.get();
  const RCFileStatus opened = RCFileStatus::ofDescriptor(fd);
  if (!opened.exists()) return platform::fail(platform::posixError(opened.error, "fstat " + path));
  if (!opened.isRegularFile()) {
    return platform::fail(platform::posixError(opened.isDirectory() ? EISDIR : EINVAL,
                                               "not a regular file: " + path));
  }
  if (opened.isEmptyRegularFile()) return std::optional<RCMD5Digest>();
  ::posix_fadvise(fd, 0, 0, POSIX_FADV_SEQUENTIAL);

  Digest context;
  if (!context.usable()) {
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
    context.update(buffer.get(), *got);
    total += std::uint64_t(*got);
  }
  // A file emptied between the size check and the read has nothing to digest.
  if (total == 0) return std::optional<RCMD5Digest>();
  return std::optional<RCMD5Digest>(context.finish());
}

std::optional<RCMD5Digest> RCMD5DataForPath(const std::string& path) {
  auto digest = RCMD5DigestOfFile(path);
  if (!digest) return std::nullopt;
  return *digest;
}

}  // namespace quorvel
