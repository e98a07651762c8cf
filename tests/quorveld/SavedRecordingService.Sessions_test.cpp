// Access sessions through the service core: sharing and conflicts, deferral
// behind a closing session and its supersession, clients that vanish with
// sessions and waiting requests, fragment-cleanup holds over a real
// recording, and a stress run of many clients.
#include <gtest/gtest.h>

#include <fmt/format.h>

#include <fstream>
#include <random>
#include <thread>

#include "tests/quorveld/ServiceFixture.h"

namespace quorvel {
namespace {

constexpr const char* kConflict = "org.quorvel.SavedRecordingService.Error.ConflictingSession";

TEST_F(SessionTest, SharedSessionsCoexistAndExclusiveOnesAreRefused) {
  auto first = token(prepare(":1.1", "PrepareToPreview", "A.m4a"));
  auto second = token(prepare(":1.2", "PrepareToPreview", "A.m4a"));
  EXPECT_NE(first.fields().at(3).asString(), second.fields().at(3).asString());
  EXPECT_EQ(refusal(prepare(":1.3", "PrepareToCapture", "A.m4a")), kConflict);
  EXPECT_EQ(refusal(prepare(":1.3", "PrepareToTrim", "A.m4a")), kConflict);
  // An exclusive session refuses shared ones on its recording only.
  EXPECT_EQ(accessType(prepare(":1.3", "PrepareToCapture", "B.m4a")), 2);
  EXPECT_EQ(refusal(prepare(":1.3", "PrepareToPreview", "B.m4a")), kConflict);

  // Ending through another connection works; ending again does nothing more.
  for (int time = 0; time < 2; ++time) {
    end(":1.4", first);
    settle();
    EXPECT_EQ(openSessions(), 2u);
  }
}

// While B's session closes, a conflicting request for A waits, and only a
// close of A's own session sets it going. (Two requests waiting behind A's
// own close are in ServiceLog_test.)
TEST_F(SessionTest, AConflictWaitsWhileAnotherRecordingsSessionCloses) {
  auto trimToken = token(prepare(":1.4", "PrepareToTrim", "A.m4a"));
  auto other = token(prepare(":1.5", "PrepareToPreview", "B.m4a"));
  auto gate = holdServiceQueue();
  end(":1.5", other);
  auto waiting = prepare(":1.6", "PrepareToPreview", "A.m4a");
  gate->count_down();
  settle();
  EXPECT_FALSE(waiting->isAnswered());
  EXPECT_EQ(deferredRequests(), 1u);
  end(":1.4", trimToken);
  EXPECT_EQ(accessType(waiting), 1);
}

TEST_F(SessionTest, AVanishedClientTakesItsSessionsAndItsWaitingRequestWithIt) {
  token(prepare(":1.1", "PrepareToCapture", "A.m4a"));
  token(prepare(":1.1", "PrepareToPreview", "C.m4a"));
  auto other = token(prepare(":1.2", "PrepareToPreview", "B.m4a"));
  settle();  // the opens are signalled before the deferral
  auto gate = holdServiceQueue();
  end(":1.2", other);
  auto waiting = prepare(":1.3", "PrepareToPreview", "A.m4a");  // deferred behind B's close
  gate->count_down();
  settle();
  EXPECT_FALSE(waiting->isAnswered());
  EXPECT_EQ(changes("A.m4a"), 2);  // the capture's open, the deferral
  auto inUse = onServiceQueue(
      [&] { return service_->_onQueue_composedAVURLsWithActiveSessionsOrScheduledWork(); });
  EXPECT_EQ(std::ranges::count(inUse, *platform::URL::fromFileURLStringOrPath(url("A.m4a"))), 2);

  listener_->vanish(":1.3");
  settle();
  EXPECT_EQ(deferredRequests(), 0u);
  EXPECT_EQ(changes("A.m4a"), 3);
  EXPECT_TRUE(waiting->values().empty());  // never granted
  listener_->vanish(":1.1");
  settle();
  EXPECT_GE(changes("A.m4a"), 4);
  expectNothingLeft();
}

TEST_F(SessionTest, HoldsKeepOrphanedFragmentsUntilTheLastOneIsReleased) {
  auto editor = makeRecording("Walk", {0.2});
  const std::filesystem::path stray = editor.composition()->bundleURL().path() + "/stray.m4a";
  auto strew = [&] { std::ofstream(stray) << "audio"; };
  const std::string walk = "Walk.m4a";
  auto holds = [&] {
    return onServiceQueue(
        [&] { return service_->orphanedFragmentCleanupHoldCount(editor.composedAVURL()); });
  };
  auto enable = [&](const char* peer) {
    call(peer, "EnableOrphanedFragmentCleanup", {url(walk)}, true);
    settle();
  };

  strew();
  for (const char* peer : {":1.1", ":1.2", ":1.1"}) {
    auto held = call(peer, "DisableOrphanedFragmentCleanup", {url(walk)});
    ASSERT_TRUE(held->waitFor(10s));
    EXPECT_FALSE(held->isError());
  }
  EXPECT_EQ(holds(), 2u);  // one per connection
  end(":1.3", token(prepare(":1.3", "PrepareToPreview", walk)));
  enable(":1.4");  // never held
  enable(":1.1");
  EXPECT_EQ(holds(), 1u);
  EXPECT_TRUE(std::filesystem::exists(stray));
  enable(":1.2");
  EXPECT_EQ(holds(), 0u);
  EXPECT_FALSE(std::filesystem::exists(stray));
  EXPECT_TRUE(
      std::filesystem::exists(editor.composition()->fragments().front().AVOutputURL().path()));

  // A session open on the recording keeps it; opening with no other session
  // cleans before the token is given; a vanished holder releases its hold.
  strew();
  auto open = token(prepare(":1.5", "PrepareToPreview", walk));
  EXPECT_FALSE(std::filesystem::exists(stray));
  strew();
  end(":1.6", token(prepare(":1.6", "PrepareToPreview", walk)));
  settle();
  EXPECT_TRUE(std::filesystem::exists(stray));
  ASSERT_TRUE(call(":1.7", "DisableOrphanedFragmentCleanup", {url(walk)})->waitFor(10s));
  end(":1.5", open);
  settle();
  EXPECT_TRUE(std::filesystem::exists(stray));
  listener_->vanish(":1.7");
  settle();
  EXPECT_FALSE(std::filesystem::exists(stray));
}

// Clients issue random prepares, ends and disconnects on a few recordings.
// Afterwards nothing is left open or waiting, every call was answered
// exactly once, and the keep-alive is released.
TEST_F(SessionTest, StressOfRandomClientsLeavesNothingBehind) {
  constexpr int kClients = 4;
  const char* kinds[] = {"PrepareToPreview", "PrepareToCapture", "PrepareToTrim"};
  struct Request {
    std::string peer;
    std::shared_ptr<platform::LocalReply> reply;
    bool ended = false;
  };
  std::vector<std::vector<Request>> requests(kClients);
  std::vector<std::thread> clients;
  for (int client = 0; client < kClients; ++client) {
    clients.emplace_back([&, client] {
      std::mt19937 random(static_cast<unsigned>(client) * 7919u + 1);
      int generation = 0;
      auto peer = [&] { return fmt::format(":2.{}{:03}", client, generation); };
      for (int step = 0; step < 150; ++step) {
        const auto action = random() % 10;
        if (action < 5) {
          requests[client].push_back({peer(), call(peer(), kinds[random() % 3],
                                                   {url(fmt::format("R{}.m4a", random() % 3))})});
        } else if (action < 9) {
          for (auto& request : requests[client]) {
            if (!request.ended && request.peer == peer() && request.reply->isAnswered() &&
                !request.reply->isError()) {
              end(peer(), request.reply->values().at(0));
              request.ended = true;
              break;
            }
          }
        } else {
          listener_->vanish(peer());
          ++generation;
        }
      }
      listener_->vanish(peer());
    });
  }
  for (auto& thread : clients) thread.join();
  settle();
  expectNothingLeft();
  for (const auto& list : requests)
    for (const auto& request : list) EXPECT_EQ(request.reply->answerCount(), 1);
}

}  // namespace
}  // namespace quorvel
