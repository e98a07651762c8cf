// The service core's test fixture: a service of its own behind an
// in-process listener, the main queue on a manual clock, and the log
// captured. Tests deliver calls as peers and move the clock instead of
// sleeping.
#pragma once

#include <gtest/gtest.h>

#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>
#include <latch>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "platform/Log.h"
#include "platform/MainQueue.h"
#include "platform/ProcessLifetime.h"
#include "platform/dbus/LocalListener.h"
#include "quorveld/RCSXPCTransactionController.h"
#include "quorveld/SavedRecordingService.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/Gate.h"

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
      logged_.update([&] { lines_.push_back({level, std::string(text)}); });
    });
    service_ = SavedRecordingService::makeForTesting({.watchDebugSignal = false});
    service_->setListenerFactory(
        [this](const std::string& name, platform::InterfaceDescription interface) {
          return makeListener(name, std::move(interface));
        });
  }

  // The listener start() gets: by default an in-process one, which the tests
  // drive as peers with call().
  virtual std::shared_ptr<platform::Listener> makeListener(
      const std::string& /*serviceName*/, platform::InterfaceDescription interface) {
    listener_ = std::make_shared<platform::LocalListener>(std::move(interface));
    return listener_;
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
  // Lets the fragment cleanups under way finish, then runs what the service
  // queue holds.
  void drainServiceQueue() {
    service_->waitUntilFragmentCleanupsAreFinishedForTesting();
    service_->serviceSerialQueue().sync([] {});
  }
  // Moves the clock and runs what is due on the main queue, including the
  // service-queue work that the due timers start and the export operations
  // and fragment cleanups that work queues, until the three queues have nothing left to hand on.
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
    std::lock_guard lock(logged_.mutex());
    return lines_;
  }
  // Waits (at most platform::testing::kWait) until `count` lines contain
  // `needle`.
  bool waitForLines(std::string_view needle, std::size_t count = 1) {
    return logged_.waitUntil([&] {
      return std::size_t(std::ranges::count_if(lines_, [&](const LogLine& line) {
               return line.text.find(needle) != std::string::npos;
             })) >= count;
    });
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
  platform::testing::Gate logged_;
  std::vector<LogLine> lines_;  // guarded by logged_
};

// A started service on a recordings directory of its own, with helpers to
// prepare and end sessions as peers and to read the service's state.
class SessionTest : public ServiceTest {
 protected:
  void SetUp() override {
    directory_ = std::filesystem::temp_directory_path() /
                 ("quorvel-sessions-" + std::to_string(::getpid()) + "-" +
                  ::testing::UnitTest::GetInstance()->current_test_info()->name());
    std::filesystem::remove_all(directory_);
    RCSetSavedRecordingsDirectory(directory_.string());
    ASSERT_EQ(RCSavedRecordingsDirectory(), directory_.string());  // made on first use
    ServiceTest::SetUp();
    ASSERT_TRUE(service_->start());
  }
  void TearDown() override {
    ServiceTest::TearDown();
    RCSetSavedRecordingsDirectory(std::nullopt);
    std::filesystem::remove_all(directory_);
  }

  std::string url(const std::string& name) const {
    return platform::URL::fileURLWithPath((directory_ / name).string()).absoluteString();
  }
  std::shared_ptr<platform::LocalReply> prepare(const std::string& peer, const std::string& member,
                                                const std::string& recording) {
    return call(peer, member, {url(recording)});
  }
  // The token a granted prepare answered.
  BusValue token(const std::shared_ptr<platform::LocalReply>& reply) {
    EXPECT_TRUE(reply->waitFor(10s));
    EXPECT_FALSE(reply->isError()) << reply->errorName();
    return reply->isError() ? BusValue::structure({"", 0, "", ""}) : reply->values().at(0);
  }
  void end(const std::string& peer, const BusValue& token) {
    call(peer, "EndAccessSession", {token}, /*noReply=*/true);
  }
  // Holds the service queue until the returned latch is counted down, so
  // the calls delivered meanwhile queue up in a known order.
  std::shared_ptr<std::latch> holdServiceQueue() {
    auto gate = std::make_shared<std::latch>(1);
    service_->serviceSerialQueue().async([gate] { gate->wait(); });
    return gate;
  }
  template <class T>
  T onServiceQueue(std::function<T()> read) {
    T value{};
    service_->serviceSerialQueue().sync([&] { value = read(); });
    return value;
  }
  // A recording in the database whose fragments are tones of the given
  // lengths, not yet composed. Returns its editor (nullopt on failure, with
  // the test failed).
  std::optional<RCCompositionEditor> makeRecording(const std::string& title,
                                                   std::initializer_list<double> fragmentSeconds) {
    auto model = RCSavedRecordingsModel::modelWithDirectory(directory_.string());
    EXPECT_TRUE(model) << model.error();
    if (!model) return std::nullopt;
    auto editor = RCCompositionEditor::createCompositionForNewRecording(**model, title);
    EXPECT_TRUE(editor) << editor.error();
    if (!editor) return std::nullopt;
    std::string tone = (directory_ / "tone.wav").string();
    for (double seconds : fragmentSeconds) {
      EXPECT_TRUE(testing::writeTone(tone, seconds, "wav"));
      auto fragment = editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(tone));
      EXPECT_TRUE(fragment) << fragment.error();
      if (!fragment) return std::nullopt;
    }
    std::filesystem::remove(tone);
    return std::move(*editor);
  }
  std::size_t openSessions() {
    return onServiceQueue<std::size_t>(
        [&] { return service_->assetSessionController().activeSessions().size(); });
  }
  std::size_t deferredRequests() {
    return onServiceQueue<std::size_t>(
        [&] { return service_->deferredAccessRequestCountForTesting(); });
  }
  // Nothing open, closing or waiting, and no keep-alive held.
  void expectNothingLeft() {
    EXPECT_EQ(openSessions(), 0u);
    EXPECT_EQ(
        onServiceQueue<std::size_t>([&] { return service_->closingSessionCountForTesting(); }), 0u);
    EXPECT_EQ(deferredRequests(), 0u);
    EXPECT_FALSE(controller().isInTransaction());
  }

  std::filesystem::path directory_;
};

}  // namespace quorvel
