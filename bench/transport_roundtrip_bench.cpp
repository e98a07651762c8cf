// Round trip through the listener against a bare D-Bus round trip.
//
// One process, one private dbus-daemon. A BusListener exports a trivial
// method; a client connection calls it N times, and N times calls
// org.freedesktop.DBus.Peer.Ping on the same listener's name, which sd-bus
// answers on the same bus thread without entering the listener's code. The
// ratio of the two mean round trips is the cost of the transport's own
// dispatch (connection table, call object, answer path). Target: <= 1.2.
//
// Usage: transport_roundtrip_bench [N]   (default 20000)
#include <sdbus-c++/sdbus-c++.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "bench/AcceptAll.h"
#include "platform/dbus/BusListener.h"
// The test suite's private bus.
#include "tests/support/TestBus.h"

namespace {

constexpr const char* kName = "org.quorvel.bench.Transport";
constexpr const char* kPath = "/org/quorvel/bench/Transport";
constexpr const char* kInterface = "org.quorvel.bench.Transport1";

using Clock = std::chrono::steady_clock;

// Calls `member` of `interface` `count` times; returns the total time.
Clock::duration callRepeatedly(sdbus::IProxy& proxy, const char* interface, const char* member,
                               int count) {
  auto start = Clock::now();
  for (int i = 0; i < count; ++i) {
    auto call = proxy.createMethodCall(interface, member);
    proxy.callMethod(call);
  }
  return Clock::now() - start;
}

}  // namespace

int main(int argc, char** argv) {
  int n = argc > 1 ? std::atoi(argv[1]) : 20000;
  if (n <= 0) n = 20000;

  platform::testing::TestBus bus;
  platform::InterfaceDescription interface {
    kInterface, {}, {}
  };
  interface.methods.push_back(
      {"Nop", "", {}, "", {}, false, [](platform::IncomingCall call) { call.reply(); }});
  quorvel::bench::AcceptAll delegate;
  platform::BusListener listener({bus.address(), kName, kPath}, interface);
  listener.setDelegate(&delegate);
  if (auto started = listener.resume(); !started) {
    std::fprintf(stderr, "cannot start the listener: %s\n", started.error().description().c_str());
    return 1;
  }

  auto client = sdbus::createSessionBusConnectionWithAddress(bus.address());
  auto proxy = sdbus::createProxy(*client, kName, kPath);

  // Warm up both paths (connection accepted, caches and branch predictors).
  callRepeatedly(*proxy, kInterface, "Nop", 1000);
  callRepeatedly(*proxy, "org.freedesktop.DBus.Peer", "Ping", 1000);

  // Interleaved rounds so that drift in machine load hits both alike.
  constexpr int kRounds = 10;
  Clock::duration method{}, ping{};
  for (int round = 0; round < kRounds; ++round) {
    int count = n / kRounds + (round < n % kRounds ? 1 : 0);
    method += callRepeatedly(*proxy, kInterface, "Nop", count);
    ping += callRepeatedly(*proxy, "org.freedesktop.DBus.Peer", "Ping", count);
  }

  using Micros = std::chrono::duration<double, std::micro>;
  double methodMean = Micros(method).count() / n;
  double pingMean = Micros(ping).count() / n;
  std::printf("calls per path:                %d\n", n);
  std::printf("listener method round trip:    %.2f us\n", methodMean);
  std::printf("bare Peer.Ping round trip:     %.2f us\n", pingMean);
  std::printf("ratio (method / ping):         %.3f (target <= 1.2)\n", methodMean / pingMean);
  listener.stop();
  return 0;
}
