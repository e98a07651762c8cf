// The media worker's frames and messages: what both sides must refuse, and
// what must survive the trip unchanged.
#include <gtest/gtest.h>

#include <cerrno>
#include <cmath>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/media/RCMediaProtocol.h"

namespace quorvel {
namespace {

TEST(MediaProtocolTest, FramesSplitAnywhereComeOutWholeAndOversizedOnesAreRefusedUnread) {
  std::string stream = RCMediaEncodeFrame("{\"a\":1}") + RCMediaEncodeFrame("") +
                       RCMediaEncodeFrame(std::string(1000, 'x'));
  for (std::size_t step : {std::size_t(1), std::size_t(3), stream.size()}) {
    RCMediaFrameReader reader;
    std::vector<std::string> bodies;
    for (std::size_t at = 0; at < stream.size(); at += step) {
      reader.append(stream.data() + at, std::min(step, stream.size() - at));
      while (auto body = reader.next()) {
        ASSERT_TRUE(body);
        if (!*body) break;
        bodies.push_back(**body);
      }
    }
    ASSERT_EQ(bodies.size(), 3u) << "step " << step;
    EXPECT_EQ(bodies[0], "{\"a\":1}");
    EXPECT_EQ(bodies[1], "");
    EXPECT_EQ(bodies[2], std::string(1000, 'x'));
    EXPECT_EQ(reader.pendingBytes(), 0u);
  }
  // Only the header of a frame over the limit has to arrive to refuse it.
  RCMediaFrameReader reader;
  const std::uint32_t size = kRCMediaMaxFrameBytes + 1;
  const char header[4] = {char(size & 0xff), char((size >> 8) & 0xff), char((size >> 16) & 0xff),
                          char(size >> 24)};
  reader.append(header, 4);
  auto refused = reader.next();
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error(), RCMediaError(RCMediaErrorCodeWorkerFailed, ""));
}

RCMediaRequest throughTheWire(const RCMediaRequest& request) {
  auto decoded = RCMediaDecodeRequest(RCMediaEncodeRequest(request));
  EXPECT_TRUE(decoded) << decoded.error();
  return decoded.value_or(RCMediaRequest{});
}
RCMediaReply decodedReply(const std::string& body) {
  auto decoded = RCMediaDecodeReply(body);
  EXPECT_TRUE(decoded) << decoded.error();
  return decoded.value_or(RCMediaReply{});
}

TEST(MediaProtocolTest, RequestsAndRepliesSurviveTheTrip) {
  // Any byte of a Linux file name, and titles in any script.
  const platform::URL odd = platform::URL::fileURLWithPath("/rec/\xff\x01 Walk %20#?.m4a"),
                      flac = platform::URL::fileURLWithPath("/b.flac");
  RCMediaRequest compose{.id = 42, .kind = RCMediaJobKind::Compose, .url = odd};
  compose.segments = {{odd, 0.25, 1.5}, {flac, 0, 0.5}};
  compose.destination = platform::URL::fileURLWithPath("/rec/Walk.waveform");
  RCMediaRequest decoded = throughTheWire(compose);
  EXPECT_EQ(decoded.id, 42u);
  EXPECT_EQ(decoded.kind, RCMediaJobKind::Compose);
  EXPECT_EQ(decoded.url, odd);
  ASSERT_EQ(decoded.segments.size(), 2u);
  EXPECT_EQ(decoded.segments[0].fragmentURL, odd);
  EXPECT_EQ(decoded.segments[0].contentStart, 0.25);
  EXPECT_EQ(decoded.segments[1].contentDuration, 0.5);
  EXPECT_EQ(decoded.destination, compose.destination);

  decoded = throughTheWire({.kind = RCMediaJobKind::WriteTitle,
                            .url = odd,
                            .title = "Spaziergang \xc3\xbc",
                            .language = "deu"});
  EXPECT_EQ(decoded.title, "Spaziergang \xc3\xbc");
  EXPECT_EQ(decoded.language, "deu");
  decoded = throughTheWire({.kind = RCMediaJobKind::ProbeMany, .urls = {odd, flac}});
  EXPECT_EQ(decoded.kind, RCMediaJobKind::ProbeMany);
  EXPECT_EQ(decoded.urls, (std::vector{odd, flac}));

  RCMediaProbe probe{.playable = true, .duration = std::nan(""), .containerName = "wav"};
  probe.titleItems = {{"Walk", ""}, {"Spaziergang", "ger"}};
  probe.creationDate = platform::Date::dateWithTimeIntervalSince1970(1577934245.5);
  RCMediaReply reply = decodedReply(RCMediaEncodeResult(7, &probe));
  EXPECT_EQ(reply.kind, RCMediaReply::Kind::Result);
  ASSERT_TRUE(reply.probe);
  EXPECT_TRUE(std::isnan(reply.probe->duration));
  EXPECT_EQ(reply.probe->titleItems, probe.titleItems);
  EXPECT_DOUBLE_EQ(reply.probe->creationDate->timeIntervalSince1970(), 1577934245.5);

  reply = decodedReply(RCMediaEncodeItem(7, 63, probe));
  EXPECT_EQ(reply.kind, RCMediaReply::Kind::Item);
  EXPECT_EQ(reply.index, 63u);
  ASSERT_TRUE(reply.probe);
  EXPECT_EQ(reply.probe->titleItems, probe.titleItems);
  reply = decodedReply(
      RCMediaEncodeItem(7, 1, platform::fail(platform::posixError(ENOENT, "stat /a"))));
  EXPECT_EQ(reply.index, 1u);
  EXPECT_FALSE(reply.probe);
  EXPECT_EQ(reply.error, platform::posixError(ENOENT, ""));

  reply = decodedReply(RCMediaEncodeError(
      8, platform::Error(kRCMP4ErrorDomain, kRCMP4ErrorNoMovie, std::string(10000, 'm'))));
  EXPECT_EQ(reply.kind, RCMediaReply::Kind::Error);
  EXPECT_EQ(reply.error, platform::Error(kRCMP4ErrorDomain, kRCMP4ErrorNoMovie));
  EXPECT_EQ(reply.error->localizedDescription().size(), 4096u);  // long messages are cut

  // A compose that blames a segment: the index and what was found both arrive.
  reply = decodedReply(RCMediaEncodeError(
      10, RCComposerSegmentError(3, RCMediaError(RCMediaErrorCodeTruncated, "b.m4a ends early"))));
  EXPECT_EQ(RCComposerFailedSegment(*reply.error), 3u);
  ASSERT_NE(reply.error->underlyingError(), nullptr);
  EXPECT_EQ(*reply.error->underlyingError(), RCMediaError(RCMediaErrorCodeTruncated, ""));
  EXPECT_EQ(reply.error->underlyingError()->localizedDescription(), "b.m4a ends early");

  reply = decodedReply(RCMediaEncodeProgress(9, 0.5));
  EXPECT_EQ(reply.kind, RCMediaReply::Kind::Progress);
  EXPECT_EQ(reply.progress, 0.5);
}

TEST(MediaProtocolTest, MalformedMessagesAreErrorValues) {
  for (const char* reply : {
           "",
           "[]",
           "not json",
           "{\"id\":1}",
           "{\"id\":-1,\"result\":{}}",
           "{\"id\":\"1\",\"result\":{}}",
           "{\"id\":1,\"progress\":\"half\"}",
           "{\"id\":1,\"result\":[]}",
           "{\"id\":1,\"result\":{\"playable\":1}}",
           "{\"id\":1,\"result\":{\"playable\":true,\"duration\":-1,\"container\":\"\","
           "\"titles\":[],\"created\":null}}",
           "{\"id\":1,\"result\":{\"playable\":true,\"duration\":1,\"container\":\"\","
           "\"titles\":[1],\"created\":null}}",
           "{\"id\":1,\"result\":{\"playable\":true,\"duration\":1,\"container\":\"\","
           "\"titles\":[],\"created\":1e300}}",
           "{\"id\":1,\"error\":{\"domain\":\"\",\"code\":1,\"message\":\"\"}}",
           "{\"id\":1,\"error\":{\"domain\":\"d\",\"code\":1.5,\"message\":\"\"}}",
           "{\"id\":1,\"error\":{\"domain\":\"d\",\"code\":1,\"message\":\"\","
           "\"underlying\":7}}",
           "{\"id\":1,\"error\":{\"domain\":\"d\",\"code\":1,\"message\":\"\","
           "\"underlying\":{\"domain\":\"d\",\"code\":1,\"message\":\"\",\"underlying\":"
           "{\"domain\":\"d\",\"code\":1,\"message\":\"\"}}}}",
           "{\"id\":1,\"item\":[]}",
           "{\"id\":1,\"item\":{\"result\":{}}}",
           "{\"id\":1,\"item\":{\"index\":-1,\"error\":{\"domain\":\"d\",\"code\":1,"
           "\"message\":\"\"}}}",
           "{\"id\":1,\"item\":{\"index\":64,\"error\":{\"domain\":\"d\",\"code\":1,"
           "\"message\":\"\"}}}",
           "{\"id\":1,\"item\":{\"index\":0}}",
           "{\"id\":1,\"item\":{\"index\":0,\"result\":{}}}",
           "{\"id\":1,\"item\":{\"index\":0,\"result\":{\"playable\":true,\"duration\":1,"
           "\"container\":\"\",\"titles\":[],\"created\":null},\"error\":{\"domain\":\"d\","
           "\"code\":1,\"message\":\"\"}}}",
       }) {
    auto decoded = RCMediaDecodeReply(reply);
    EXPECT_FALSE(decoded) << reply;
    if (!decoded) {
      EXPECT_EQ(decoded.error(), RCMediaError(RCMediaErrorCodeWorkerFailed, ""));
    }
  }
  std::string tooMany = "{\"id\":1,\"job\":\"probeMany\",\"urls\":[\"file:///a\"";
  for (std::size_t i = 1; i <= kRCMediaMaxProbeBatch; ++i) tooMany += ",\"file:///a\"";
  tooMany += "]}";
  for (const std::string& request : std::vector<std::string>{
           tooMany,
           "{\"id\":1,\"job\":\"probeMany\",\"urls\":[]}",
           "{\"id\":1,\"job\":\"probeMany\",\"urls\":\"file:///a\"}",
           "{\"id\":1,\"job\":\"probeMany\",\"urls\":[\"file:///a\",1]}",
           "{\"id\":1,\"job\":\"probeMany\",\"urls\":[\"/a\"]}",
           "{\"id\":1,\"job\":\"format\",\"url\":\"file:///a\"}",
           "{\"id\":1,\"job\":\"probe\",\"url\":\"http://host/a.m4a\"}",
           "{\"id\":1,\"job\":\"probe\",\"url\":\"/a.m4a\"}",
           "{\"id\":1,\"job\":\"compose\",\"url\":\"file:///a\",\"segments\":{},\"waveform\":null}",
           "{\"id\":1,\"job\":\"waveform\",\"url\":\"file:///a\"}",
       }) {
    EXPECT_FALSE(RCMediaDecodeRequest(request)) << request;
  }
}

}  // namespace
}  // namespace quorvel
