// LocalListener and Connection without a bus: the same delivery rules the
// service core relies on, plus the connection's own state.
#include <gtest/gtest.h>

#include <thread>

#include "platform/dbus/LocalListener.h"

namespace platform {
namespace {

using namespace std::chrono_literals;

class AcceptingDelegate : public ListenerDelegate {
 public:
  bool shouldAcceptNewConnection(Listener&, std::shared_ptr<Connection> connection) override {
    ++asked;
    seen.push_back(connection);
    if (!accept) return false;
    connection->setValid(true);
    std::weak_ptr<Connection> weak = connection;
    connection->setInvalidationHandler([this, weak] {
      ++invalidated;
      endedConnection = weak.lock();
    });
    connection->setInterruptionHandler([this] { ++interrupted; });
    if (resumeImmediately) connection->resume();
    return true;
  }
  bool accept = true;
  bool resumeImmediately = true;
  int asked = 0;
  int invalidated = 0;
  int interrupted = 0;
  std::shared_ptr<Connection> endedConnection;
  std::vector<std::shared_ptr<Connection>> seen;
};

struct Recorded {
  std::vector<std::shared_ptr<Connection>> current;
  std::vector<IncomingCall> held;
};

InterfaceDescription interface(Recorded& recorded) {
  InterfaceDescription description{"org.quorvel.test.Local1", {}, {{"Changed", "", {}}}};
  description.methods.push_back({"Echo", "s", {}, "s", {}, false, [&recorded](IncomingCall call) {
                                   recorded.current.push_back(Connection::current());
                                   BusValues arguments = call.arguments();
                                   call.reply(std::move(arguments));
                                 }});
  description.methods.push_back(
      {"Hold", "", {}, "(siss)", {}, false, [&recorded](IncomingCall call) {
         recorded.current.push_back(Connection::current());
         recorded.held.push_back(std::move(call));
       }});
  description.methods.push_back({"End", "(siss)", {}, "", {}, true, [&recorded](IncomingCall call) {
                                   recorded.current.push_back(Connection::current());
                                   call.reply();
                                 }});
  return description;
}

class LocalListenerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    listener.setDelegate(&delegate);
    ASSERT_TRUE(listener.resume());
  }
  Recorded recorded;
  AcceptingDelegate delegate;
  LocalListener listener{interface(recorded)};
};

TEST_F(LocalListenerTest, DeliversWithCurrentConnectionAndAcceptsOncePerPeer) {
  auto first = listener.deliver(":1.1", "Echo", {"a"});
  auto second = listener.deliver(":1.1", "Echo", {"b"});
  auto other = listener.deliver(":1.2", "Echo", {"c"});
  ASSERT_TRUE(first->isAnswered());
  EXPECT_EQ(first->values(), BusValues{"a"});
  EXPECT_EQ(other->values(), BusValues{"c"});
  EXPECT_EQ(delegate.asked, 2);
  ASSERT_EQ(recorded.current.size(), 3u);
  EXPECT_EQ(recorded.current[0], recorded.current[1]);
  EXPECT_EQ(recorded.current[0]->uniqueName(), ":1.1");
  EXPECT_EQ(recorded.current[2]->uniqueName(), ":1.2");
  EXPECT_EQ(Connection::current(), nullptr);
  EXPECT_EQ(listener.connectionCount(), 2u);
}

TEST_F(LocalListenerTest, RepliesOnceFromAnyThreadAndDroppedCallsAnswerWithAnError) {
  auto held = listener.deliver(":1.1", "Hold");
  auto dropped = listener.deliver(":1.1", "Hold");
  ASSERT_EQ(recorded.held.size(), 2u);
  EXPECT_FALSE(held->isAnswered());

  BusValue token = BusValue::structure({"capture", std::int32_t{2}, "file:///a", "id"});
  std::thread([call = std::move(recorded.held[0]), token]() mutable {
    call.reply({token});
    call.reply({token});  // ignored
    call.replyError(kBusErrorFailed, "ignored too");
  }).join();
  ASSERT_TRUE(held->waitFor(5s));
  EXPECT_EQ(held->answerCount(), 1);
  EXPECT_EQ(held->values(), BusValues{token});

  recorded.held.clear();  // drops the second call unanswered
  EXPECT_EQ(dropped->answerCount(), 1);
  EXPECT_EQ(dropped->errorName(), kBusErrorFailed);
  EXPECT_EQ(dropped->errorMessage(), kNoReplyProducedMessage);
}

TEST_F(LocalListenerTest, MalformedRepliesBecomeErrors) {
  auto reply = listener.deliver(":1.1", "Hold");
  recorded.held[0].reply({"not a token"});
  EXPECT_TRUE(reply->isError());
  EXPECT_EQ(reply->errorName(), kBusErrorFailed);
}

TEST_F(LocalListenerTest, NoReplyCallsAreNeverAnswered) {
  BusValue token = BusValue::structure({"", std::int32_t{0}, "", ""});
  auto reply = listener.deliver(":1.1", "End", {token}, /*noReplyExpected=*/true);
  EXPECT_EQ(recorded.current.size(), 1u);
  EXPECT_EQ(reply->answerCount(), 0);
  // Even a wrong call without reply stays silent.
  EXPECT_EQ(listener.deliver(":1.1", "Nope", {}, true)->answerCount(), 0);
}

