// The Listener contract, run against both listeners: the service core is
// tested on LocalListener and runs on BusListener, so both must deliver,
// refuse, answer and end connections alike. Then what only the bus listener
// does: the routing and introspection it gets from the bus, signals that
// reach other peers, and many short-lived peers at once.
//
// A Recorder is the delegate and the methods' handlers and records what the
// listener delivers; a harness per listener makes peers, sends their calls
// and ends them: LocalHarness drives a LocalListener in process, BusHarness
// a BusListener on a private dbus-daemon, each peer its own bus connection.
#include <gtest/gtest.h>
#include <sdbus-c++/sdbus-c++.h>

#include <map>
#include <memory>
#include <numeric>
#include <ranges>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/dbus/BusListener.h"
#include "platform/dbus/SdBusCodec.h"
#include "tests/support/Gate.h"
#include "tests/support/LocalListener.h"
#include "tests/support/TestBus.h"

namespace platform::testing {
namespace {

constexpr const char* kName = "org.quorvel.test.Listener";
constexpr const char* kPath = "/org/quorvel/test/Listener";
constexpr const char* kInterface = "org.quorvel.test.Listener1";
const BusValue kToken = BusValue::structure({"capture", std::int32_t{2}, "file:///a.m4a", "id"});

// What the listener did; every field is guarded by the gate.
struct Recorder : ListenerDelegate {
  Gate gate;
  bool refuseAll = false;
  bool resumeImmediately = true;
  std::vector<std::shared_ptr<Connection>> offered;    // cleared by tests of lifetimes
  std::vector<std::weak_ptr<Connection>> connections;  // every one the delegate was asked about
  std::map<std::string, int> invalidations;            // by unique name
  int interruptions = 0;
  bool lostBus = false;
  std::vector<IncomingCall> held;  // calls the test answers later
  struct Delivery {
    std::string member;
    BusValues arguments;
    bool noReply;
    std::shared_ptr<Connection> connection;
    std::shared_ptr<Connection> current;
  };
  std::vector<Delivery> deliveries;

  bool shouldAcceptNewConnection(Listener&, std::shared_ptr<Connection> connection) override {
    bool refuse = false, resume = false;
    gate.update([&] {
      offered.push_back(connection);
      connections.push_back(connection);
      refuse = refuseAll;
      resume = resumeImmediately;
    });
    if (refuse) return false;
    std::string name = connection->uniqueName();
    connection->setInvalidationHandler(
        [this, name] { gate.update([&] { ++invalidations[name]; }); });
    connection->setInterruptionHandler([this] { gate.update([&] { ++interruptions; }); });
    connection->setValid(true);
    if (resume) connection->resume();
    return true;
  }
  void listenerDidLoseBus(Listener&) override {
    gate.update([&] { lostBus = true; });
  }
  int totalInvalidations() {
    auto counts = invalidations | std::views::values;
    return std::accumulate(counts.begin(), counts.end(), 0);
  }
  // Echo answers at once; Hold keeps the call for the test to answer; End
  // takes a token and sends no reply.
  InterfaceDescription interface() {
    auto record = [this](const IncomingCall& call) {
      gate.update([&] {
        deliveries.push_back({call.member(), call.arguments(), call.noReplyExpected(),
                              call.connection(), Connection::current()});
      });
    };
    InterfaceDescription description{kInterface, {}, {{"Changed", "", {}}}};
    description.methods.push_back(
        {"Echo", "s", {"text"}, "s", {"echo"}, false, [record](IncomingCall call) {
           record(call);
           call.reply(BusValues(call.arguments()));
         }});
    description.methods.push_back(
        {"Hold", "", {}, "(siss)", {"token"}, false, [this, record](IncomingCall call) {
           record(call);
           gate.update([&] { held.push_back(std::move(call)); });
         }});
    description.methods.push_back(
        {"End", "(siss)", {"token"}, "", {}, true, [record](IncomingCall call) {
           record(call);
           call.reply();  // does nothing: no reply expected
         }});
    return description;
  }
};

// The answer a peer got.
struct Answer {
  bool answered = false;
  int count = 0;          // answers the call produced
  std::string errorName;  // "" for a reply
  std::string errorMessage;
  BusValues values;
};
// Waits (at most kWait) for a call's answer. A call without reply returns
// at once, unanswered.
using PendingAnswer = std::function<Answer()>;

class LocalHarness {
 public:
  explicit LocalHarness(InterfaceDescription interface) : listener_(std::move(interface)) {}
  LocalListener& listener() { return listener_; }
  std::string newPeer() { return ":1." + std::to_string(++peers_); }
  PendingAnswer call(const std::string& peer, const std::string& member, BusValues arguments = {},
                     bool noReply = false) {
    auto reply = listener_.deliver(peer, member, std::move(arguments), noReply);
    return [reply, noReply] {
      if (!noReply) reply->waitFor(kWait);
      return Answer{reply->isAnswered(), reply->answerCount(), reply->errorName(),
                    reply->errorMessage(), reply->values()};
    };
  }
  void vanish(const std::string& peer) { listener_.vanish(peer); }
  void loseBus() { listener_.loseBus(); }
  void settle() {}  // deliveries are over when deliver() returns

