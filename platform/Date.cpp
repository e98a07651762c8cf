#include "platform/Date.h"

#include <fmt/format.h>

#include <cmath>
#include <cstdio>
#include <ctime>

namespace platform {
namespace {

Date::Clock::duration secondsToDuration(double seconds) {
  return std::chrono::duration_cast<Date::Clock::duration>(std::chrono::duration<double>(seconds));
}

// Days since 1970-01-01 of a proleptic Gregorian date.
long long daysFromCivil(long long y, unsigned m, unsigned d) {
  y -= m <= 2;
  const long long era = (y >= 0 ? y : y - 399) / 400;
  const unsigned yoe = static_cast<unsigned>(y - era * 400);
  const unsigned doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
  const unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return era * 146097 + static_cast<long long>(doe) - 719468;
}

}  // namespace

Date Date::dateWithTimeIntervalSinceNow(double seconds) {
  return Date(Clock::now() + secondsToDuration(seconds));
}

Date Date::dateWithTimeIntervalSince1970(double seconds) {
  return Date(Clock::time_point(secondsToDuration(seconds)));
}

double Date::timeIntervalSinceNow() const {
  return std::chrono::duration<double>(time_ - Clock::now()).count();
}

double Date::timeIntervalSince1970() const {
  return std::chrono::duration<double>(time_.time_since_epoch()).count();
}

std::optional<Date> Date::fromISO8601(std::string_view text) {
  int year = 0, month = 0, day = 0, hour = 0, minute = 0, consumed = 0;
  double second = 0;
  std::string copy(text);
  if (std::sscanf(copy.c_str(), "%4d-%2d-%2d%*1[T ]%2d:%2d:%lf%n", &year, &month, &day, &hour,
                  &minute, &second, &consumed) < 6) {
    return std::nullopt;
  }
  if (month < 1 || month > 12 || day < 1 || day > 31 || hour > 23 || minute > 59 || second < 0 ||
      second >= 61 || !std::isfinite(second)) {
    return std::nullopt;
  }
  std::string_view zone = text.substr(static_cast<std::size_t>(consumed));
  int offsetMinutes = 0;
  if (!zone.empty() && zone != "Z" && zone != "z") {
    int zh = 0, zm = 0;
    char sign = 0;
    std::string z(zone);
    if (std::sscanf(z.c_str(), "%c%2d:%2d", &sign, &zh, &zm) != 3 &&
        std::sscanf(z.c_str(), "%c%2d%2d", &sign, &zh, &zm) != 3) {
      return std::nullopt;
    }
    if ((sign != '+' && sign != '-') || zh > 23 || zm > 59) return std::nullopt;
    offsetMinutes = (sign == '-' ? -1 : 1) * (zh * 60 + zm);
  }
  long long days = daysFromCivil(year, static_cast<unsigned>(month), static_cast<unsigned>(day));
  double since1970 = static_cast<double>(days) * 86400.0 + hour * 3600.0 + minute * 60.0 + second -
                     offsetMinutes * 60.0;
  return dateWithTimeIntervalSince1970(since1970);
}

std::string Date::ISO8601String() const {
  auto millis = std::chrono::floor<std::chrono::milliseconds>(time_).time_since_epoch().count();
  std::time_t seconds = static_cast<std::time_t>(std::floor(static_cast<double>(millis) / 1000.0));
  long long remainder = millis - static_cast<long long>(seconds) * 1000;
  std::tm utc{};
  gmtime_r(&seconds, &utc);
  return fmt::format("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}.{:03}Z", utc.tm_year + 1900,
                     utc.tm_mon + 1, utc.tm_mday, utc.tm_hour, utc.tm_min, utc.tm_sec, remainder);
}

}  // namespace platform
