// The session registry: the conflict rule, lookups by token, recording and
// connection, closing, and the dump's text.
#include <gtest/gtest.h>

#include <regex>

#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"
#include "platform/dbus/Connection.h"
#include "quorveld/AssetAccessSessionController.h"
#include "quorveld/RCSXPCTransactionController.h"

namespace quorvel {
namespace {

class SessionRegistryTest : public ::testing::Test {
 protected:
  std::shared_ptr<AssetAccessSession> open(const platform::URL& url, bool exclusive,
                                           std::shared_ptr<platform::Connection> connection = {},
                                           std::optional<platform::Error>* error = nullptr) {
    return registry_.openAccessSessionWithName(exclusive ? "capture" : "preview",
                                               std::move(connection), url, exclusive, error);
  }
  void TearDown() override {
    for (const auto& session : registry_.activeSessions()) registry_.closeSession(session);
    EXPECT_FALSE(RCSXPCTransactionController::sharedInstance().isInTransaction());
  }

  AssetAccessSessionController registry_;
  platform::URL walk_ = platform::URL::fileURLWithPath("/recordings/Walk.m4a");
  platform::URL talk_ = platform::URL::fileURLWithPath("/recordings/Talk.m4a");
};

// The conflict rule itself is driven through the service in the sessions
// test; here what only the registry shows.
TEST_F(SessionRegistryTest, ARefusalLeavesTheTableAndClosingAllFreesTheRecording) {
  std::optional<platform::Error> error = platform::Error("stale", 1);
  auto first = open(walk_, /*exclusive=*/false, {}, &error);
  ASSERT_TRUE(first);
  EXPECT_FALSE(error);  // a success writes "no error"
  auto second = open(walk_, false);
  EXPECT_FALSE(open(walk_, /*exclusive=*/true, {}, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(*error, RCSSavedRecordingServiceError(RCSSavedRecordingServiceErrorConflictingSession));
  EXPECT_EQ(registry_.activeSessions().size(), 2u);
  // Sessions without a client (the daemon's own) belong to no connection.
  EXPECT_TRUE(registry_.activeSessionsWithXPCConnection(nullptr).empty());

  // Closing one shared session leaves the other; closing all frees the
  // recording for an exclusive session even though its (empty) list stays.
  registry_.closeSession(first);
  EXPECT_EQ(registry_.activeSessionsWithWithCompositionAVURL(walk_),
            AssetAccessSessionList{second});
  EXPECT_FALSE(open(walk_, true));
  registry_.closeSession(second);
  EXPECT_TRUE(open(walk_, true));
}

TEST_F(SessionRegistryTest, EachSessionKeepsTheProcessAliveUntilClosed) {
  auto& controller = RCSXPCTransactionController::sharedInstance();
  auto session = open(walk_, true);
  EXPECT_TRUE(session->xpcTransaction()->isActive());
  EXPECT_EQ(
      session->xpcTransaction()->name(),
      "Opening access session for compositionAVURL: /recordings/Walk.m4a, connection: (null)");
  EXPECT_TRUE(controller.isInTransaction());
  registry_.closeSession(session);
  EXPECT_FALSE(session->xpcTransaction()->isActive());
  registry_.closeSession(session);  // a second close changes nothing
  EXPECT_FALSE(controller.isInTransaction());
}

TEST_F(SessionRegistryTest, DumpPrintsOneLineWhenEmptyAndABlockPerRecording) {
  EXPECT_EQ(registry_.stateDescription(),
            fmt::format("[{}] *** No Active Sessions ***\n", registry_.description()));
  auto walk = open(walk_, false);
  auto walkToo = open(walk_, false);
  auto talk = open(talk_, true);
  std::string dump = registry_.stateDescription();
  std::string expected = fmt::format("[{}] *** Active Sessions (by compositionAVURL/URL) ***\n\n",
                                     registry_.description()) +
                         "compositionAVURL = file:///recordings/Walk.m4a\n" +
                         "\tActive Sessions (2) = " + walk->debugDescription() + "; " +
                         walkToo->debugDescription() + "\n" +
                         "\tComposition Metadata = (null)\n\n\n" +
                         "compositionAVURL = file:///recordings/Talk.m4a\n" +
                         "\tActive Sessions (1) = " + talk->debugDescription() + "\n" +
                         "\tComposition Metadata = (null)\n\n\n" + std::string(41, '*') + "\n";
  EXPECT_EQ(dump, expected);
}

}  // namespace
}  // namespace quorvel
