// The idle exit on a manual clock: the service on an in-process listener, the
// main queue driven by the test, the real root transaction.
#include "quorveld/IdleExit.h"

#include <gtest/gtest.h>

#include "quorveld/RCSXPCTransaction.h"
#include "tests/quorveld/ServiceFixture.h"

namespace quorvel {
namespace {

class IdleExitTest : public ServiceTest {
 public:
  void SetUp() override {
    ServiceTest::SetUp();
    platform::setLogThreshold(platform::kLogLevelNotice);  // the daemon's default
    ASSERT_TRUE(service_->start());
    settle();  // the first orphan pass and the start-up keep-alives are over
    ASSERT_FALSE(platform::ProcessLifetime::instance().isInTransaction());
    idleExit_ = std::make_shared<IdleExit>(service_, platform::ProcessLifetime::instance(), main_);
  }
  void TearDown() override {
    idleExit_.reset();
    ServiceTest::TearDown();
  }
  // What is due on the main queue, the service work it starts, and what that
  // work hands back.
  void turn() {
    main_.runUntilIdle();
    drainServiceQueue();
    main_.runUntilIdle();
  }
  void startIdleExit() {
    main_.async([this] { idleExit_->start(); });
    main_.runUntilIdle();
  }
  bool stopped() {
    bool stopped = false;
    main_.async([&] { stopped = idleExit_->hasStoppedMainQueue(); });
    main_.runUntilIdle();
    return stopped;
  }

  std::shared_ptr<IdleExit> idleExit_;
};

TEST_F(IdleExitTest, ACallReceivedBeforeTheNameWentIsAnsweredBeforeTheMainQueueStops) {
  // The service queue is still busy with earlier work when the call arrives,
  // and the call is read but not yet delivered when the idle exit starts.
  std::latch busy(1);
  service_->serviceSerialQueue().async([&busy] { busy.wait(); });
  auto reply = listener_->receive(":1.1", "FetchExportingCompositionAVURLs");
  startIdleExit();
  EXPECT_TRUE(listener_->isNameReleased());
  EXPECT_TRUE(listener_->isStopped());
  EXPECT_TRUE(controller().isInTransaction());  // the delivered call's work is queued
  EXPECT_FALSE(reply->isAnswered());
  EXPECT_FALSE(stopped());

  busy.count_down();
  turn();
  EXPECT_TRUE(reply->isAnswered());
  EXPECT_FALSE(reply->isError()) << reply->errorName();
  // The request's keep-alive lingers a second after its work: still running.
  EXPECT_FALSE(stopped());
  advance(999ms);
  EXPECT_FALSE(stopped());
  advance(1ms);
  EXPECT_TRUE(stopped());
  EXPECT_EQ(reply->answerCount(), 1);
  main_.run();      // returns at once: the sequence ended with a stop
  startIdleExit();  // the idle timer firing again changes nothing
}

TEST_F(IdleExitTest, AKeepAliveHeldAfterTheListenerStoppedHoldsTheMainQueue) {
  auto held = RCSXPCTransaction::initWithName("test keep-alive");
  held->beginTransaction();
  startIdleExit();
  advance(1h);
  EXPECT_TRUE(listener_->isStopped());
  EXPECT_FALSE(stopped());

  // Its end is followed by another drain: work queued meanwhile runs first.
  std::latch busy(1);
  service_->serviceSerialQueue().async([&busy] { busy.wait(); });
  held->endTransaction();
  main_.runUntilIdle();
  EXPECT_FALSE(stopped());
  busy.count_down();
  turn();
  EXPECT_TRUE(stopped());
  main_.run();  // returns at once
}

}  // namespace
}  // namespace quorvel