 private:
  LocalListener listener_;
  int peers_ = 0;
};

class BusHarness {
 public:
  explicit BusHarness(InterfaceDescription interface)
      : listener_(BusListenerOptions{bus_.address(), kName, kPath}, std::move(interface)) {}
  BusListener& listener() { return listener_; }
  TestBus& bus() { return bus_; }
  std::string newPeer() {
    auto peer = std::make_unique<Peer>(bus_.address());
    std::string name = peer->bus->getUniqueName();
    peers_[name] = std::move(peer);
    return name;
  }
  PendingAnswer call(const std::string& peer, const std::string& member, BusValues arguments = {},
                     bool noReply = false) {
    auto& proxy = *peers_.at(peer)->proxy;
    auto message = proxy.createMethodCall(kInterface, member);
    sdbuscodec::appendValues(message, arguments);
    if (noReply) {
      message.dontExpectReply();
      proxy.callMethod(message);
      return [] { return Answer{}; };
    }
    const MethodDescription* method = listener_.method(member);
    struct Pending {
      Latch done;
      Answer answer{true, 1, {}, {}, {}};
    };
    auto pending = std::make_shared<Pending>();
    proxy.callMethod(message, [pending, signature = method ? method->outputSignature : ""](
                                  sdbus::MethodReply& reply, const sdbus::Error* error) {
      if (error) {
        pending->answer.errorName = error->getName();
        pending->answer.errorMessage = error->getMessage();
      } else if (auto values = sdbuscodec::readValues(reply, signature)) {
        pending->answer.values = *values;
      } else {
        pending->answer.errorName = "undecodable reply";
      }
      pending->done.open();
    });
    return [pending] { return pending->done.wait() ? pending->answer : Answer{}; };
  }
  // Returns once the bus has passed on what the peer sent before: a peer's
  // messages go out in order, and the bus answers this one after routing them.
  void flush(const std::string& peer) {
    auto daemon =
        sdbus::createProxy(*peers_.at(peer)->bus, "org.freedesktop.DBus", "/org/freedesktop/DBus");
    Latch answered;
    daemon->callMethodAsync("GetId")
        .onInterface("org.freedesktop.DBus")
        .uponReplyInvoke([&](const sdbus::Error*, std::string) { answered.open(); });
    answered.wait();
  }
  // The peer disconnects from the bus.
  void vanish(const std::string& peer) { peers_.erase(peer); }
  // The peers stop servicing their connections first: their threads would
  // throw once the bus is gone.
  void loseBus() {
    for (auto& [name, peer] : peers_) peer->bus->leaveEventLoop();
    bus_.kill();
  }
  // Returns once the listener has finished what it was delivering.
  void settle() {
    Latch reached;
    if (listener_.performOnBusThread([&] { reached.open(); })) reached.wait();
  }

