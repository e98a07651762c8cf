// What only the bus listener does: owning its name, the D-Bus routing and
// introspection it gets from the bus, signals that reach other peers, and a
// stress run of many short-lived peers. The contract it shares with
// LocalListener is in Listener_test.cpp.
#include <gtest/gtest.h>

#include <cstdio>
#include <set>
#include <thread>

#include "tests/platform/dbus/ListenerHarness.h"

namespace platform::testing {
namespace {

class BusListenerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    harness.listener().setDelegate(&delegate);
    ASSERT_TRUE(harness.listener().resume());
  }
  Observations seen;
  RecordingDelegate delegate{seen};
  BusHarness harness{testInterface(seen)};
};

// Calls `member` of `interface` and returns the error name ("" for none).
std::string errorOf(sdbus::IProxy& proxy, const std::string& interface, const std::string& member) {
  try {
    auto call = proxy.createMethodCall(interface, member);
    proxy.callMethod(call);
  } catch (const sdbus::Error& error) {
    return error.getName();
  }
  return {};
}

TEST_F(BusListenerTest, OtherInterfacesAreRoutedByTheBusWithoutAConnection) {
  auto bus = sdbus::createSessionBusConnectionWithAddress(harness.bus().address());
  auto proxy = sdbus::createProxy(*bus, kName, kPath);
  EXPECT_EQ(errorOf(*proxy, "org.quorvel.test.Other", "Echo"), kBusErrorUnknownMethod);
  EXPECT_EQ(errorOf(*proxy, "org.freedesktop.DBus.Peer", "Ping"), "");
  std::lock_guard lock(seen.gate.mutex());
  EXPECT_TRUE(seen.deliveries.empty());
}

TEST_F(BusListenerTest, SignalsReachListeningPeers) {
  auto watcher = sdbus::createSessionBusConnectionWithAddress(harness.bus().address());
  Gate gate;
  int received = 0;
  auto match = watcher->addMatch(
      std::string("type='signal',interface='") + kInterface + "',member='Changed'",
      [&](sdbus::Message&) { gate.update([&] { ++received; }); });
  watcher->enterEventLoopAsync();
  harness.listener().emitSignal("Changed");
  EXPECT_TRUE(gate.waitUntil([&] { return received == 1; }));
  watcher->leaveEventLoop();
}

TEST_F(BusListenerTest, IntrospectionShowsTheInterface) {
  std::string command = "gdbus introspect --address '" + harness.bus().address() + "' --dest " +
                        kName + " --object-path " + kPath + " 2>&1";
  std::string output;
  if (FILE* pipe = ::popen(command.c_str(), "r")) {
    char buffer[512];
    while (std::fgets(buffer, sizeof buffer, pipe)) output += buffer;
    ::pclose(pipe);
  }
  EXPECT_NE(output.find(kInterface), std::string::npos) << output;
  EXPECT_NE(output.find("Echo(in  s text,"), std::string::npos) << output;
  EXPECT_NE(output.find("out (siss) token"), std::string::npos) << output;
  EXPECT_NE(output.find("org.freedesktop.DBus.Method.NoReply"), std::string::npos) << output;
  EXPECT_NE(output.find("signal"), std::string::npos) << output;
}

// A name already taken is the integration test's second daemon.
TEST(BusListenerStartTest, FailsAsAValueWhenTheBusIsUnreachable) {
  Observations seen;
  BusListener unreachable(BusListenerOptions{"unix:path=/nonexistent/socket", kName, kPath},
                          testInterface(seen));
  EXPECT_FALSE(unreachable.resume());
}

// Many short-lived peers, from several threads at once: each connects,
// calls, and disconnects. Every connection is reported gone exactly once
// and no connection object outlives its peer.
TEST_F(BusListenerTest, StressManyPeersComeAndGo) {
  constexpr int kThreads = 4;
  constexpr int kPeersPerThread = 250;
  constexpr int kBatch = 25;
  std::vector<std::thread> threads;
  std::mutex namesMutex;
  std::set<std::string> names;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      for (int done = 0; done < kPeersPerThread; done += kBatch) {
        std::vector<std::unique_ptr<sdbus::IConnection>> batch;
        for (int i = 0; i < kBatch; ++i) {
          batch.push_back(sdbus::createSessionBusConnectionWithAddress(harness.bus().address()));
          std::string echo;
          sdbus::createProxy(*batch.back(), kName, kPath)
              ->callMethod("Echo")
              .onInterface(kInterface)
              .withArguments(std::string("p"))
              .storeResultsTo(echo);
          EXPECT_EQ(echo, "p");
          std::lock_guard lock(namesMutex);
          names.insert(batch.back()->getUniqueName());
        }
      }  // each batch disconnects here
    });
  }
  for (auto& thread : threads) thread.join();
  constexpr int kPeers = kThreads * kPeersPerThread;
  ASSERT_TRUE(seen.gate.waitUntil([&] { return seen.totalInvalidations == kPeers; }))
      << seen.totalInvalidations;
  harness.settle();  // the last invalidation has finished on the bus thread

  std::lock_guard lock(seen.gate.mutex());
  EXPECT_EQ(names.size(), static_cast<std::size_t>(kPeers));
  EXPECT_EQ(seen.accepted, kPeers);
  EXPECT_EQ(seen.invalidations.size(), static_cast<std::size_t>(kPeers));
  for (const auto& [name, count] : seen.invalidations) {
    EXPECT_EQ(count, 1) << name;
    EXPECT_TRUE(names.count(name)) << name;
  }
  EXPECT_EQ(harness.listener().connectionCount(), 0u);
  seen.deliveries.clear();  // they hold connections
  seen.offered.clear();
  int alive = 0;
  for (const auto& weak : seen.connections) alive += !weak.expired();
  EXPECT_EQ(alive, 0);
}

}  // namespace
}  // namespace platform::testing
