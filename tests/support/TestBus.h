// TestBus: a private dbus-daemon for one test (or one test suite). The
// constructor starts `dbus-daemon --nofork --print-address` with a
// generated configuration (a session bus with the limits of Debian's
// session.conf, listening in a fresh temporary directory) and waits for it
// to print its address; the destructor kills it and removes the directory.
// The daemon also dies with the test process (parent-death signal).
//
// Usage:
//   platform::testing::TestBus bus;           // throws if it cannot start
//   BusListenerOptions options{bus.address(), "org.example.Name", "/org/example"};
//
// Owned by the test; not thread-safe (use it from the test's thread).
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace platform::testing {

class TestBus {
 public:
  struct Options {
    // Directories with D-Bus service (activation) files, for tests that let
    // the bus start a service on demand.
    std::vector<std::string> serviceDirectories;
  };

  TestBus();
  explicit TestBus(Options options);
  ~TestBus();
  TestBus(const TestBus&) = delete;
  TestBus& operator=(const TestBus&) = delete;

  // The address to connect to, e.g. "unix:path=/tmp/qv-bus-XXXX/dbus-abc,guid=...".
  const std::string& address() const { return address_; }
  // The dbus-daemon's process, for benchmarks that read its CPU time.
  pid_t pid() const { return pid_; }
  // Ends the daemon now and waits for it (to test a lost bus). Idempotent.
  void kill();

 private:
  std::string directory_;
  std::string address_;
  pid_t pid_ = -1;
};

}  // namespace platform::testing