 private:
  // A client: its own bus connection, serviced by its own thread, and a
  // proxy to the listener.
  struct Peer {
    explicit Peer(const std::string& address)
        : bus(sdbus::createSessionBusConnectionWithAddress(address)),
          proxy(sdbus::createProxy(*bus, kName, kPath)) {
      bus->enterEventLoopAsync();
    }
    ~Peer() { bus->leaveEventLoop(); }
    std::unique_ptr<sdbus::IConnection> bus;
    std::unique_ptr<sdbus::IProxy> proxy;
  };

  TestBus bus_;
  BusListener listener_;
  std::map<std::string, std::unique_ptr<Peer>> peers_;
};

template <typename Harness>
class ListenerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    harness.listener().setDelegate(&seen);
    ASSERT_TRUE(harness.listener().resume());
  }
  void TearDown() override {
    harness.listener().stop();
    std::lock_guard lock(seen.gate.mutex());
    seen.held.clear();
  }
  // Waits until the listener holds `count` calls.
  bool waitForHeld(std::size_t count) {
    return seen.gate.waitUntil([&] { return seen.held.size() == count; });
  }
  IncomingCall takeHeld(std::size_t index) {
    std::lock_guard lock(seen.gate.mutex());
    return std::move(seen.held.at(index));
  }

  Recorder seen;
  Harness harness{seen.interface()};
  const std::string peer = harness.newPeer();  // calls nothing until a test has it call
};

using Listeners = ::testing::Types<LocalHarness, BusHarness>;
struct ListenerNames {
  template <typename T>
  static std::string GetName(int) {
    return std::is_same_v<T, LocalHarness> ? "Local" : "Bus";
  }
};
TYPED_TEST_SUITE(ListenerTest, Listeners, ListenerNames);

// A refused peer's calls are denied, and the delegate is not asked again.
TYPED_TEST(ListenerTest, DeliversCallsWithTheirConnectionOnePerPeerOrDeniesThem) {
  auto& h = this->harness;
  const std::string& first = this->peer;
  auto second = h.newPeer();
  EXPECT_EQ(h.call(first, "Echo", {"a"})().values, BusValues{"a"});
  EXPECT_EQ(h.call(first, "Echo", {"b"})().values, BusValues{"b"});
  EXPECT_EQ(h.call(second, "Echo", {"c"})().values, BusValues{"c"});
  this->seen.gate.update([&] { this->seen.refuseAll = true; });
  auto refused = h.newPeer();
  EXPECT_EQ(h.call(refused, "Echo", {"x"})().errorName, kBusErrorAccessDenied);
  EXPECT_EQ(h.call(refused, "Echo", {"x"})().errorName, kBusErrorAccessDenied);

  std::lock_guard lock(this->seen.gate.mutex());
  EXPECT_EQ(this->seen.connections.size(), 3u);  // once per peer, not per call
  auto& deliveries = this->seen.deliveries;
  ASSERT_EQ(deliveries.size(), 3u);
  EXPECT_EQ(deliveries[0].connection->uniqueName(), first);
  EXPECT_EQ(deliveries[0].connection, deliveries[1].connection);
  EXPECT_EQ(deliveries[2].connection->uniqueName(), second);
  for (const auto& delivery : deliveries) {
    EXPECT_EQ(delivery.current, delivery.connection);  // current() during delivery
    EXPECT_FALSE(delivery.noReply);
  }
  EXPECT_EQ(Connection::current(), nullptr);  // outside any delivery
  EXPECT_EQ(h.listener().connectionCount(), 3u);
  EXPECT_EQ(h.listener().connection(first), deliveries[0].connection);
}

