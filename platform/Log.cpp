#include "platform/Log.h"

#include <sys/stat.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <mutex>

namespace platform {
namespace {

struct LogState {
  std::once_flag once;
  std::atomic<int> threshold{kLogLevelNotice};
  std::atomic<bool> console{false};
  std::atomic<bool> journal{false};
  std::mutex mutex;  // guards identifier, sink and the stderr writes
  std::string identifier = "quorveld";
  LogSink sink;
  std::atomic<bool> hasSink{false};
};

LogState& state() {
  static LogState* s = new LogState;  // never destroyed: logging works during exit
  return *s;
}

void writeStderr(std::string_view text) {
  std::string line(text);
  line.push_back('\n');
  std::fwrite(line.data(), 1, line.size(), stderr);
  std::fflush(stderr);
}

}  // namespace

void logInitialize() {
  LogState& s = state();
  std::call_once(s.once, [&s] {
    if (const char* level = std::getenv("QUORVEL_LOG_LEVEL"); level && *level) {
      int value = std::atoi(level);
      if (value >= 0 && value <= 7) s.threshold = value;
    }
    const char* console = std::getenv("QUORVEL_LOG_CONSOLE");
    if (console && *console) {
      s.console = std::string_view(console) == "1";
    } else {
      s.console = isatty(STDERR_FILENO) == 1;
    }
    struct stat st {};
    s.journal = std::getenv("QUORVEL_LOG_STDERR") == nullptr &&
                stat("/run/systemd/journal/socket", &st) == 0 && S_ISSOCK(st.st_mode);
  });
}

void setLogThreshold(int level) {
  logInitialize();
  state().threshold = level;
}

int logThreshold() {
  logInitialize();
  return state().threshold;
}

void setConsoleLogging(bool enabled) {
  logInitialize();
  state().console = enabled;
}

void setLogIdentifier(std::string identifier) {
  std::lock_guard lock(state().mutex);
  state().identifier = std::move(identifier);
}

bool shouldLogToConsole(int level, LogCategory) {
  LogState& s = state();
  return s.console.load(std::memory_order_relaxed) &&
         level <= s.threshold.load(std::memory_order_relaxed);
}

bool LoggingShouldLog(int level, LogCategory) {
  return level <= state().threshold.load(std::memory_order_relaxed);
}

void logToConsole(std::string_view text) {
  using namespace std::chrono;
  auto now = system_clock::now();
  std::time_t seconds = system_clock::to_time_t(now);
  auto millis = duration_cast<milliseconds>(now.time_since_epoch()).count() % 1000;
  std::tm local{};
  localtime_r(&seconds, &local);
  LogState& s = state();
  std::lock_guard lock(s.mutex);
  writeStderr(fmt::format("{:04}-{:02}-{:02} {:02}:{:02}:{:02}.{:03} {}[{}:{}] {}",
                          local.tm_year + 1900, local.tm_mon + 1, local.tm_mday, local.tm_hour,
                          local.tm_min, local.tm_sec, millis, s.identifier, getpid(), gettid(),
                          text));
}

void LogInternal(int level, LogCategory, std::string_view file, std::string_view function, int line,
                 std::string_view text) {
  LogState& s = state();
  if (s.hasSink.load(std::memory_order_acquire)) {
    std::lock_guard lock(s.mutex);
    if (s.sink) {
      s.sink(level, text);
      return;
    }
  }
  if (s.journal) {
    std::string identifier;
    {
      std::lock_guard lock(s.mutex);
      identifier = s.identifier;
    }
    std::string fileField = fmt::format("CODE_FILE={}", file);
    std::string lineField = fmt::format("CODE_LINE={}", line);
    std::string funcField = fmt::format("CODE_FUNC={}", function);
    std::string message = fmt::format("MESSAGE={}", text);
    std::string priority = fmt::format("PRIORITY={}", level);
    std::string ident = fmt::format("SYSLOG_IDENTIFIER={}", identifier);
    iovec fields[] = {
        {message.data(), message.size()},     {priority.data(), priority.size()},
        {fileField.data(), fileField.size()}, {lineField.data(), lineField.size()},
        {funcField.data(), funcField.size()}, {ident.data(), ident.size()},
    };
    if (sd_journal_sendv(fields, 6) >= 0) return;
  }
  if (s.console.load(std::memory_order_relaxed)) return;  // already on stderr
  std::lock_guard lock(s.mutex);
  writeStderr(fmt::format("<{}>{}", level, text));
}

void setLogSinkForTesting(LogSink sink) {
  logInitialize();
  LogState& s = state();
  std::lock_guard lock(s.mutex);
  s.hasSink = static_cast<bool>(sink);
  s.sink = std::move(sink);
}

namespace detail {

void writeLogLine(int level, std::string_view tag, std::string_view file, std::string_view function,
                  int line, std::string_view message) {
  std::string text = fmt::format("[{}] {}", tag, message);
  if (shouldLogToConsole(level, LogCategory::Default)) logToConsole(text);
  if (LoggingShouldLog(level, LogCategory::Default)) {
    LogInternal(level, LogCategory::Default, file, function, line, text);
  }
}

}  // namespace detail
}  // namespace platform