TEST_F(LocalListenerTest, RefusedPeersAreAskedOnceAndDenied) {
  delegate.accept = false;
  auto first = listener.deliver(":1.5", "Echo", {"x"});
  auto second = listener.deliver(":1.5", "Echo", {"x"});
  EXPECT_EQ(first->errorName(), kBusErrorAccessDenied);
  EXPECT_EQ(second->errorName(), kBusErrorAccessDenied);
  EXPECT_EQ(delegate.asked, 1);
  EXPECT_TRUE(recorded.current.empty());
}

TEST_F(LocalListenerTest, CallsWaitForResumeAndArriveInOrder) {
  delegate.resumeImmediately = false;
  auto a = listener.deliver(":1.1", "Echo", {"1"});
  auto b = listener.deliver(":1.1", "Echo", {"2"});
  EXPECT_FALSE(a->isAnswered());
  ASSERT_EQ(delegate.seen.size(), 1u);
  EXPECT_FALSE(delegate.seen[0]->isResumed());
  std::thread([connection = delegate.seen[0]] { connection->resume(); }).join();
  EXPECT_EQ(a->values(), BusValues{"1"});
  EXPECT_EQ(b->values(), BusValues{"2"});
  ASSERT_EQ(recorded.current.size(), 2u);
  EXPECT_EQ(recorded.current[0], delegate.seen[0]);  // set on the resuming thread too
}

TEST_F(LocalListenerTest, VanishInvalidatesOnceAndLosingTheBusInvalidatesTheRest) {
  listener.deliver(":1.1", "Echo", {"x"});
  listener.deliver(":1.2", "Echo", {"x"});
  listener.deliver(":1.3", "Echo", {"x"});
  listener.vanish(":1.1");
  listener.vanish(":1.1");
  listener.vanish(":9.9");  // never seen: nothing
  EXPECT_EQ(delegate.invalidated, 1);
  ASSERT_NE(delegate.endedConnection, nullptr);  // the handler could still reach it
  EXPECT_EQ(delegate.endedConnection->uniqueName(), ":1.1");
  EXPECT_TRUE(delegate.endedConnection->hasEnded());
  EXPECT_EQ(listener.connectionCount(), 2u);

  listener.loseBus();
  EXPECT_EQ(delegate.invalidated, 3);  // for good: a lost bus never gives them back
  EXPECT_EQ(delegate.interrupted, 0);
  EXPECT_EQ(listener.connectionCount(), 0u);

  // A peer that comes back is a new connection.
  listener.deliver(":1.2", "Echo", {"x"});
  EXPECT_EQ(delegate.asked, 4);
}

TEST_F(LocalListenerTest, ConnectionsDoNotOutliveTheirPeer) {
  listener.deliver(":1.1", "Echo", {"x"});
  std::weak_ptr<Connection> weak = delegate.seen[0];
  delegate.seen.clear();
  recorded.current.clear();
  listener.vanish(":1.1");
  delegate.endedConnection.reset();
  EXPECT_TRUE(weak.expired());
}

TEST_F(LocalListenerTest, SignalsNameAndStopAreRecorded) {
  listener.emitSignal("Changed");
  ASSERT_EQ(listener.emittedSignals().size(), 1u);
  EXPECT_EQ(listener.emittedSignals()[0].first, "Changed");
  ASSERT_TRUE(listener.releaseName());
  EXPECT_TRUE(listener.isNameReleased());
  EXPECT_EQ(listener.deliver(":1.1", "Echo", {"x"})->errorName(), kBusErrorServiceUnknown);
  listener.stop();
  EXPECT_TRUE(listener.isStopped());
}

TEST(LocalListenerResumeTest, RejectsAnInvalidInterface) {
  InterfaceDescription bad{"org.quorvel.test.Bad1", {}, {}};
  bad.methods.push_back({"Map", "a{sv}", {}, "", {}, false, [](IncomingCall) {}});
  LocalListener listener(bad);
  EXPECT_FALSE(listener.resume());
  InterfaceDescription noHandler{"org.quorvel.test.Bad1", {}, {}};
  noHandler.methods.push_back({"M", "", {}, "", {}, false, nullptr});
  EXPECT_FALSE(LocalListener(noHandler).resume());
}

TEST(ConnectionTest, ValidityUserInfoAndCurrent) {
  auto connection = Connection::createForListener(":1.7");
  EXPECT_FALSE(connection->isValid());  // never through a listener
  EXPECT_EQ(connection->description(), "<connection :1.7>");

  connection->setUserInfo("key", std::any());  // removal without a dictionary
  EXPECT_FALSE(connection->hasUserInfoDictionary());
  EXPECT_FALSE(connection->userInfo("key").has_value());

  connection->setUserInfo("key", std::any(42));
  EXPECT_TRUE(connection->hasUserInfoDictionary());
  EXPECT_EQ(std::any_cast<int>(connection->userInfo("key")), 42);
  connection->setUserInfo("key", std::any());
  EXPECT_FALSE(connection->userInfo("key").has_value());
  EXPECT_TRUE(connection->hasUserInfoDictionary());  // kept, now empty

  EXPECT_EQ(Connection::current(), nullptr);
}

}  // namespace
}  // namespace platform
