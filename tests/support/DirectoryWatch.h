// DirectoryWatch: what happens to the names in one directory, from inotify,
// so a test waits for a file to appear or counts replacements instead of
// polling. Events are queued by the kernel before the call that caused them
// returns, so nothing done before events() or waitFor() is missed. Owned by
// the test; one thread at a time.
#pragma once

#include <poll.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "tests/support/Gate.h"

namespace quorvel::testing {

class DirectoryWatch {
 public:
  struct Event {
    std::uint32_t mask;  // IN_CREATE, IN_MOVED_TO, IN_MODIFY, IN_DELETE, …
    std::string name;
  };

  explicit DirectoryWatch(const std::filesystem::path& directory,
                          std::uint32_t mask = IN_CREATE | IN_MOVED_TO | IN_MODIFY | IN_DELETE) {
    fd_ = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    if (fd_ >= 0) ::inotify_add_watch(fd_, directory.c_str(), mask);
  }
  ~DirectoryWatch() {
    if (fd_ >= 0) ::close(fd_);
  }
  DirectoryWatch(const DirectoryWatch&) = delete;
  DirectoryWatch& operator=(const DirectoryWatch&) = delete;

  // The events queued since the last call.
  std::vector<Event> events() {
    std::vector<Event> out;
    alignas(inotify_event) char buffer[16384];
    for (;;) {
      const ssize_t n = fd_ < 0 ? -1 : ::read(fd_, buffer, sizeof buffer);
      if (n <= 0) return out;
      for (char* p = buffer; p < buffer + n;) {
        auto* event = reinterpret_cast<inotify_event*>(p);
        out.push_back({event->mask, event->len ? std::string(event->name) : std::string()});
        p += sizeof(inotify_event) + event->len;
      }
    }
  }
  // Waits (up to Gate's bound) for an event that `matches`; true when one came.
  bool waitFor(const std::function<bool(const Event&)>& matches) {
    const auto until = std::chrono::steady_clock::now() + platform::testing::kWait;
    while (std::chrono::steady_clock::now() < until) {
      for (const Event& event : events())
        if (matches(event)) return true;
      struct pollfd fds = {fd_, POLLIN, 0};
      ::poll(&fds, 1, 100);
    }
    return false;
  }
  // Waits for a name starting with `prefix` to be created or moved in.
  bool waitForCreation(const std::string& prefix) {
    return waitFor([&](const Event& event) {
      return (event.mask & (IN_CREATE | IN_MOVED_TO)) && event.name.starts_with(prefix);
    });
  }

 private:
  int fd_ = -1;
};

}  // namespace quorvel::testing