TYPED_TEST(ListenerTest, AnswersOnceFromAnyThreadAndDroppedCallsAnswerWithAnError) {
  auto held = this->harness.call(this->peer, "Hold");
  auto dropped = this->harness.call(this->peer, "Hold");
  auto malformed = this->harness.call(this->peer, "Hold");
  ASSERT_TRUE(this->waitForHeld(3));

  std::thread([call = this->takeHeld(0)]() mutable {
    call.reply({kToken});
    call.reply({kToken});  // ignored
    call.replyError(kBusErrorFailed, "ignored too");
  }).join();
  Answer answer = held();
  EXPECT_EQ(answer.count, 1);
  EXPECT_EQ(answer.errorName, "");
  EXPECT_EQ(answer.values, BusValues{kToken});

  this->takeHeld(1);  // dropped unanswered
  answer = dropped();
  EXPECT_EQ(answer.errorName, kBusErrorFailed);
  EXPECT_EQ(answer.errorMessage, kNoReplyProducedMessage);

  this->takeHeld(2).reply({"not a token"});
  EXPECT_EQ(malformed().errorName, kBusErrorFailed);
}

// Wrong calls are answered without reaching the delegate; calls without a
// reply are delivered in order and never answered.
TYPED_TEST(ListenerTest, WrongCallsAreAnsweredAndNoReplyCallsDeliveredInOrder) {
  auto call = [this](auto... arguments) { return this->harness.call(this->peer, arguments...)(); };
  EXPECT_EQ(call("Echo", BusValues{std::int32_t{5}}).errorName, kBusErrorInvalidArgs);
  EXPECT_EQ(call("Echo").errorName, kBusErrorInvalidArgs);
  EXPECT_EQ(call("NoSuchMethod").errorName, kBusErrorUnknownMethod);
  EXPECT_FALSE(call("End", BusValues{kToken}, /*noReply=*/true).answered);
  EXPECT_FALSE(call("Nope", BusValues{}, /*noReply=*/true).answered);
  EXPECT_EQ(call("Echo", BusValues{"after"}).values, BusValues{"after"});

  std::lock_guard lock(this->seen.gate.mutex());
  EXPECT_EQ(this->seen.connections.size(), 1u);
  ASSERT_EQ(this->seen.deliveries.size(), 2u);
  EXPECT_EQ(this->seen.deliveries[0].member, "End");
  EXPECT_EQ(this->seen.deliveries[0].arguments, BusValues{kToken});
  EXPECT_TRUE(this->seen.deliveries[0].noReply);
}

TYPED_TEST(ListenerTest, CallsWaitForTheConnectionToResumeAndArriveInOrder) {
  this->seen.gate.update([&] { this->seen.resumeImmediately = false; });
  auto a = this->harness.call(this->peer, "Echo", {"1"});
  auto b = this->harness.call(this->peer, "Echo", {"2"});
  ASSERT_TRUE(this->seen.gate.waitUntil([&] { return this->seen.connections.size() == 1; }));
  std::shared_ptr<Connection> connection;
  {
    std::lock_guard lock(this->seen.gate.mutex());
    EXPECT_TRUE(this->seen.deliveries.empty());
    connection = this->seen.offered[0];
  }
  EXPECT_FALSE(connection->isResumed());
  std::thread([connection] { connection->resume(); }).join();
  EXPECT_EQ(a().values, BusValues{"1"});
  EXPECT_EQ(b().values, BusValues{"2"});

  std::lock_guard lock(this->seen.gate.mutex());
  ASSERT_EQ(this->seen.deliveries.size(), 2u);
  EXPECT_EQ(this->seen.deliveries[0].current, connection);  // set on the resuming thread too
}

