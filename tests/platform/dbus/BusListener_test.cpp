// BusListener against a private dbus-daemon: delivery, connections, answers
// from any thread, the standard errors, peers vanishing, losing the bus, and
// a stress run of many short-lived peers.
#include <gtest/gtest.h>
#include <sdbus-c++/sdbus-c++.h>

#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <future>
#include <map>
#include <mutex>
#include <set>
#include <thread>

#include "platform/dbus/BusListener.h"
#include "tests/support/TestBus.h"

namespace platform {
namespace {

using namespace std::chrono_literals;

constexpr const char* kName = "org.quorvel.test.Listener";
constexpr const char* kPath = "/org/quorvel/test/Listener";
constexpr const char* kInterface = "org.quorvel.test.Listener1";
constexpr auto kWait = 20s;  // upper bound on any wait for an event

// Waits for a condition that other threads make true.
class Gate {
 public:
  void update(const std::function<void()>& change) {
    {
      std::lock_guard lock(mutex_);
      change();
    }
    changed_.notify_all();
  }
  bool waitUntil(const std::function<bool()>& predicate) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, kWait, predicate);
  }
  std::mutex& mutex() { return mutex_; }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
};

// What the listener saw, recorded by the delegate and the handlers.
struct Observations {
  Gate gate;
  int accepted = 0;
  bool refuseAll = false;
  std::map<std::string, int> invalidations;  // by unique name
  std::map<std::string, int> interruptions;  // by unique name
  int totalInvalidations = 0;
  bool lostBus = false;
  std::vector<std::weak_ptr<Connection>> connections;
  std::vector<IncomingCall> held;  // calls answered later by the test
  struct Delivery {
    std::string member;
    BusValues arguments;
    bool noReply;
    std::shared_ptr<Connection> connection;
    std::shared_ptr<Connection> current;
  };
  std::vector<Delivery> deliveries;
};

class RecordingDelegate : public ListenerDelegate {
 public:
  explicit RecordingDelegate(Observations& seen) : seen_(seen) {}

  bool shouldAcceptNewConnection(Listener&, std::shared_ptr<Connection> connection) override {
    bool refuse = false;
    seen_.gate.update([&] {
      ++seen_.accepted;
      seen_.connections.push_back(connection);
      refuse = seen_.refuseAll;
    });
    if (refuse) return false;
    std::weak_ptr<Connection> weak = connection;
    std::string name = connection->uniqueName();
    connection->setInvalidationHandler([this, weak, name] {
      seen_.gate.update([&] {
        ++seen_.invalidations[name];
        ++seen_.totalInvalidations;
      });
    });
    connection->setInterruptionHandler(
        [this, name] { seen_.gate.update([&] { ++seen_.interruptions[name]; }); });
    connection->setValid(true);
    connection->resume();
    return true;
  }
  void listenerDidLoseBus(Listener&) override {
    seen_.gate.update([&] { seen_.lostBus = true; });
  }

 private:
  Observations& seen_;
};

InterfaceDescription testInterface(Observations& seen) {
  auto record = [&seen](const IncomingCall& call) {
    seen.gate.update([&] {
      seen.deliveries.push_back({call.member(), call.arguments(), call.noReplyExpected(),
                                 call.connection(), Connection::current()});
    });
  };
  InterfaceDescription interface {
    kInterface, {}, {
      {
        "Changed", "", {}
      }
    }
  };
  interface.methods.push_back(
      {"Echo", "s", {"text"}, "s", {"echo"}, false, [record](IncomingCall call) {
         record(call);
         BusValues arguments = call.arguments();
         call.reply(std::move(arguments));
       }});
  interface.methods.push_back(
      {"Token", "(siss)", {"token"}, "(siss)", {"token"}, false, [record](IncomingCall call) {
         record(call);
         BusValues arguments = call.arguments();
         call.reply(std::move(arguments));
       }});
  interface.methods.push_back(
      {"Later", "sb", {"url", "flag"}, "as", {"urls"}, false, [record](IncomingCall call) {
         record(call);
         // Answer from another thread.
         std::thread([call = std::move(call)]() mutable {
           call.reply({std::vector<std::string>{call.arguments()[0].asString(),
                                                call.arguments()[1].asBool() ? "yes" : "no"}});
         }).detach();
       }});
  interface.methods.push_back({"Drop", "", {}, "", {}, false, [record](IncomingCall call) {
                                 record(call);  // and drops the call unanswered
                               }});
  interface.methods.push_back({"Hold", "", {}, "", {}, false, [&seen, record](IncomingCall call) {
                                 record(call);
                                 seen.gate.update([&] { seen.held.push_back(std::move(call)); });
                               }});
  interface.methods.push_back({"Notify", "s", {"url"}, "", {}, true, [record](IncomingCall call) {
                                 record(call);
                                 call.reply();  // does nothing: no reply expected
                               }});
  return interface;
}

