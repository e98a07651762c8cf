// The Listener contract, run against both listeners: the service core is
// tested on LocalListener and runs on BusListener, so both must deliver,
// refuse, answer and end connections alike. What only the bus listener does
// is in BusListener_test.cpp.
#include <gtest/gtest.h>

#include <thread>

#include "tests/platform/dbus/ListenerHarness.h"

namespace platform::testing {
namespace {

const BusValue kToken = BusValue::structure({"capture", std::int32_t{2}, "file:///a.m4a", "id"});

template <typename Harness>
class ListenerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    harness.listener().setDelegate(&delegate);
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

  Observations seen;
  RecordingDelegate delegate{seen};
  Harness harness{testInterface(seen)};
};

using Listeners = ::testing::Types<LocalHarness, BusHarness>;
class ListenerNames {
 public:
  template <typename T>
  static std::string GetName(int) {
    return std::is_same_v<T, LocalHarness> ? "Local" : "Bus";
  }
};
TYPED_TEST_SUITE(ListenerTest, Listeners, ListenerNames);

TYPED_TEST(ListenerTest, DeliversCallsWithTheirConnectionOnePerPeer) {
  auto first = this->harness.newPeer();
  auto second = this->harness.newPeer();
  EXPECT_EQ(this->harness.call(first, "Echo", {"a"})().values, BusValues{"a"});
  EXPECT_EQ(this->harness.call(first, "Echo", {"b"})().values, BusValues{"b"});
  EXPECT_EQ(this->harness.call(second, "Echo", {"c"})().values, BusValues{"c"});

  std::lock_guard lock(this->seen.gate.mutex());
  EXPECT_EQ(this->seen.accepted, 2);  // once per peer, not per call
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
  EXPECT_EQ(this->harness.listener().connectionCount(), 2u);
  EXPECT_EQ(this->harness.listener().connection(first), deliveries[0].connection);
}

TYPED_TEST(ListenerTest, AnswersOnceFromAnyThreadAndDroppedCallsAnswerWithAnError) {
  auto peer = this->harness.newPeer();
  auto held = this->harness.call(peer, "Hold");
  auto dropped = this->harness.call(peer, "Hold");
  auto malformed = this->harness.call(peer, "Hold");
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

TYPED_TEST(ListenerTest, WrongCallsAreAnsweredWithoutReachingTheDelegate) {
  auto peer = this->harness.newPeer();
  EXPECT_EQ(this->harness.call(peer, "Echo", {std::int32_t{5}})().errorName, kBusErrorInvalidArgs);
  EXPECT_EQ(this->harness.call(peer, "Echo")().errorName, kBusErrorInvalidArgs);
  EXPECT_EQ(this->harness.call(peer, "NoSuchMethod")().errorName, kBusErrorUnknownMethod);
  EXPECT_EQ(this->harness.call(peer, "Echo", {"still here"})().values, BusValues{"still here"});

  std::lock_guard lock(this->seen.gate.mutex());
  EXPECT_EQ(this->seen.accepted, 1);
  EXPECT_EQ(this->seen.deliveries.size(), 1u);
}

TYPED_TEST(ListenerTest, NoReplyCallsAreDeliveredInOrderAndNeverAnswered) {
  auto peer = this->harness.newPeer();
  EXPECT_FALSE(this->harness.call(peer, "End", {kToken}, /*noReply=*/true)().answered);
  EXPECT_FALSE(this->harness.call(peer, "Nope", {}, /*noReply=*/true)().answered);
  EXPECT_EQ(this->harness.call(peer, "Echo", {"after"})().values, BusValues{"after"});

  std::lock_guard lock(this->seen.gate.mutex());
  ASSERT_EQ(this->seen.deliveries.size(), 2u);
  EXPECT_EQ(this->seen.deliveries[0].member, "End");
  EXPECT_EQ(this->seen.deliveries[0].arguments, BusValues{kToken});
  EXPECT_TRUE(this->seen.deliveries[0].noReply);
}

TYPED_TEST(ListenerTest, RefusedPeersAreAskedOnceAndDenied) {
  this->seen.gate.update([&] { this->seen.refuseAll = true; });
  auto peer = this->harness.newPeer();
  EXPECT_EQ(this->harness.call(peer, "Echo", {"x"})().errorName, kBusErrorAccessDenied);
  EXPECT_EQ(this->harness.call(peer, "Echo", {"x"})().errorName, kBusErrorAccessDenied);
  std::lock_guard lock(this->seen.gate.mutex());
  EXPECT_EQ(this->seen.accepted, 1);
  EXPECT_TRUE(this->seen.deliveries.empty());
}

TYPED_TEST(ListenerTest, CallsWaitForTheConnectionToResumeAndArriveInOrder) {
  this->seen.gate.update([&] { this->seen.resumeImmediately = false; });
  auto peer = this->harness.newPeer();
  auto a = this->harness.call(peer, "Echo", {"1"});
  auto b = this->harness.call(peer, "Echo", {"2"});
  ASSERT_TRUE(this->seen.gate.waitUntil([&] { return this->seen.accepted == 1; }));
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
  auto gone = this->harness.newPeer();
  auto second = this->harness.newPeer();
  auto third = this->harness.newPeer();
  for (const auto& peer : {gone, second, third}) this->harness.call(peer, "Echo", {"x"})();
  this->harness.call(gone, "Hold");  // never answered to the peer
  ASSERT_TRUE(this->waitForHeld(1));

  this->harness.vanish(gone);
  this->harness.vanish(gone);
  this->harness.vanish(":9.9");  // never seen: nothing
  ASSERT_TRUE(this->seen.gate.waitUntil([&] { return this->seen.invalidations[gone] == 1; }));
  this->takeHeld(0).reply({kToken});  // to a peer that is gone: dropped
  this->harness.settle();
  {
    std::lock_guard lock(this->seen.gate.mutex());
    EXPECT_EQ(this->seen.totalInvalidations, 1);
    EXPECT_TRUE(this->seen.offered[0]->hasEnded());
    // Nothing but the test's own records keeps the connection of a gone peer.
    this->seen.offered.erase(this->seen.offered.begin());
    std::erase_if(this->seen.deliveries,
                  [&](const auto& d) { return d.connection->uniqueName() == gone; });
    EXPECT_TRUE(this->seen.connections[0].expired());
  }
  EXPECT_EQ(this->harness.listener().connection(gone), nullptr);
  EXPECT_EQ(this->harness.listener().connectionCount(), 2u);

  this->harness.loseBus();
  ASSERT_TRUE(this->seen.gate.waitUntil([&] { return this->seen.lostBus; }));
  std::lock_guard lock(this->seen.gate.mutex());
  // For good: a connection never comes back after the bus is lost.
  EXPECT_EQ(this->seen.invalidations[second], 1);
  EXPECT_EQ(this->seen.invalidations[third], 1);
  EXPECT_TRUE(this->seen.interruptions.empty());
  EXPECT_EQ(this->seen.totalInvalidations, 3);
  EXPECT_EQ(this->harness.listener().connectionCount(), 0u);
}

TYPED_TEST(ListenerTest, ReleasingTheNameAndStoppingKeepHeldAnswers) {
  auto peer = this->harness.newPeer();
  auto held = this->harness.call(peer, "Hold");
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

}  // namespace
}  // namespace platform::testing
