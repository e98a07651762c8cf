// The idle exit on a manual clock: the service on an in-process listener, the
// main queue driven by the test, the real root transaction.
#include "quorveld/IdleExit.h"

#include <gtest/gtest.h>

#include <chrono>
#include <latch>

#include "platform/MainQueue.h"
#include "platform/ProcessLifetime.h"
#include "platform/dbus/LocalListener.h"
#include "quorveld/RCSXPCTransaction.h"
#include "quorveld/RCSXPCTransactionController.h"

namespace quorvel {
namespace {

using namespace std::chrono_literals;

class IdleExitTest : public ::testing::Test {
 protected:
  void SetUp() override {
    // The process-wide lifetime and controller stay on the real main queue.
    (void)lifetime();
    (void)RCSXPCTransactionController::sharedInstance();
    platform::setMainQueueForTesting(&main_);
    service_ = SavedRecordingService::makeForTesting({.watchDebugSignal = false});
    service_->setListenerFactory([this](const std::string&, platform::InterfaceDescription i) {
      listener_ = std::make_shared<platform::LocalListener>(std::move(i));
      return listener_;
    });
    ASSERT_TRUE(service_->start());
    advance(2s);  // the first orphan pass runs...
    advance(2s);  // ...and the start-up keep-alives are over
    ASSERT_FALSE(lifetime().isInTransaction());
    idleExit_ = std::make_shared<IdleExit>(service_, lifetime(), main_);
  }
  void TearDown() override {
    advance(10s);
    advance(10s);
    idleExit_.reset();
    service_.reset();
    platform::setMainQueueForTesting(nullptr);
    EXPECT_FALSE(lifetime().isInTransaction());
  }
  static platform::ProcessLifetime& lifetime() { return platform::ProcessLifetime::instance(); }
  // One turn: what is due on the main queue, the service work it starts, and
  // what that work hands back.
  void turn() {
    main_.runUntilIdle();
    service_->serviceSerialQueue().sync([] {});
    main_.runUntilIdle();
  }
  void advance(std::chrono::nanoseconds by) {
    clock_.advance(by);
    turn();
    turn();
  }
  bool stopped() {
    bool stopped = false;
    main_.async([&] { stopped = idleExit_->hasStoppedMainQueue(); });
    main_.runUntilIdle();
    return stopped;
  }
  // The stop the sequence ends with makes the next run() return at once.
  void expectMainQueueStopped() { main_.run(); }

  platform::ManualClock clock_;
  platform::MainQueue main_{clock_, "test main"};
  std::shared_ptr<SavedRecordingService> service_;
  std::shared_ptr<platform::LocalListener> listener_;
  std::shared_ptr<IdleExit> idleExit_;
};

TEST_F(IdleExitTest, ACallReceivedBeforeTheNameWentIsAnsweredBeforeTheMainQueueStops) {
  // The service queue is still busy with earlier work when the call arrives,
  // and the call is read but not yet delivered when the idle exit starts.
  std::latch busy(1);
  service_->serviceSerialQueue().async([&busy] { busy.wait(); });
  auto reply = listener_->receive(":1.1", "FetchExportingCompositionAVURLs");

  main_.async([this] { idleExit_->start(); });
  main_.runUntilIdle();
  EXPECT_TRUE(listener_->isNameReleased());
  EXPECT_TRUE(listener_->isStopped());
  EXPECT_TRUE(lifetime().isInTransaction());  // the delivered call's work is queued
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
  expectMainQueueStopped();

  // The idle timer firing again changes nothing.
  main_.async([this] { idleExit_->start(); });
  main_.runUntilIdle();
}

TEST_F(IdleExitTest, AKeepAliveHeldAfterTheListenerStoppedHoldsTheMainQueue) {
  auto held = RCSXPCTransaction::initWithName("test keep-alive");
  held->beginTransaction();
  main_.async([this] { idleExit_->start(); });
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
  expectMainQueueStopped();
}

}  // namespace
}  // namespace quorvel