// A client peer: its own bus connection and a proxy to the listener.
struct Peer {
  explicit Peer(const std::string& address)
      : bus(sdbus::createSessionBusConnectionWithAddress(address)),
        proxy(sdbus::createProxy(*bus, kName, kPath)) {}
  std::string uniqueName() const { return bus->getUniqueName(); }
  std::string echo(const std::string& text) {
    std::string result;
    proxy->callMethod("Echo").onInterface(kInterface).withArguments(text).storeResultsTo(result);
    return result;
  }
  // Calls `member` and returns the error name it failed with ("" if none).
  std::string errorOf(const std::function<void(sdbus::MethodCall&)>& build,
                      const std::string& member, const std::string& interface = kInterface) {
    auto call = proxy->createMethodCall(interface, member);
    build(call);
    try {
      proxy->callMethod(call);
    } catch (const sdbus::Error& error) {
      lastErrorMessage = error.getMessage();
      return error.getName();
    }
    return {};
  }
  std::unique_ptr<sdbus::IConnection> bus;
  std::unique_ptr<sdbus::IProxy> proxy;
  std::string lastErrorMessage;
};

class BusListenerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    listener = std::make_unique<BusListener>(BusListenerOptions{bus.address(), kName, kPath},
                                             testInterface(seen));
    listener->setDelegate(&delegate);
    ASSERT_TRUE(listener->resume());
  }
  void TearDown() override {
    listener.reset();
    seen.held.clear();
  }

  testing::TestBus bus;
  Observations seen;
  RecordingDelegate delegate{seen};
  std::unique_ptr<BusListener> listener;
};

TEST_F(BusListenerTest, DeliversCallsWithTheirConnectionOnePerPeer) {
  Peer first(bus.address());
  Peer second(bus.address());
  EXPECT_EQ(first.echo("a"), "a");
  EXPECT_EQ(first.echo("b"), "b");
  EXPECT_EQ(second.echo("c"), "c");

  std::lock_guard lock(seen.gate.mutex());
  EXPECT_EQ(seen.accepted, 2);  // once per peer, not per call
  ASSERT_EQ(seen.deliveries.size(), 3u);
  EXPECT_EQ(seen.deliveries[0].connection->uniqueName(), first.uniqueName());
  EXPECT_EQ(seen.deliveries[0].connection, seen.deliveries[1].connection);
  EXPECT_EQ(seen.deliveries[2].connection->uniqueName(), second.uniqueName());
  EXPECT_NE(seen.deliveries[0].connection, seen.deliveries[2].connection);
  for (const auto& delivery : seen.deliveries) {
    EXPECT_EQ(delivery.current, delivery.connection);  // current() during delivery
    EXPECT_FALSE(delivery.noReply);
    EXPECT_TRUE(delivery.connection->isValid());
  }
  EXPECT_EQ(seen.deliveries[1].arguments, BusValues{"b"});
  EXPECT_EQ(Connection::current(), nullptr);  // outside any delivery
  EXPECT_EQ(listener->connectionCount(), 2u);
  EXPECT_EQ(listener->connection(first.uniqueName()), seen.deliveries[0].connection);
}

TEST_F(BusListenerTest, StructsAndAnswersFromOtherThreadsRoundTrip) {
  Peer peer(bus.address());
  sdbus::Struct<std::string, std::int32_t, std::string, std::string> token{"capture", 2,
                                                                           "file:///a.m4a", "id"};
  decltype(token) back;
  peer.proxy->callMethod("Token").onInterface(kInterface).withArguments(token).storeResultsTo(back);
  EXPECT_EQ(back, token);

  std::vector<std::string> urls;
  peer.proxy->callMethod("Later")
      .onInterface(kInterface)
      .withArguments(std::string("file:///x"), true)
      .storeResultsTo(urls);
  EXPECT_EQ(urls, (std::vector<std::string>{"file:///x", "yes"}));

  std::lock_guard lock(seen.gate.mutex());
  EXPECT_EQ(seen.deliveries[0].arguments[0],
            BusValue::structure({"capture", std::int32_t{2}, "file:///a.m4a", "id"}));
}

