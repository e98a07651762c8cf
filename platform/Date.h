// Date: a point in wall-clock time with sub-second precision. A value type.
#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

class Date {
 public:
  using Clock = std::chrono::system_clock;

  Date() = default;
  explicit Date(Clock::time_point time) : time_(time) {}

  static Date now() { return Date(Clock::now()); }
  static Date dateWithTimeIntervalSinceNow(double seconds);
  static Date dateWithTimeIntervalSince1970(double seconds);
  // Parses ISO 8601 / RFC 3339 ("2024-05-01T10:20:30.5Z", "…+02:00", or a
  // plain "2024-05-01 10:20:30" taken as UTC). Nullopt when unparsable.
  static std::optional<Date> fromISO8601(std::string_view text);

  double timeIntervalSinceNow() const;
  double timeIntervalSince1970() const;
  // "2024-05-01T10:20:30.500Z" (UTC, milliseconds).
  std::string ISO8601String() const;

  friend bool operator==(const Date&, const Date&) = default;
  friend auto operator<=>(const Date&, const Date&) = default;

 private:
  Clock::time_point time_{};
};

}  // namespace platform
