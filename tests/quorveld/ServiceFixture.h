// The service core's test fixture: a service of its own behind an
// in-process listener, the main queue on a manual clock, and the log
// captured. Tests deliver calls as peers and move the clock instead of
// sleeping. Its members are public, so scenario tables can drive it.
#pragma once

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <latch>
#include <ranges>
#include <stdexcept>
#include <string>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "platform/MainQueue.h"
#include "platform/ProcessLifetime.h"
#include "quorveld/RCSXPCTransactionController.h"
#include "quorveld/SavedRecordingService.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/LocalListener.h"
#include "tests/support/LogCapture.h"
#include "tests/support/ScopedTempDir.h"

namespace quorvel {

using namespace std::chrono_literals;
using platform::BusValue;
using platform::BusValues;

class ServiceTest : public ::testing::Test {
 public:
  void SetUp() override {
    // The process-wide lifetime and controller stay on the real main queue;
    // only what the service schedules from now on goes to the test's queue.
    (void)platform::ProcessLifetime::instance();
    ASSERT_FALSE(controller().isInTransaction());
    platform::setMainQueueForTesting(&main_);
    service_ = SavedRecordingService::makeForTesting({.watchDebugSignal = false});
    service_->setListenerFactory([this](const std::string& name, platform::InterfaceDescription i) {
      return makeListener(name, std::move(i));
    });
  }
  // The listener start() gets: by default an in-process one, which the tests
  // drive as peers with call().
  virtual std::shared_ptr<platform::Listener> makeListener(const std::string&,
                                                           platform::InterfaceDescription i) {
    return listener_ = std::make_shared<platform::LocalListener>(std::move(i));
  }
  void TearDown() override {
    // Every queued block and delayed end runs before the service goes: a
    // close takes several hops through the service queue.
    settle();
    listener_.reset();
    service_.reset();
    platform::setMainQueueForTesting(nullptr);
    EXPECT_FALSE(controller().isInTransaction());
  }

  static RCSXPCTransactionController& controller() {
    return RCSXPCTransactionController::sharedInstance();
  }
  // Moves the clock a second at a time until no keep-alive is held (at most
  // a minute), then one more.
  void settle() {
    for (int second = 0; second < 60 && controller().isInTransaction(); ++second) advance(1s);
    advance(1s);
  }
  // Lets the fragment cleanups under way finish, then runs what the service
  // queue holds.
  void drainServiceQueue() {
    service_->waitUntilFragmentCleanupsAreFinishedForTesting();
    service_->serviceSerialQueue().sync([] {});
  }
  // Moves the clock, then runs the main queue, the service queue and the
  // export operations until no chain of work between them has a hop left
  // (none has more than twelve).
  void advance(std::chrono::nanoseconds by) {
    clock_.advance(by);
    for (int round = 0; round < 12; ++round) {
      main_.runUntilIdle();
      drainServiceQueue();
      service_->assetExportController().waitUntilAllOperationsAreFinishedForTesting();
    }
  }
  std::shared_ptr<platform::LocalReply> call(const std::string& peer, const std::string& member,
                                             BusValues arguments = {}, bool noReply = false) {
    return listener_->deliver(peer, member, std::move(arguments), noReply);
  }

  testing::LogCapture log_;
  platform::ManualClock clock_;
  platform::MainQueue main_{clock_, "test main"};
  std::shared_ptr<SavedRecordingService> service_;
  std::shared_ptr<platform::LocalListener> listener_;
};

// A started service on a recordings directory of its own, with helpers to
// prepare and end sessions as peers and to read the service's state.
class SessionTest : public ServiceTest {
 public:
  void SetUp() override {
    RCSetSavedRecordingsDirectory(directory_.string());
    ASSERT_EQ(RCSavedRecordingsDirectory(), directory_.string());  // made on first use
    ServiceTest::SetUp();
    ASSERT_TRUE(service_->start());
  }
  void TearDown() override {
    ServiceTest::TearDown();
    RCSetSavedRecordingsDirectory(std::nullopt);
  }