TEST_F(BusListenerTest, ErrorsAndDroppedCallsAndTheListenerKeepsServing) {
  Peer peer(bus.address());
  EXPECT_EQ(peer.errorOf([](sdbus::MethodCall&) {}, "Drop"), kBusErrorFailed);
  EXPECT_EQ(peer.lastErrorMessage, kNoReplyProducedMessage);
  EXPECT_EQ(peer.errorOf([](sdbus::MethodCall& call) { call << std::int32_t{5}; }, "Echo"),
            kBusErrorInvalidArgs);
  EXPECT_EQ(peer.errorOf([](sdbus::MethodCall&) {}, "Echo"), kBusErrorInvalidArgs);
  EXPECT_EQ(peer.errorOf([](sdbus::MethodCall&) {}, "NoSuchMethod"), kBusErrorUnknownMethod);
  EXPECT_EQ(peer.errorOf([](sdbus::MethodCall&) {}, "Echo", "org.quorvel.test.Other"),
            kBusErrorUnknownMethod);
  EXPECT_EQ(peer.echo("still here"), "still here");
  // Bus-handled interfaces answer without a connection being made.
  Peer pinger(bus.address());
  EXPECT_EQ(pinger.errorOf([](sdbus::MethodCall&) {}, "Ping", "org.freedesktop.DBus.Peer"), "");

  std::lock_guard lock(seen.gate.mutex());
  EXPECT_EQ(seen.accepted, 1);  // rejected calls never reach the delegate's table
  EXPECT_EQ(seen.deliveries.size(), 2u);
}

TEST_F(BusListenerTest, NoReplyCallsAreDeliveredAndNeverAnswered) {
  Peer peer(bus.address());
  auto call = peer.proxy->createMethodCall(kInterface, "Notify");
  call << std::string("file:///n");
  call.dontExpectReply();
  peer.proxy->callMethod(call);
  EXPECT_EQ(peer.echo("after"), "after");  // same peer: delivered in order

  std::lock_guard lock(seen.gate.mutex());
  ASSERT_EQ(seen.deliveries.size(), 2u);
  EXPECT_EQ(seen.deliveries[0].member, "Notify");
  EXPECT_TRUE(seen.deliveries[0].noReply);
}

TEST_F(BusListenerTest, RefusedPeersGetAccessDeniedAndAreAskedOnce) {
  seen.gate.update([&] { seen.refuseAll = true; });
  Peer peer(bus.address());
  EXPECT_EQ(peer.errorOf([](sdbus::MethodCall& call) { call << std::string("x"); }, "Echo"),
            kBusErrorAccessDenied);
  EXPECT_EQ(peer.errorOf([](sdbus::MethodCall& call) { call << std::string("x"); }, "Echo"),
            kBusErrorAccessDenied);
  std::lock_guard lock(seen.gate.mutex());
  EXPECT_EQ(seen.accepted, 1);
  EXPECT_TRUE(seen.deliveries.empty());
}

TEST_F(BusListenerTest, VanishingPeerInvalidatesOnceEvenMidCall) {
  std::string name;
  {
    Peer peer(bus.address());
    name = peer.uniqueName();
    EXPECT_EQ(peer.echo("x"), "x");
    // An asynchronous call the peer will never see answered.
    auto call = peer.proxy->createMethodCall(kInterface, "Hold");
    auto pending = peer.proxy->callMethod(call, [](sdbus::MethodReply&, const sdbus::Error*) {});
    ASSERT_TRUE(seen.gate.waitUntil([&] { return seen.held.size() == 1; }));
  }  // the peer disconnects here
  ASSERT_TRUE(seen.gate.waitUntil([&] { return seen.invalidations[name] == 1; }));

  IncomingCall late;
  {
    std::lock_guard lock(seen.gate.mutex());
    late = std::move(seen.held.front());
    seen.held.clear();
  }
  late.reply();  // to a peer that is gone: dropped silently
  Peer other(bus.address());
  EXPECT_EQ(other.echo("alive"), "alive");

  std::lock_guard lock(seen.gate.mutex());
  EXPECT_EQ(seen.invalidations[name], 1);
  EXPECT_TRUE(seen.interruptions.empty());
  EXPECT_EQ(listener->connection(name), nullptr);
  EXPECT_EQ(listener->connectionCount(), 1u);
}

TEST_F(BusListenerTest, LosingTheBusInvalidatesEveryConnection) {
  std::string first, second;
  {
    Peer a(bus.address());
    Peer b(bus.address());
    first = a.uniqueName();
    second = b.uniqueName();
    a.echo("1");
    b.echo("2");
    bus.kill();
  }
  ASSERT_TRUE(seen.gate.waitUntil([&] { return seen.lostBus; }));
  std::lock_guard lock(seen.gate.mutex());
  EXPECT_EQ(seen.invalidations[first], 1);
  EXPECT_EQ(seen.invalidations[second], 1);
  EXPECT_TRUE(seen.interruptions.empty());
  EXPECT_TRUE(listener->hasLostBus());
  EXPECT_EQ(listener->connectionCount(), 0u);
}

