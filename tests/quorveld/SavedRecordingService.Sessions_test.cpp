// Access sessions through the service core: sharing and conflicts, deferral
// behind a closing session and its supersession, clients that vanish with
// sessions and waiting requests, fragment-cleanup holds over a real
// recording, and a stress run of many clients.
#include <gtest/gtest.h>

#include <fmt/format.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <latch>
#include <random>
#include <thread>

#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "tests/quorveld/ServiceFixture.h"
#include "tests/support/AudioFixtures.h"

namespace quorvel {
namespace {

constexpr const char* kConflict = "org.quorvel.SavedRecordingService.Error.ConflictingSession";
constexpr const char* kSuperseded =
    "org.quorvel.SavedRecordingService.Error.DeferredRequestSuperseded";

TEST_F(SessionTest, SharedSessionsCoexistAndExclusiveOnesAreRefused) {
  auto first = prepare(":1.1", "PrepareToPreview", "A.m4a");
  auto second = prepare(":1.2", "PrepareToPreview", "A.m4a");
  EXPECT_EQ(token(first).fields().at(1).asInt32(), 1);
  EXPECT_EQ(token(second).fields().at(1).asInt32(), 1);
  EXPECT_NE(token(first).fields().at(3).asString(), token(second).fields().at(3).asString());
  auto refused = [&](const char* member, const char* recording) {
    auto reply = prepare(":1.3", member, recording);
    return reply->waitFor(10s) && reply->errorName() == kConflict;
  };
  EXPECT_TRUE(refused("PrepareToCapture", "A.m4a"));
  EXPECT_TRUE(refused("PrepareToTrim", "A.m4a"));
  // An exclusive session refuses shared ones on its recording only.
  EXPECT_EQ(token(prepare(":1.3", "PrepareToCapture", "B.m4a")).fields().at(1).asInt32(), 2);
  EXPECT_TRUE(refused("PrepareToPreview", "B.m4a"));

  // Ending through another connection works; ending again does nothing more.
  end(":1.4", token(first));
  settle();
  EXPECT_EQ(openSessions(), 2u);
  auto closing = linesContaining("Closing access session");
  end(":1.4", token(first));
  settle();
  EXPECT_EQ(linesContaining("Closing access session").size(), closing.size());
  EXPECT_EQ(linesContaining("Ending access session").size(), 2u);

  const std::vector<std::string> steps = {"Ending access session", "Closing access session",
                                          "Scheduling orphan fragment cleanup for closing session",
                                          "Finally closing access session"};
  std::vector<std::string> order;
  for (const auto& line : lines()) {
    for (const auto& step : steps) {
      if (line.text.find(step) != std::string::npos) order.push_back(step);
    }
  }
  ASSERT_GE(order.size(), 4u);
  EXPECT_EQ(std::vector(order.begin(), order.begin() + 4), steps);
}

TEST_F(SessionTest, ConflictsWaitBehindAClosingSessionAndTheNewestWins) {
  auto preview = token(prepare(":1.1", "PrepareToPreview", "A.m4a"));
  auto other = token(prepare(":1.5", "PrepareToPreview", "B.m4a"));

  auto gate = holdServiceQueue();
  end(":1.1", preview);
  auto capture = prepare(":1.3", "PrepareToCapture", "A.m4a");
  auto trim = prepare(":1.4", "PrepareToTrim", "A.m4a");
  gate->count_down();

  ASSERT_TRUE(capture->waitFor(10s));
  EXPECT_EQ(capture->errorName(), kSuperseded);
  auto trimToken = token(trim);  // re-issued once A's preview has left the registry
  EXPECT_EQ(trimToken.fields().at(1).asInt32(), 2);
  EXPECT_EQ(linesContaining("scheduling deferred access for 'capture' request").size(), 1u);
  EXPECT_EQ(linesContaining("running deferred access block for 'capture' request -- was canceled!")
                .size(),
            1u);
  EXPECT_EQ(linesContaining(
                "running deferred access block for 'trimming' request -- will re-issue request")
                .size(),
            1u);

  // While B's session closes, a conflicting request for A waits, and only a
  // close of A's own session sets it going.
  gate = holdServiceQueue();
  end(":1.5", other);
  auto waiting = prepare(":1.6", "PrepareToPreview", "A.m4a");
  gate->count_down();
  settle();
  EXPECT_FALSE(waiting->isAnswered());
  EXPECT_EQ(deferredRequests(), 1u);
  end(":1.4", trimToken);
  EXPECT_EQ(token(waiting).fields().at(1).asInt32(), 1);
}

TEST_F(SessionTest, AVanishedClientTakesItsSessionsAndItsWaitingRequestWithIt) {
  token(prepare(":1.1", "PrepareToCapture", "A.m4a"));
  token(prepare(":1.1", "PrepareToPreview", "C.m4a"));
  auto other = token(prepare(":1.2", "PrepareToPreview", "B.m4a"));

  auto gate = holdServiceQueue();
  end(":1.2", other);
  auto waiting = prepare(":1.3", "PrepareToPreview", "A.m4a");  // deferred behind B's close
  gate->count_down();
  settle();
  EXPECT_FALSE(waiting->isAnswered());
  auto inUse = onServiceQueue<std::vector<platform::URL>>(
      [&] { return service_->_onQueue_composedAVURLsWithActiveSessionsOrScheduledWork(); });
  EXPECT_EQ(std::ranges::count(inUse, *platform::URL::fromFileURLStringOrPath(url("A.m4a"))), 2);

  listener_->vanish(":1.3");
  settle();
  EXPECT_EQ(deferredRequests(), 0u);
  EXPECT_TRUE(waiting->values().empty());  // never granted

  listener_->vanish(":1.1");
  settle();
  EXPECT_EQ(linesContaining("for terminated connection: <connection :1.1>").size(), 2u);
  EXPECT_EQ(linesContaining("Finally closing access session").size(), 1u);  // B's only
  expectNothingLeft();
}

TEST_F(SessionTest, HoldsKeepOrphanedFragmentsUntilTheLastOneIsReleased) {
  auto editor = makeRecording("Walk", {0.2});
  ASSERT_TRUE(editor);
  const std::filesystem::path bundle = editor->composition()->bundleURL().path();
  auto stray = [&] { std::ofstream(bundle / "stray.m4a") << "audio"; };
  stray();
  const std::string recording = editor->composedAVURL().lastPathComponent();
  const platform::URL recordingURL = editor->composedAVURL();
  auto holds = [&] {
    return onServiceQueue<std::size_t>(
        [&] { return service_->orphanedFragmentCleanupHoldCount(recordingURL); });
  };

  for (const char* peer : {":1.1", ":1.2", ":1.1"}) {
    auto held = call(peer, "DisableOrphanedFragmentCleanup", {url(recording)});
    ASSERT_TRUE(held->waitFor(10s));
    EXPECT_FALSE(held->isError());
  }
  EXPECT_EQ(holds(), 2u);  // one per connection
  end(":1.3", token(prepare(":1.3", "PrepareToPreview", recording)));
  call(":1.4", "EnableOrphanedFragmentCleanup", {url(recording)}, true);  // never held
  call(":1.1", "EnableOrphanedFragmentCleanup", {url(recording)}, true);
  settle();
  EXPECT_EQ(holds(), 1u);
  EXPECT_TRUE(std::filesystem::exists(bundle / "stray.m4a"));

  call(":1.2", "EnableOrphanedFragmentCleanup", {url(recording)}, true);
  settle();
  EXPECT_EQ(holds(), 0u);
  EXPECT_FALSE(std::filesystem::exists(bundle / "stray.m4a"));
  EXPECT_TRUE(
      std::filesystem::exists(editor->composition()->fragments().front().AVOutputURL().path()));
  EXPECT_EQ(linesContaining("NOTE: cleaning (deleting) orphaned fragment '" +
                            (bundle / "stray.m4a").string() + "' no longer in use.")
                .size(),
            1u);

  // A session open on the recording keeps it; opening with no other session
  // cleans before the token is given; a vanished holder releases its hold.
  stray();
  auto open = token(prepare(":1.5", "PrepareToPreview", recording));
  EXPECT_FALSE(std::filesystem::exists(bundle / "stray.m4a"));
  stray();
  end(":1.6", token(prepare(":1.6", "PrepareToPreview", recording)));
  settle();
  EXPECT_TRUE(std::filesystem::exists(bundle / "stray.m4a"));
  ASSERT_TRUE(call(":1.7", "DisableOrphanedFragmentCleanup", {url(recording)})->waitFor(10s));
  end(":1.5", open);
  settle();
  EXPECT_TRUE(std::filesystem::exists(bundle / "stray.m4a"));
  listener_->vanish(":1.7");
  settle();
  EXPECT_FALSE(std::filesystem::exists(bundle / "stray.m4a"));

  // A recording whose bundle does not load loses nothing and is named.
  token(prepare(":1.8", "PrepareToPreview", "Nothing.m4a"));
  EXPECT_EQ(linesContaining("WARNING: attempt to delete orphaned fragments for " +
                            url("Nothing.m4a") + " failed because the composition failed to load")
                .size(),
            1u);
}

// Clients issue random prepares, ends and disconnects on a few recordings.
// Afterwards nothing is left open or waiting, every call was answered at most
// once (exactly once unless its client vanished first), and the keep-alive
// is released.
TEST_F(SessionTest, StressOfRandomClientsLeavesNothingBehind) {
  constexpr int kClients = 4;
  constexpr int kSteps = 150;
  const char* kinds[] = {"PrepareToPreview", "PrepareToCapture", "PrepareToTrim"};
  struct Request {
    std::string peer;
    std::shared_ptr<platform::LocalReply> reply;
    bool ended = false;
  };
  std::vector<std::vector<Request>> requests(kClients);
  std::vector<std::vector<std::string>> vanished(kClients);
  std::vector<std::thread> clients;
  for (int client = 0; client < kClients; ++client) {
    clients.emplace_back([&, client] {
      std::mt19937 random(static_cast<unsigned>(client) * 7919u + 1);
      int generation = 0;
      auto peer = [&] { return fmt::format(":2.{}{:03}", client, generation); };
      for (int step = 0; step < kSteps; ++step) {
        int action = static_cast<int>(random() % 10);
        if (action < 5) {
          requests[client].push_back({peer(), call(peer(), kinds[random() % 3],
                                                   {url(fmt::format("R{}.m4a", random() % 3))})});
        } else if (action < 9) {
          for (auto& request : requests[client]) {
            if (!request.ended && request.peer == peer() && request.reply->isAnswered() &&
                !request.reply->isError()) {
              call(peer(), "EndAccessSession", {request.reply->values().at(0)}, true);
              request.ended = true;
              break;
            }
          }
        } else {
          listener_->vanish(peer());
          vanished[client].push_back(peer());
          ++generation;
        }
      }
      listener_->vanish(peer());
      vanished[client].push_back(peer());
    });
  }
  for (auto& thread : clients) thread.join();
  settle();

  expectNothingLeft();
  for (const auto& list : requests) {
    for (const auto& request : list) EXPECT_EQ(request.reply->answerCount(), 1);
  }
}

}  // namespace
}  // namespace quorvel