  std::string url(const std::string& name) const {
    return platform::URL::fileURLWithPath((directory_ / name).string()).absoluteString();
  }
  std::shared_ptr<platform::LocalReply> prepare(const std::string& peer, const std::string& member,
                                                const std::string& recording) {
    return call(peer, member, {url(recording)});
  }
  // The token a granted request answered.
  BusValue token(const std::shared_ptr<platform::LocalReply>& reply) {
    EXPECT_TRUE(reply->waitFor(10s));
    EXPECT_FALSE(reply->isError()) << reply->errorName();
    return reply->isError() ? BusValue::structure({"", 0, "", ""}) : reply->values().at(0);
  }
  // The access type of the token a granted request answered (0: no token).
  int accessType(const std::shared_ptr<platform::LocalReply>& reply) {
    return token(reply).fields().at(1).asInt32();
  }
  // The error a refused request answered.
  std::string refusal(const std::shared_ptr<platform::LocalReply>& reply) {
    EXPECT_TRUE(reply->waitFor(10s));
    return reply->errorName();
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
  auto onServiceQueue(auto read) {
    decltype(read()) value{};
    service_->serviceSerialQueue().sync([&] { value = read(); });
    return value;
  }
  // A recording in the database whose fragments are tones of the given
  // lengths, not yet composed. Throws, failing the test, when a step fails.
  RCCompositionEditor makeRecording(const std::string& title,
                                    std::initializer_list<double> fragmentSeconds) {
    auto check = [&](auto&& result) {
      if (!result) throw std::runtime_error(fmt::format("making {}: {}", title, result.error()));
      return std::move(*result);
    };
    auto model = check(RCSavedRecordingsModel::modelWithDirectory(directory_.string()));
    auto editor = check(RCCompositionEditor::createCompositionForNewRecording(*model, title));
    const std::string tone = (temp_ / "tone.wav").string();
    for (double seconds : fragmentSeconds) {
      if (!testing::writeTone(tone, seconds, "wav")) throw std::runtime_error("no tone");
      check(editor.appendFragmentFromAudioFile(platform::URL::fileURLWithPath(tone)));
    }
    return editor;
  }
  // Fragments of the recording not yet composed (999: its bundle does not load).
  std::size_t decomposed(const RCCompositionEditor& editor) {
    auto composition =
        RCComposition::compositionLoadedFromCompositionBundleURL(editor.composition()->bundleURL());
    return composition ? composition->decomposedFragments().size() : 999;
  }
  // Overwrites the file's header with bytes no media file starts with, as
  // a failing disk or a stray write would, keeping its size.
  static void damage(const std::string& path) {
    std::fstream(path, std::ios::binary | std::ios::in | std::ios::out) << std::string(64, 'Z');
  }
  std::size_t openSessions() {
    return onServiceQueue(
        [&] { return service_->assetSessionController().activeSessions().size(); });
  }
  std::size_t deferredRequests() {
    return onServiceQueue([&] { return service_->deferredAccessRequestCountForTesting(); });
  }
  // The AccessSessionsChanged signals for `recording` so far.
  long changes(const std::string& recording) {
    return std::ranges::count(
        listener_->emittedSignals(),
        std::pair<std::string, BusValues>{"AccessSessionsChanged", {BusValue(url(recording))}});
  }
  // Recordings waiting for a later close to be finalized.
  std::size_t waitingFinalizations() {
    return onServiceQueue([&] { return service_->compositionAVURLsToFinalizeForTesting().size(); });
  }
  // Nothing open, closing or waiting, and no keep-alive held.
  void expectNothingLeft() {
    EXPECT_EQ(openSessions(), 0u);
    EXPECT_EQ(onServiceQueue([&] { return service_->closingSessionCountForTesting(); }), 0u);
    EXPECT_EQ(deferredRequests(), 0u);
    EXPECT_EQ(waitingFinalizations(), 0u);
    EXPECT_FALSE(controller().isInTransaction());
  }

  testing::ScopedTempDir temp_{"qv-sessions"};
  std::filesystem::path directory_ = temp_ / "Recordings";
};

}  // namespace quorvel
