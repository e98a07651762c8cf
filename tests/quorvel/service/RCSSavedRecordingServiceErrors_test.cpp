// The wire contract: error values to D-Bus error replies and back, and access
// tokens through their (siss) tuple.
#include <gtest/gtest.h>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/service/RCSSavedRecordingAccessToken.h"
#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"

namespace quorvel {
namespace {

TEST(ServiceErrorsTest, EveryServiceCodeTravelsUnderItsOwnNameAndComesBack) {
  for (const auto& [code, name] :
       {std::pair{RCSSavedRecordingServiceErrorMissingCompositionAVURL, "MissingCompositionAVURL"},
        {RCSSavedRecordingServiceErrorConflictingSession, "ConflictingSession"},
        {RCSSavedRecordingServiceErrorDeferredRequestSuperseded, "DeferredRequestSuperseded"},
        {RCSSavedRecordingServiceErrorCompositionFailed, "CompositionFailed"}}) {
    SCOPED_TRACE(name);
    platform::Error error = RCSSavedRecordingServiceError(code);
    EXPECT_EQ(error.domain(), "org.quorvel.SavedRecordingService.ErrorDomain");
    RCSDBusError reply = RCSDBusErrorFromError(error);
    EXPECT_EQ(reply.name, std::string("org.quorvel.SavedRecordingService.Error.") + name);
    EXPECT_NE(reply.message.find("org.quorvel.SavedRecordingService.ErrorDomain"),
              std::string::npos);
    EXPECT_NE(reply.message.find(std::to_string(code)), std::string::npos);
    platform::Error back = RCSErrorFromDBusError(reply.name, reply.message);
    EXPECT_EQ(back, error);
    EXPECT_EQ(back.underlyingError(), nullptr);
    // A client that only has the name still gets the code.
    EXPECT_EQ(RCSErrorFromDBusError(reply.name, "").code(), code);
  }
}

TEST(ServiceErrorsTest, OtherErrorsAreGenericButKeepDomainCodeTextAndUnderlyingChain) {
  platform::Error failed =
      RCSSavedRecordingServiceError(RCSSavedRecordingServiceErrorCompositionFailed);
  platform::Error generic = RCGenericErrorWithUnderlyingError(failed);
  ASSERT_NE(generic.underlyingError(), nullptr);
  EXPECT_EQ(generic.underlyingError()->code(), 401);

  RCSDBusError reply = RCSDBusErrorFromError(generic);
  EXPECT_EQ(reply.name, "org.quorvel.Error.Generic");
  platform::Error back = RCSErrorFromDBusError(reply.name, reply.message);
  EXPECT_EQ(back, RCError(RCErrorCodeGeneric, ""));
  EXPECT_EQ(back.localizedDescription(), generic.localizedDescription());
  ASSERT_NE(back.underlyingError(), nullptr);
  EXPECT_EQ(*back.underlyingError(), failed);

  // An unknown code of the service domain, and text with quotes and markers.
  platform::Error odd(RCSSavedRecordingServiceErrorDomain, 999, "say \"hi\" Code=3");
  reply = RCSDBusErrorFromError(odd);
  EXPECT_EQ(reply.name, "org.quorvel.Error.Generic");
  back = RCSErrorFromDBusError(reply.name, reply.message);
  EXPECT_EQ(back, odd);
  EXPECT_EQ(back.localizedDescription(), "say \"hi\" Code=3");

  platform::Error posix = platform::posixError(ENOENT, "open x");
  EXPECT_EQ(
      RCSErrorFromDBusError("org.quorvel.Error.Generic", RCSDBusErrorFromError(posix).message),
      posix);
}

TEST(ServiceErrorsTest, RepliesFromOtherSendersBecomeErrorsNamedAfterThem) {
  platform::Error noReply =
      RCSErrorFromDBusError("org.freedesktop.DBus.Error.NoReply", "Did not receive a reply");
  EXPECT_EQ(noReply.domain(), "org.freedesktop.DBus.Error.NoReply");
  EXPECT_EQ(noReply.localizedDescription(), "Did not receive a reply");
  EXPECT_EQ(RCSErrorFromDBusError("org.quorvel.Error.Generic", "garbled"),
            RCError(RCErrorCodeGeneric, ""));
  // Half a description: domain without code is not taken for one.
  EXPECT_EQ(RCSErrorFromDBusError("x.y", "Error Domain=abc").domain(), "x.y");
  EXPECT_EQ(RCSErrorFromDBusError("x.y", "Error Domain=abc Code=").domain(), "x.y");
}

TEST(AccessTokenTest, TupleRoundTripComparesEqualAndMalformedTuplesAreNoToken) {
  platform::URL url = platform::URL::fileURLWithPath("/r/My Walk #1.m4a");
  auto kept = RCSSavedRecordingAccessToken::tokenWithName("preview", 1, url);
  auto tuple = kept.toTuple();
  EXPECT_EQ(std::get<0>(tuple), "preview");
  EXPECT_EQ(std::get<1>(tuple), 1);
  EXPECT_EQ(std::get<2>(tuple), url.absoluteString());
  auto back = RCSSavedRecordingAccessToken::fromTuple(tuple);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, kept);
  // Clients may hand the identifier back in lower case.
  std::string lower = std::get<3>(tuple);
  for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  std::get<3>(tuple) = lower;
  EXPECT_EQ(*RCSSavedRecordingAccessToken::fromTuple(tuple), kept);

  // No token and malformed tuples are no token.
  EXPECT_FALSE(
      RCSSavedRecordingAccessToken::fromTuple(RCSSavedRecordingAccessToken::noTokenTuple()));
  const auto good = kept.toTuple();
  auto bad = good;
  std::get<3>(bad) = "not-a-uuid";
  EXPECT_FALSE(RCSSavedRecordingAccessToken::fromTuple(bad));
  bad = good;
  std::get<2>(bad) = "http://example.com/a.m4a";
  EXPECT_FALSE(RCSSavedRecordingAccessToken::fromTuple(bad));
  // A token without a URL is still a token, just for no recording.
  bad = good;
  std::get<2>(bad) = "";
  auto noURL = RCSSavedRecordingAccessToken::fromTuple(bad);
  ASSERT_TRUE(noURL);
  EXPECT_FALSE(noURL->compositionAVURL());
}

}  // namespace
}  // namespace quorvel
