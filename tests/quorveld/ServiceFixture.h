// The service core's test fixture: a service of its own behind an
// in-process listener, the main queue on a manual clock, and the log
// captured. Tests deliver calls as peers and move the clock instead of
// sleeping.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Log.h"
#include "platform/MainQueue.h"
#include "platform/ProcessLifetime.h"
#include "platform/dbus/LocalListener.h"
#include "quorveld/RCSXPCTransactionController.h"
#include "quorveld/SavedRecordingService.h"

namespace quorvel {

using namespace std::chrono_literals;
using platform::BusValue;
using platform::BusValues;

struct LogLine {
  int level;
  std::string text;
};

class ServiceTest : public ::testing::Test {
 protected:
  void SetUp() override {
    // The process-wide lifetime and controller stay on the real main queue;
    // only what the service schedules from now on goes to the test's queue.
    (void)platform::ProcessLifetime::instance();
    (void)RCSXPCTransactionController::sharedInstance();
    ASSERT_FALSE(controller().isInTransaction());
    platform::setMainQueueForTesting(&main_);
    platform::setConsoleLogging(false);
    platform::setLogThreshold(platform::kLogLevelDebug);
    platform::setLogSinkForTesting([this](int level, std::string_view text) {
      std::lock_guard lock(mutex_);
      lines_.push_back({level, std::string(text)});
    });
    service_ = SavedRecordingService::makeForTesting({.watchDebugSignal = false});
    service_->setListenerFactory(
        [this](const std::string&, platform::InterfaceDescription interface) {
          auto listener = std::make_shared<platform::LocalListener>(std::move(interface));
          listener_ = listener;
          return listener;
        });
  }

  void TearDown() override {
    // Let every queued block and every delayed end run, then drop the service:
    // a close takes several hops through the service queue, each of which may
    // start a delayed end.
    settle();
    listener_.reset();
    service_.reset();
    platform::setMainQueueForTesting(nullptr);
    platform::setLogSinkForTesting(nullptr);
    platform::setLogThreshold(platform::kLogLevelNotice);
    EXPECT_FALSE(controller().isInTransaction());
  }

  static RCSXPCTransactionController& controller() {
    return RCSXPCTransactionController::sharedInstance();
  }
  // Runs the service queue and the main queue, moving the clock a second at
  // a time, until no keep-alive is held (or a minute has passed).
  void settle() {
    for (int second = 0; second < 60; ++second) {
      advance(1s);
      if (!controller().isInTransaction()) break;
    }
    advance(1s);
  }
  void drainServiceQueue() {
    service_->serviceSerialQueue().sync([] {});
  }
  // Moves the clock and runs what is due on the main queue, including the
  // service-queue work that the due timers start and the export operations
  // that work queues, until the three queues have nothing left to hand on.
  void advance(std::chrono::nanoseconds by) {
    clock_.advance(by);
    // Each round moves every chain of work one hop further; no chain in the
    // service has more hops than this.
    for (int round = 0; round < 12; ++round) {
      main_.runUntilIdle();
      drainServiceQueue();
      service_->assetExportController().waitUntilAllOperationsAreFinishedForTesting();
    }
  }
  std::vector<LogLine> lines() {
    std::lock_guard lock(mutex_);
    return lines_;
  }
  std::vector<std::string> linesContaining(std::string_view needle) {
    std::vector<std::string> found;
    for (auto& line : lines()) {
      if (line.text.find(needle) != std::string::npos) found.push_back(line.text);
    }
    return found;
  }
  std::shared_ptr<platform::LocalReply> call(const std::string& peer, const std::string& member,
                                             BusValues arguments = {}, bool noReply = false) {
    return listener_->deliver(peer, member, std::move(arguments), noReply);
  }

  platform::ManualClock clock_;
  platform::MainQueue main_{clock_, "test main"};
  std::shared_ptr<SavedRecordingService> service_;
  std::shared_ptr<platform::LocalListener> listener_;
  std::mutex mutex_;
  std::vector<LogLine> lines_;
};

}  // namespace quorvel