TYPED_TEST(ListenerTest, VanishingPeersInvalidateOnceAndLosingTheBusInvalidatesTheRest) {
  auto& h = this->harness;
  auto& seen = this->seen;
  const std::string& gone = this->peer;
  auto second = h.newPeer();
  auto third = h.newPeer();
  for (const auto& peer : {gone, second, third}) h.call(peer, "Echo", {"x"})();
  h.call(gone, "Hold");  // never answered to the peer
  ASSERT_TRUE(this->waitForHeld(1));

  h.vanish(gone);
  h.vanish(gone);
  h.vanish(":9.9");  // never seen: nothing
  ASSERT_TRUE(seen.gate.waitUntil([&] { return seen.invalidations[gone] == 1; }));
  this->takeHeld(0).reply({kToken});  // to a peer that is gone: dropped
  h.settle();
  {
    std::lock_guard lock(seen.gate.mutex());
    EXPECT_EQ(seen.totalInvalidations(), 1);
    EXPECT_TRUE(seen.offered[0]->hasEnded());
    // Nothing but the test's own records keeps the connection of a gone peer.
    seen.offered.erase(seen.offered.begin());
    std::erase_if(seen.deliveries,
                  [&](const auto& d) { return d.connection->uniqueName() == gone; });
    EXPECT_TRUE(seen.connections[0].expired());
  }
  EXPECT_EQ(h.listener().connection(gone), nullptr);
  EXPECT_EQ(h.listener().connectionCount(), 2u);

  h.loseBus();
  ASSERT_TRUE(seen.gate.waitUntil([&] { return seen.lostBus; }));
  std::lock_guard lock(seen.gate.mutex());
  // For good: a connection never comes back after the bus is lost.
  EXPECT_EQ(seen.invalidations, (std::map<std::string, int>{{gone, 1}, {second, 1}, {third, 1}}));
  EXPECT_EQ(seen.interruptions, 0);
  EXPECT_EQ(h.listener().connectionCount(), 0u);
}

TYPED_TEST(ListenerTest, ReleasingTheNameAndStoppingKeepHeldAnswers) {
  auto held = this->harness.call(this->peer, "Hold");
  ASSERT_TRUE(this->waitForHeld(1));
  ASSERT_TRUE(this->harness.listener().releaseName());
  this->harness.listener().stop();
  this->takeHeld(0).reply({kToken});  // after stop: still sent
  EXPECT_EQ(held().values, BusValues{kToken});

  auto late = this->harness.newPeer();
  EXPECT_EQ(this->harness.call(late, "Echo", {"x"})().errorName, kBusErrorServiceUnknown);
}

TYPED_TEST(ListenerTest, RejectsAnInvalidInterface) {
  InterfaceDescription unsupported{"org.quorvel.test.Bad1", {}, {}};
  unsupported.methods.push_back({"Map", "a{sv}", {}, "", {}, false, [](IncomingCall) {}});
  EXPECT_FALSE(TypeParam(unsupported).listener().resume());
  InterfaceDescription noHandler{"org.quorvel.test.Bad1", {}, {}};
  noHandler.methods.push_back({"M", "", {}, "", {}, false, nullptr});
  EXPECT_FALSE(TypeParam(noHandler).listener().resume());
}

TEST(ConnectionTest, UserInfoKeepsItsDictionaryOnceCreated) {
  auto connection = Connection::createForListener(":1.7");
  EXPECT_FALSE(connection->isValid());                        // never through a listener
  EXPECT_EQ(connection->description(), "<connection :1.7>");  // as the logs show it
  connection->setUserInfo("key", std::any());                 // removal without a dictionary
  EXPECT_FALSE(connection->hasUserInfoDictionary());
  connection->setUserInfo("key", std::any(42));
  EXPECT_EQ(std::any_cast<int>(connection->userInfo("key")), 42);
  connection->setUserInfo("key", std::any());
  EXPECT_FALSE(connection->userInfo("key").has_value());
  EXPECT_TRUE(connection->hasUserInfoDictionary());  // kept, now empty
}

using BusListenerTest = ListenerTest<BusHarness>;

