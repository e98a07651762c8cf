#include "platform/UUID.h"

#include <pthread.h>
#include <sys/random.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace platform {

namespace {

void fillFromKernel(std::uint8_t* data, std::size_t size) {
  std::size_t filled = 0;
  while (filled < size) {
    ssize_t n = getrandom(data + filled, size - filled, 0);
    if (n < 0) {
      if (errno == EINTR) continue;
      std::abort();  // no randomness at all: nothing sensible can go on
    }
    filled += static_cast<std::size_t>(n);
  }
}

// Every keep-alive and session takes a UUID, thousands a second on a busy
// daemon, and each getrandom() is a system call. So each thread draws the
// kernel's random bytes a block at a time and hands them out 16 at a time.
// The bytes are the kernel's, used once each; a forked child drops what its
// parent had buffered, so the two never hand out the same identifier.
constexpr std::size_t kBlock = std::size_t{16} * 128;  // 128 identifiers
std::atomic<std::uint64_t> forkGeneration{0};

struct RandomBuffer {
  std::array<std::uint8_t, kBlock> bytes;
  std::size_t used = kBlock;
  std::uint64_t generation = 0;
};

void takeRandomBytes(std::uint8_t* out, std::size_t size) {
  static const bool forkHandlerInstalled = [] {
    pthread_atfork(nullptr, nullptr, [] { forkGeneration.fetch_add(1); });
    return true;
  }();
  (void)forkHandlerInstalled;
  thread_local RandomBuffer buffer;
  std::uint64_t generation = forkGeneration.load(std::memory_order_relaxed);
  if (buffer.used + size > kBlock || buffer.generation != generation) {
    fillFromKernel(buffer.bytes.data(), kBlock);
    buffer.used = 0;
    buffer.generation = generation;
  }
  std::memcpy(out, buffer.bytes.data() + buffer.used, size);
  std::memset(buffer.bytes.data() + buffer.used, 0, size);
  buffer.used += size;
}

}  // namespace

UUID UUID::random() {
  UUID uuid;
  takeRandomBytes(uuid.bytes_.data(), uuid.bytes_.size());
  uuid.bytes_[6] = static_cast<std::uint8_t>((uuid.bytes_[6] & 0x0F) | 0x40);
  uuid.bytes_[8] = static_cast<std::uint8_t>((uuid.bytes_[8] & 0x3F) | 0x80);
  return uuid;
}

std::optional<UUID> UUID::fromString(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  UUID uuid;
  std::size_t byte = 0;
  for (std::size_t i = 0; i < text.size();) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      if (text[i] != '-') return std::nullopt;
      ++i;
      continue;
    }
    auto hex = [](char c) -> int {
      if (c >= '0' && c <= '9') return c - '0';
      if (c >= 'a' && c <= 'f') return c - 'a' + 10;
      if (c >= 'A' && c <= 'F') return c - 'A' + 10;
      return -1;
    };
    int high = hex(text[i]);
    int low = hex(text[i + 1]);
    if (high < 0 || low < 0) return std::nullopt;
    uuid.bytes_[byte++] = static_cast<std::uint8_t>(high * 16 + low);
    i += 2;
  }
  return uuid;
}

std::string UUID::string() const {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(36);
  for (std::size_t i = 0; i < bytes_.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) out.push_back('-');
    out.push_back(kHex[bytes_[i] >> 4]);
    out.push_back(kHex[bytes_[i] & 0xF]);
  }
  return out;
}

}  // namespace platform
