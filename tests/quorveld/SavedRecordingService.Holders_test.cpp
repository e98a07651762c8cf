// Who holds a recording, through the service core: the listings with each
// holder's credentials and the states of a close, and the change signal
// after every kind of change, coalesced over a burst.
#include <gtest/gtest.h>

#include <ranges>

#include "tests/quorveld/ServiceFixture.h"

namespace quorvel {
namespace {

class HoldersTest : public SessionTest {
 public:
  // The AccessSessionsChanged signals for `recording` so far.
  long changes(const std::string& recording) {
    return std::ranges::count(
        listener_->emittedSignals(),
        std::pair<std::string, BusValues>{"AccessSessionsChanged", {BusValue(url(recording))}});
  }
  // A listing's entries.
  std::vector<BusValue> list(const char* member) {
    auto reply = call(":1.9", member, {});
    EXPECT_TRUE(reply->waitFor(10s));
    return reply->isError() ? std::vector<BusValue>{} : reply->values().at(0).elements();
  }
};

TEST_F(HoldersTest, ListingsNameEachHolderAsTheBusKnowsIt) {
  listener_->setPeerCredentials(":1.1", {.pid = 42, .uid = 1000, .command = "recorder"});
  token(prepare(":1.1", "PrepareToCapture", "A.m4a"));
  auto other = token(prepare(":1.2", "PrepareToPreview", "B.m4a"));  // credentials unknown
  auto sessions = list("ListAccessSessions");
  ASSERT_EQ(sessions.size(), 2u);
  const auto& capture = sessions[0].fields();
  ASSERT_EQ(capture.size(), 9u);  // no token identifier among them
  EXPECT_EQ(capture[0].asString(), "capture");
  EXPECT_EQ(capture[1].asInt32(), 2);
  EXPECT_EQ(capture[2].asString(), url("A.m4a"));
  EXPECT_EQ(capture[3].asString(), "open");
  EXPECT_GT(capture[4].asInt64(), 1'700'000'000'000'000);  // microseconds since the epoch
  EXPECT_EQ(std::vector(capture.begin() + 5, capture.end()),
            (std::vector<BusValue>{":1.1", std::uint32_t(42), std::uint32_t(1000), "recorder"}));
  EXPECT_EQ(std::vector(sessions[1].fields().begin() + 5, sessions[1].fields().end()),
            (std::vector<BusValue>{":1.2", std::uint32_t(0), std::uint32_t(0xFFFFFFFF), ""}));

  // A closing session is listed as such, and the request waiting behind it
  // with its own holder; both lists are asked for in the same turn.
  auto gate = holdServiceQueue();
  end(":1.2", other);
  auto waiting = prepare(":1.1", "PrepareToTrim", "B.m4a");
  auto duringClose = call(":1.9", "ListAccessSessions", {});
  auto deferred = call(":1.9", "ListDeferredRequests", {});
  gate->count_down();
  ASSERT_TRUE(duringClose->waitFor(10s) && deferred->waitFor(10s));
  EXPECT_EQ(duringClose->values().at(0).elements().at(1).fields().at(3).asString(), "closing");
  const auto requests = deferred->values().at(0).elements();
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].fields().size(), 8u);
  EXPECT_EQ(requests[0].fields()[0].asString(), "trimming");
  EXPECT_EQ(requests[0].fields()[2].asString(), url("B.m4a"));
  EXPECT_EQ(requests[0].fields()[7].asString(), "recorder");
  EXPECT_EQ(token(waiting).fields().at(0).asString(), "trimming");
  settle();
  EXPECT_TRUE(list("ListDeferredRequests").empty());
}

TEST_F(HoldersTest, EveryChangeIsSignalledAndABurstOncePerRecording) {
  auto preview = token(prepare(":1.1", "PrepareToPreview", "A.m4a"));
  settle();
  EXPECT_EQ(changes("A.m4a"), 1);
  end(":1.1", preview);
  settle();
  const long afterClose = changes("A.m4a");
  EXPECT_GE(afterClose, 2);  // began closing, closed: one or two signals

  // Five sessions of A and one of B in one turn: one signal each.
  auto gate = holdServiceQueue();
  std::vector<std::shared_ptr<platform::LocalReply>> burst;
  for (int i = 0; i < 5; ++i) burst.push_back(prepare(":1.2", "PrepareToPreview", "A.m4a"));
  burst.push_back(prepare(":1.2", "PrepareToCapture", "B.m4a"));
  gate->count_down();
  for (auto& reply : burst) token(reply);
  settle();
  EXPECT_EQ(changes("A.m4a"), afterClose + 1);
  EXPECT_EQ(changes("B.m4a"), 1);

  // A request deferred behind a close, and its client's death.
  auto other = token(prepare(":1.3", "PrepareToPreview", "C.m4a"));
  gate = holdServiceQueue();
  end(":1.3", other);
  auto deferred = prepare(":1.4", "PrepareToTrim", "B.m4a");
  gate->count_down();
  settle();
  ASSERT_FALSE(deferred->isAnswered());
  ASSERT_EQ(list("ListDeferredRequests").size(), 1u);
  EXPECT_EQ(changes("B.m4a"), 2);
  listener_->vanish(":1.4");
  settle();
  EXPECT_EQ(changes("B.m4a"), 3);
  EXPECT_TRUE(list("ListDeferredRequests").empty());
  listener_->vanish(":1.2");
  settle();
  EXPECT_GE(changes("B.m4a"), 4);
}

}  // namespace
}  // namespace quorvel