TEST_F(BusListenerTest, SignalsReachListeningPeers) {
  auto watcher = sdbus::createSessionBusConnectionWithAddress(bus.address());
  Gate gate;
  int received = 0;
  auto match = watcher->addMatch(
      std::string("type='signal',interface='") + kInterface + "',member='Changed'",
      [&](sdbus::Message&) { gate.update([&] { ++received; }); });
  watcher->enterEventLoopAsync();
  listener->emitSignal("Changed");
  EXPECT_TRUE(gate.waitUntil([&] { return received == 1; }));
  watcher->leaveEventLoop();
}

TEST_F(BusListenerTest, IntrospectionShowsTheInterface) {
  std::string command = "gdbus introspect --address '" + bus.address() + "' --dest " + kName +
                        " --object-path " + kPath + " 2>&1";
  std::string output;
  if (FILE* pipe = ::popen(command.c_str(), "r")) {
    char buffer[512];
    while (std::fgets(buffer, sizeof buffer, pipe)) output += buffer;
    ::pclose(pipe);
  }
  EXPECT_NE(output.find(kInterface), std::string::npos) << output;
  EXPECT_NE(output.find("Later(in  s url,"), std::string::npos) << output;
  EXPECT_NE(output.find("out as urls"), std::string::npos) << output;
  EXPECT_NE(output.find("signal"), std::string::npos) << output;
}

TEST_F(BusListenerTest, ReleasingTheNameAndStoppingKeepHeldAnswers) {
  Peer peer(bus.address());
  auto call = peer.proxy->createMethodCall(kInterface, "Hold");
  std::atomic<bool> answered{false};
  Gate gate;
  auto pending = peer.proxy->callMethod(call, [&](sdbus::MethodReply&, const sdbus::Error* error) {
    gate.update([&] { answered = (error == nullptr); });
  });
  peer.bus->enterEventLoopAsync();
  ASSERT_TRUE(seen.gate.waitUntil([&] { return seen.held.size() == 1; }));

  ASSERT_TRUE(listener->releaseName());
  listener->stop();
  IncomingCall held;
  {
    std::lock_guard lock(seen.gate.mutex());
    held = std::move(seen.held.front());
  }
  held.reply();  // after stop: still sent
  EXPECT_TRUE(gate.waitUntil([&] { return answered.load(); }));
  peer.bus->leaveEventLoop();

  Peer late(bus.address());
  EXPECT_EQ(late.errorOf([](sdbus::MethodCall& c) { c << std::string("x"); }, "Echo"),
            kBusErrorServiceUnknown);
}

TEST(BusListenerStartTest, FailsAsAValueWhenTheNameIsTaken) {
  testing::TestBus bus;
  Observations seen;
  BusListener first(BusListenerOptions{bus.address(), kName, kPath}, testInterface(seen));
  ASSERT_TRUE(first.resume());
  BusListener second(BusListenerOptions{bus.address(), kName, kPath}, testInterface(seen));
  EXPECT_FALSE(second.resume());
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
        std::vector<std::unique_ptr<Peer>> batch;
        for (int i = 0; i < kBatch; ++i) {
          batch.push_back(std::make_unique<Peer>(bus.address()));
          EXPECT_EQ(batch.back()->echo("p"), "p");
          std::lock_guard lock(namesMutex);
          names.insert(batch.back()->uniqueName());
        }
      }  // each batch disconnects here
    });
  }
  for (auto& thread : threads) thread.join();
  constexpr int kPeers = kThreads * kPeersPerThread;
  ASSERT_TRUE(seen.gate.waitUntil([&] { return seen.totalInvalidations == kPeers; }))
      << seen.totalInvalidations;
  // Let the bus thread finish the last invalidation before looking at
  // object lifetimes.
  std::promise<void> barrier;
  ASSERT_TRUE(listener->performOnBusThread([&] { barrier.set_value(); }));
  barrier.get_future().wait();

  std::lock_guard lock(seen.gate.mutex());
  EXPECT_EQ(names.size(), static_cast<std::size_t>(kPeers));
  EXPECT_EQ(seen.accepted, kPeers);
  EXPECT_EQ(seen.invalidations.size(), static_cast<std::size_t>(kPeers));
  for (const auto& [name, count] : seen.invalidations) {
    EXPECT_EQ(count, 1) << name;
    EXPECT_TRUE(names.count(name)) << name;
  }
  EXPECT_EQ(listener->connectionCount(), 0u);
  seen.deliveries.clear();  // they hold connections
  int alive = 0;
  for (const auto& weak : seen.connections) alive += !weak.expired();
  EXPECT_EQ(alive, 0);
}

}  // namespace
}  // namespace platform