// Peer and Introspectable are answered by the bus library without a
// connection; another interface of the object is unknown.
TEST_F(BusListenerTest, TheBusAnswersOtherInterfacesAndIntrospectionAndSignalsReachPeers) {
  auto client = sdbus::createSessionBusConnectionWithAddress(harness.bus().address());
  auto proxy = sdbus::createProxy(*client, kName, kPath);
  auto errorOf = [&](const std::string& interface, const std::string& member) {
    try {
      auto call = proxy->createMethodCall(interface, member);
      proxy->callMethod(call);
    } catch (const sdbus::Error& error) {
      return error.getName();
    }
    return std::string();
  };
  EXPECT_EQ(errorOf("org.quorvel.test.Other", "Echo"), kBusErrorUnknownMethod);
  EXPECT_EQ(errorOf("org.freedesktop.DBus.Peer", "Ping"), "");
  std::string xml;
  proxy->callMethod("Introspect")
      .onInterface("org.freedesktop.DBus.Introspectable")
      .storeResultsTo(xml);
  for (const char* part :
       {"<interface name=\"org.quorvel.test.Listener1\">",
        "<arg type=\"s\" name=\"text\" direction=\"in\"/>",
        "<arg type=\"(siss)\" name=\"token\" direction=\"out\"/>",
        "<annotation name=\"org.freedesktop.DBus.Method.NoReply\" value=\"true\"/>",
        "<signal name=\"Changed\">"}) {
    EXPECT_NE(xml.find(part), std::string::npos) << part << "\n" << xml;
  }
  {
    std::lock_guard lock(seen.gate.mutex());
    EXPECT_TRUE(seen.deliveries.empty());
  }

  Gate gate;
  int received = 0;
  auto match =
      client->addMatch(std::string("type='signal',interface='") + kInterface + "',member='Changed'",
                       [&](sdbus::Message&) { gate.update([&] { ++received; }); });
  client->enterEventLoopAsync();
  harness.listener().emitSignal("Changed");
  EXPECT_TRUE(gate.waitUntil([&] { return received == 1; }));
  client->leaveEventLoop();
}

// An orderly stop first delivers the calls that have reached the listener:
// the bus thread is held while a call arrives and the stop is requested.
TEST_F(BusListenerTest, StopDeliversWhatHasArrived) {
  Latch entered;
  Latch release;
  ASSERT_TRUE(harness.listener().performOnBusThread([&] {
    entered.open();
    release.wait();
  }));
  ASSERT_TRUE(entered.wait());
  auto peer = harness.newPeer();
  auto answer = harness.call(peer, "Echo", {"x"});
  harness.flush(peer);
  std::thread stopper([&] { harness.listener().stop(); });
  while (harness.listener().performOnBusThread([] {})) std::this_thread::yield();
  release.open();
  stopper.join();
  EXPECT_EQ(answer().values, BusValues{"x"});
}

// A name already taken is the integration test's second daemon.
TEST(BusListenerStartTest, FailsAsAValueWhenTheBusIsUnreachable) {
  Recorder seen;
  BusListener unreachable(BusListenerOptions{"unix:path=/nonexistent/socket", kName, kPath},
                          seen.interface());
  EXPECT_FALSE(unreachable.resume());
}

// Many short-lived peers, from several threads at once: each connects,
// calls, and disconnects. Every connection is reported gone exactly once
// and no connection object outlives its peer.
TEST_F(BusListenerTest, StressManyPeersComeAndGo) {
  constexpr int kThreads = 4;
  constexpr int kPeersPerThread = 250;
  constexpr int kBatch = 25;
  constexpr int kPeers = kThreads * kPeersPerThread;
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
  ASSERT_TRUE(seen.gate.waitUntil([&] { return seen.totalInvalidations() == kPeers; }));
  harness.settle();  // the last invalidation has finished on the bus thread

  std::lock_guard lock(seen.gate.mutex());
  EXPECT_EQ(names.size(), static_cast<std::size_t>(kPeers));
  EXPECT_EQ(seen.connections.size(), static_cast<std::size_t>(kPeers));
  for (const auto& [name, count] : seen.invalidations) {
    EXPECT_EQ(count, 1) << name;
    EXPECT_TRUE(names.count(name)) << name;
  }
  EXPECT_EQ(seen.invalidations.size(), static_cast<std::size_t>(kPeers));
  EXPECT_EQ(harness.listener().connectionCount(), 0u);
  seen.deliveries.clear();  // they hold connections
  seen.offered.clear();
  for (const auto& weak : seen.connections) EXPECT_TRUE(weak.expired());
}

}  // namespace
}  // namespace platform::testing
