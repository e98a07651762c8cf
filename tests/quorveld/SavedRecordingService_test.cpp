// The service core without a bus: start-up and its keep-alive timeline, and
// client connections. Driven through the in-process listener and a manual
// clock; the requests' entry checks and the connections' ends are in
// ServiceLog_test.
#include <gtest/gtest.h>

#include <latch>

#include "tests/quorveld/ServiceFixture.h"

namespace quorvel {
namespace {

// A listener whose bus cannot be reached.
class UnreachableListener final : public platform::Listener {
 public:
  explicit UnreachableListener(platform::InterfaceDescription i) : Listener(std::move(i)) {}
  platform::Status resume() override {
    return platform::fail(platform::Error("test", 1, "no bus"));
  }
  void emitSignal(const std::string&, const BusValues&) override {}
  platform::Status releaseName() override { return {}; }
  void stop() override {}
};

TEST_F(ServiceTest, AFailedStartTriesANewListenerAndASecondStartKeepsIt) {
  int made = 0;
  service_->setListenerFactory(
      [&](const std::string& name,
          platform::InterfaceDescription i) -> std::shared_ptr<platform::Listener> {
        if (made++ == 0) return std::make_shared<UnreachableListener>(std::move(i));
        return makeListener(name, std::move(i));
      });
  EXPECT_FALSE(service_->start());
  EXPECT_FALSE(service_->listener());
  ASSERT_TRUE(service_->start());
  ASSERT_TRUE(service_->start());
  EXPECT_EQ(made, 2);
  EXPECT_EQ(service_->listener(), listener_);
  EXPECT_FALSE(call(":1.1", "FetchExportingCompositionAVURLs")->isError());
}

// The start-up keep-alive ends at 2 s, and the first orphan-handling pass's
// dispatch one second after the pass, which runs at 1 s unless the service
// queue holds it back (GetParam()) until 2 s.
class RootTimelineTest : public ServiceTest, public ::testing::WithParamInterface<bool> {};
INSTANTIATE_TEST_SUITE_P(SlowFirstPass, RootTimelineTest, ::testing::Bool());

TEST_P(RootTimelineTest, TheRootIsHeldUntilTwoSecondsOrOneSecondAfterTheFirstPass) {
  std::latch passMayRun(GetParam() ? 1 : 0);
  service_->serviceSerialQueue().async([&passMayRun] { passMayRun.wait(); });
  ASSERT_TRUE(service_->start());
  clock_.advance(1s);
  main_.runUntilIdle();  // the pass is queued
  if (GetParam()) {
    clock_.advance(1s);
    main_.runUntilIdle();
    EXPECT_TRUE(
        controller().isInTransaction());  // the start-up keep-alive ended, the pass has not run
    passMayRun.count_down();
  }
  drainServiceQueue();
  advance(999ms);
  EXPECT_TRUE(controller().isInTransaction());
  advance(1ms);
  EXPECT_FALSE(controller().isInTransaction());
}

}  // namespace
}  // namespace quorvel
