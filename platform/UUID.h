// UUID: a random (version 4) identifier. A value type, safe to share.
#pragma once

#include <array>
#include <cstdint>
#include <cstring>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

class UUID {
 public:
  // A fresh random UUID from the kernel's random source.
  static UUID random();
  // Parses the 36-character form, either case; nullopt otherwise.
  static std::optional<UUID> fromString(std::string_view text);

  // Upper-case 8-4-4-4-12 form, "E621E1F8-C36C-495A-93FC-0C247A3E6E5F".
  std::string string() const;
  const std::array<std::uint8_t, 16>& bytes() const { return bytes_; }

  // Two word compares: tables of keep-alives compare identifiers all day.
  friend bool operator==(const UUID& a, const UUID& b) {
    std::uint64_t words[4];
    std::memcpy(&words[0], a.bytes_.data(), 16);
    std::memcpy(&words[2], b.bytes_.data(), 16);
    return words[0] == words[2] && words[1] == words[3];
  }
  friend auto operator<=>(const UUID&, const UUID&) = default;

 private:
  std::array<std::uint8_t, 16> bytes_{};
};

}  // namespace platform

template <>
struct std::hash<platform::UUID> {
  std::size_t operator()(const platform::UUID& uuid) const noexcept {
    // Random bytes hash themselves; the fixed version bits are in the middle.
    std::uint64_t head, tail;
    std::memcpy(&head, uuid.bytes().data(), 8);
    std::memcpy(&tail, uuid.bytes().data() + 8, 8);
    return static_cast<std::size_t>(head ^ (tail * 0x9E3779B97F4A7C15ull));
  }
};
