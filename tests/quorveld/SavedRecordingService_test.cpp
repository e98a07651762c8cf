// The service core without a bus: start-up and its keep-alive timeline,
// client connections, the requests' entry checks, launch events and the
// debug dump. Driven through the in-process listener and a manual clock.
#include <gtest/gtest.h>

#include <chrono>
#include <latch>
#include <mutex>
#include <string>
#include <vector>

#include "Quorvel/service/RCSSavedRecordingAccessToken.h"
#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"
#include "platform/Log.h"
#include "platform/MainQueue.h"
#include "platform/NotificationCenter.h"
#include "platform/ProcessLifetime.h"
#include "platform/dbus/LocalListener.h"
#include "quorveld/RCSAdditions.h"
#include "quorveld/RCSXPCTransactionController.h"
#include "quorveld/SavedRecordingService.h"
#include "tests/quorveld/ServiceFixture.h"

namespace quorvel {
namespace {

// A listener whose bus cannot be reached.
class UnreachableListener final : public platform::Listener {
 public:
  explicit UnreachableListener(platform::InterfaceDescription interface)
      : Listener(std::move(interface)) {}
  platform::Status resume() override {
    return platform::fail(platform::Error("test", 1, "bus unreachable"));
  }
  void emitSignal(const std::string&, const BusValues&) override {}
  platform::Status releaseName() override { return {}; }
  void stop() override {}
};

TEST_F(ServiceTest, AFailedStartTriesANewListenerAndASecondStartKeepsIt) {
  int made = 0;
  service_->setListenerFactory(
      [&](const std::string&,
          platform::InterfaceDescription interface) -> std::shared_ptr<platform::Listener> {
        if (made++ == 0) return std::make_shared<UnreachableListener>(std::move(interface));
        listener_ = std::make_shared<platform::LocalListener>(std::move(interface));
        return listener_;
      });
  EXPECT_FALSE(service_->start());
  EXPECT_FALSE(service_->listener());
  ASSERT_TRUE(service_->start());
  const auto starting = linesContaining("Starting service 'org.quorvel.SavedRecordingService'");
  advance(1s);
  const auto passes = linesContaining("checking for orphaned recordings");
  ASSERT_TRUE(service_->start());  // a second start keeps its listener but runs a pass
  EXPECT_EQ(made, 2);
  EXPECT_EQ(service_->listener(), listener_);
  EXPECT_FALSE(call(":1.1", "FetchExportingCompositionAVURLs")->isError());
  EXPECT_EQ(linesContaining("Starting service 'org.quorvel.SavedRecordingService'"), starting);
  advance(1s);
  EXPECT_EQ(linesContaining("checking for orphaned recordings").size(), passes.size() + 1);
}

TEST_F(ServiceTest, WithoutClientsTheRootIsHeldUntilTwoSeconds) {
  EXPECT_FALSE(service_->listener());  // no listener, no connection before start
  ASSERT_TRUE(service_->start());
  EXPECT_TRUE(controller().isInTransaction());
  ASSERT_TRUE(listener_);

  advance(1s);  // the first orphan-handling pass runs
  EXPECT_EQ(linesContaining("checking for orphaned recordings").size(), 1u);
  EXPECT_TRUE(controller().isInTransaction());
  advance(999ms);
  EXPECT_TRUE(controller().isInTransaction());
  advance(1ms);  // the start-up keep-alive and the pass's dispatch both end at 2 s
  EXPECT_FALSE(controller().isInTransaction());
}

TEST_F(ServiceTest, ASlowFirstPassHoldsTheRootUntilOneSecondAfterItEnds) {
  std::latch passMayRun(1);
  service_->serviceSerialQueue().async([&passMayRun] { passMayRun.wait(); });
  ASSERT_TRUE(service_->start());
  clock_.advance(1s);
  main_.runUntilIdle();  // the pass is queued behind the blocker
  clock_.advance(1s);
  main_.runUntilIdle();                         // the start-up keep-alive ends at 2 s...
  EXPECT_TRUE(controller().isInTransaction());  // ...but the pass has not run
  passMayRun.count_down();
  drainServiceQueue();  // the pass ends at 2 s: its dispatch ends at 3 s
  advance(999ms);
  EXPECT_TRUE(controller().isInTransaction());
  advance(1ms);
  EXPECT_FALSE(controller().isInTransaction());
}

TEST_F(ServiceTest, ConnectionsAreAcceptedOnceAndEndedByVanishingOrLosingTheBus) {
  ASSERT_TRUE(service_->start());
  EXPECT_FALSE(call(":1.1", "FetchExportingCompositionAVURLs")->isError());
  EXPECT_FALSE(call(":1.1", "FetchExportingCompositionAVURLs")->isError());
  auto connection = listener_->connection(":1.1");
  ASSERT_TRUE(connection);
  EXPECT_TRUE(rcs_isValid(*connection));
  EXPECT_EQ(linesContaining("Listener accepted new connection <connection :1.1>").size(), 1u);

  listener_->vanish(":1.1");
  drainServiceQueue();
  EXPECT_FALSE(rcs_isValid(*connection));
  auto invalidated = linesContaining("Connection invalidated: <connection :1.1>");
  ASSERT_EQ(invalidated.size(), 1u);

  call(":1.2", "DisableOrphanHandling");
  auto second = listener_->connection(":1.2");
  listener_->loseBus();
  drainServiceQueue();
  EXPECT_FALSE(rcs_isValid(*second));
  EXPECT_EQ(linesContaining("Connection invalidated: <connection :1.2>").size(), 1u);
  EXPECT_TRUE(linesContaining("Connection interrupted").empty());
  for (const auto& line : lines()) {
    if (line.text.find("Connection in") != std::string::npos) {
      EXPECT_EQ(line.level, 4);
    }
  }
}

TEST_F(ServiceTest, PrepareRequestsCheckTheReplyBeforeTheURL) {
  ASSERT_TRUE(service_->start());
  const std::string missing =
      "[SavedRecordingService] ERROR: received invalid message on connection <connection "
      ":1.1>.  {} parameter is required for invocations of "
      "-prepareToCaptureToCompositionAVURL:accessRequestHandler:";

  for (const char* notAURL : {"", "relative/x.m4a", "http://example.com/x.m4a"}) {
    auto reply = call(":1.1", "PrepareToCapture", {notAURL});
    ASSERT_TRUE(reply->isAnswered());
    EXPECT_EQ(reply->errorName(), RCSDBusErrorMissingCompositionAVURL);
  }
  EXPECT_EQ(linesContaining(fmt::format(fmt::runtime(missing), "compositionAVURL")).size(), 3u);

  // Neither URL nor reply: only the reply is reported, and nothing answers.
  auto dropped = call(":1.1", "PrepareToCapture", {""}, /*noReply=*/true);
  EXPECT_FALSE(dropped->isAnswered());
  EXPECT_EQ(linesContaining(fmt::format(fmt::runtime(missing), "accessRequestHandler")).size(), 1u);
  EXPECT_EQ(linesContaining(fmt::format(fmt::runtime(missing), "compositionAVURL")).size(), 3u);
}

TEST_F(ServiceTest, EveryPrepareKindLogsItsArrivalAndAnswers) {
  ASSERT_TRUE(service_->start());
  struct Kind {
    const char* member;
    BusValues arguments;
    const char* name;
    const char* word;
    int accessType;
  };
  for (const Kind& kind : std::vector<Kind>{
           {"PrepareToPreview", {"file:///recordings/New%20Recording.m4a"}, "New", "preview", 1},
           {"PrepareToExport",
            {"file:///recordings/New%20Recording.m4a", false},
            "New",
            "export",
            1},
           {"PrepareToTrim", {"/recordings/Trim Recording.m4a"}, "Trim", "trimming", 2},
           {"PrepareToCapture",
            {"file:///recordings/Capture%20Recording.m4a"},
            "Capture",
            "capture",
            2},
       }) {
    auto reply = call(":1.3", kind.member, kind.arguments);
    advance(0s);  // an export answers once its finalization has
    ASSERT_TRUE(reply->waitFor(10s));
    ASSERT_FALSE(reply->isError()) << reply->errorName();
    EXPECT_EQ(reply->values().at(0).fields().at(1).asInt32(), kind.accessType);
    EXPECT_EQ(linesContaining(fmt::format("[SavedRecordingService] Received request to prepare "
                                          "'{} Recording.m4a' for {}...",
                                          kind.name, kind.word))
                  .size(),
              1u);
  }
  listener_->vanish(":1.3");  // its sessions close with it
}

TEST_F(ServiceTest, OtherRequestsFollowTheirParameterRules) {
  ASSERT_TRUE(service_->start());
  auto noToken = BusValue::structure({"", 0, "", ""});
  call(":1.4", "EndAccessSession", {noToken}, /*noReply=*/true);
  EXPECT_EQ(linesContaining("[SavedRecordingService] Ending access session: (null).").size(), 1u);
  EXPECT_EQ(linesContaining("accessToken parameter is required for invocations of "
                            "-endAccessSessionWithToken:")
                .size(),
            1u);

  // Fetch without a reply is ignored altogether: nothing but the acceptance.
  auto before = lines().size();
  call(":1.4", "FetchExportingCompositionAVURLs", {}, /*noReply=*/true);
  drainServiceQueue();
  EXPECT_EQ(lines().size(), before);
}

TEST_F(ServiceTest, LaunchEventsArePostedInProcessOnTheMainQueue) {
  ASSERT_TRUE(service_->start());
  std::vector<std::string> posted;
  auto& center = platform::NotificationCenter::defaultCenter();
  auto token = center.addObserver("com.example.RecordingsChanged",
                                  [&posted](const platform::Notification& notification) {
                                    posted.push_back(notification.name);
                                  });
  listener_->deliverSignal("org.quorvel.Events1", "Event", {"com.example.RecordingsChanged"});
  EXPECT_TRUE(posted.empty());  // not on the delivery thread
  main_.runUntilIdle();
  EXPECT_EQ(posted, (std::vector<std::string>{"com.example.RecordingsChanged"}));
  center.removeObserver(token);
}

}  // namespace
}  // namespace quorvel
