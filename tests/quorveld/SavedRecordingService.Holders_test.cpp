// Who holds a recording, through the service core: the listings with each
// holder's credentials and the states of a close, and the change signal
// after opens and closes, coalesced over a burst (a deferral's and a dead
// client's signals are checked with them in the sessions test).
#include <gtest/gtest.h>

#include <ranges>

#include "tests/quorveld/ServiceFixture.h"

namespace quorvel {
namespace {

class HoldersTest : public SessionTest {
 public:
  // A listing's entries.
  std::vector<BusValue> list(const char* member) {
    auto reply = call(":1.9", member, {});
    EXPECT_TRUE(reply->waitFor(10s));
    return reply->isError() ? std::vector<BusValue>{} : reply->values().at(0).elements();
  }
  // An entry's fields, its time (microseconds since the epoch) checked and
  // then zeroed.
  static std::vector<BusValue> fields(const BusValue& entry, std::size_t timeAt) {
    auto fields = entry.fields();
    EXPECT_GT(fields.at(timeAt).asInt64(), 1'700'000'000'000'000);
    fields[timeAt] = std::int64_t{0};
    return fields;
  }
};

TEST_F(HoldersTest, ListingsNameEachHolderAsTheBusKnowsIt) {
  listener_->setPeerCredentials(":1.1", {.pid = 42, .uid = 1000, .command = "recorder"});
  token(prepare(":1.1", "PrepareToCapture", "A.m4a"));
  auto other = token(prepare(":1.2", "PrepareToPreview", "B.m4a"));  // credentials unknown
  auto sessions = list("ListAccessSessions");
  ASSERT_EQ(sessions.size(), 2u);
  // No token identifier among them.
  EXPECT_EQ(fields(sessions[0], 4),
            (std::vector<BusValue>{"capture", 2, url("A.m4a"), "open", std::int64_t{0}, ":1.1", 42u,
                                   1000u, "recorder"}));
  EXPECT_EQ(fields(sessions[1], 4),
            (std::vector<BusValue>{"preview", 1, url("B.m4a"), "open", std::int64_t{0}, ":1.2", 0u,
                                   0xFFFFFFFFu, ""}));

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
  EXPECT_EQ(fields(requests[0], 3),
            (std::vector<BusValue>{"trimming", 2, url("B.m4a"), std::int64_t{0}, ":1.1", 42u, 1000u,
                                   "recorder"}));
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
}

}  // namespace
}  // namespace quorvel
