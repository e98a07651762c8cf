// QV_MISUSE: the one way the project reacts to a programming error inside the
// process (a call that breaks a documented contract: sync onto the current
// queue, a value() of an error result, a waveform of an impossible shape).
// Such a call cannot be answered sensibly, so the message goes to stderr with
// the file and line of the check and the process aborts; failures that come
// from outside the process (files, peers, the system) are error values
// instead. Usable from any thread.
#pragma once

#include <fmt/format.h>

#include <cstdio>
#include <cstdlib>
#include <string_view>

namespace platform::detail {

[[noreturn]] inline void misuse(const char* file, int line, std::string_view message) {
  fmt::print(stderr, "{}:{}: {}\n", file, line, message);
  std::fflush(stderr);
  std::abort();
}

}  // namespace platform::detail

// Aborts with "<file>:<line>: <message>" when `condition` holds; the message
// is a fmt format string and its arguments.
#define QV_MISUSE(condition, ...)                                                 \
  do {                                                                            \
    if (condition) [[unlikely]] {                                                 \
      ::platform::detail::misuse(__FILE__, __LINE__, ::fmt::format(__VA_ARGS__)); \
    }                                                                             \
  } while (false)
