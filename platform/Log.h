// The log: one line per statement, "[<tag>] <message>", where the tag is the
// name of the source file up to its first '.' (so SavedRecordingService.cpp
// and SavedRecordingService.Connections.cpp both log as
// "[SavedRecordingService] "). A file whose lines belong under another tag
// defines QV_LOG_TAG ("RCSXPCTransaction") before its first #include.
//
// Levels are syslog's: 4 for errors and warnings, 6 for notable events, 7 for
// tracing. A line goes to the console (stderr, human-readable) when the
// console is on (stderr is a terminal, or QUORVEL_LOG_CONSOLE=1) and to the
// log back end (journald's native protocol when journald is there, else
// stderr as "<N>[tag] message") when the level passes the threshold (6, or
// 7 with --verbose / QUORVEL_LOG_LEVEL=7). Both may happen; the back end's
// stderr fallback stays quiet when the console already printed the line.
//
// Thread-safe: may be used from any thread.
#pragma once

#include <fmt/format.h>
#include <fmt/ostream.h>

#include <functional>
#include <string>
#include <string_view>

namespace platform {

inline constexpr int kLogLevelError = 4;
inline constexpr int kLogLevelNotice = 6;
inline constexpr int kLogLevelDebug = 7;

enum class LogCategory { Default };

// Idempotent set-up: reads QUORVEL_LOG_LEVEL and QUORVEL_LOG_CONSOLE once.
void logInitialize();
// Level threshold of the back end (and the console). 6 by default.
void setLogThreshold(int level);
int logThreshold();
// Forces the console on or off (the default follows stderr / the environment).
void setConsoleLogging(bool enabled);
// Sets the identifier used with journald and on the console ("quorveld").
void setLogIdentifier(std::string identifier);

// Whether a line of this level goes to the console.
bool shouldLogToConsole(int level, LogCategory category);
// Whether a line of this level goes to the back end: level <= threshold.
bool LoggingShouldLog(int level, LogCategory category);
// Writes one line to the console.
void logToConsole(std::string_view text);
// Writes one line to the back end (or the test sink, when one is installed).
void LogInternal(int level, LogCategory category, std::string_view file, std::string_view function,
                 int line, std::string_view text);

// The tag of a source file: its base name up to the first '.'.
constexpr std::string_view logTagForFile(std::string_view file) {
  std::size_t slash = file.rfind('/');
  if (slash != std::string_view::npos) file.remove_prefix(slash + 1);
  return file.substr(0, file.find('.'));
}

// Tests: while a sink is installed, every back-end line goes to it (level and
// full text "[tag] message") instead of journald/stderr. Pass nullptr to
// remove it.
using LogSink = std::function<void(int level, std::string_view text)>;
void setLogSinkForTesting(LogSink sink);

namespace detail {
void writeLogLine(int level, std::string_view tag, std::string_view file, std::string_view function,
                  int line, std::string_view message);
}  // namespace detail

}  // namespace platform

#ifndef QV_LOG_TAG
#define QV_LOG_TAG ::platform::logTagForFile(__FILE__)
#endif

// QV_LOG(level, "format {}", args...): formats (fmt syntax) only when the line
// goes somewhere.
#define QV_LOG(level, ...)                                                                      \
  do {                                                                                          \
    ::platform::logInitialize();                                                                \
    const int qv_log_level_ = (level);                                                          \
    if (::platform::shouldLogToConsole(qv_log_level_, ::platform::LogCategory::Default) ||      \
        ::platform::LoggingShouldLog(qv_log_level_, ::platform::LogCategory::Default)) {        \
      ::platform::detail::writeLogLine(qv_log_level_, QV_LOG_TAG, __FILE__, __func__, __LINE__, \
                                       ::fmt::format(__VA_ARGS__));                             \
    }                                                                                           \
  } while (0)
