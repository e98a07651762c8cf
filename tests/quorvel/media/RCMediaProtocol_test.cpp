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

// Every field of a request, comparable.
auto fields(const RCMediaRequest& r) {
  std::vector<std::tuple<platform::URL, double, double>> segments;
  for (const auto& s : r.segments)
    segments.emplace_back(s.fragmentURL, s.contentStart, s.contentDuration);
  return std::tuple(r.id, int(r.kind), r.url, r.urls, segments, r.destination, r.title, r.language);
}
// What a decoded reply says, comparable: a probe by its titles, date and
// whether its length is known.
auto says(const RCMediaReply& r) {
  const RCMediaProbe& p = r.probe ? *r.probe : RCMediaProbe{};
  return std::tuple(r.id, int(r.kind), r.progress, r.index, r.probe.has_value(), p.titleItems,
                    std::isnan(p.duration), p.creationDate, r.error);
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
  using enum RCMediaJobKind;
  for (const RCMediaRequest& request : std::vector<RCMediaRequest>{
           {.id = 42,
         .kind = Compose,
         .url = odd,
         .segments = {{odd, 0.25, 1.5}, {flac, 0, 0.5}},
         .destination = platform::URL::fileURLWithPath("/rec/Walk.waveform")},
           {.kind = WriteTitle, .url = odd, .title = "Spaziergang \xc3\xbc", .language = "deu"},
           {.kind = ProbeMany, .urls = {odd, flac}},
           {.id = 7, .kind = Waveform, .url = flac, .destination = odd},
       }) {
    auto decoded = RCMediaDecodeRequest(RCMediaEncodeRequest(request));
    ASSERT_TRUE(decoded) << decoded.error();
    EXPECT_EQ(fields(*decoded), fields(request));
  }

  RCMediaProbe probe{.playable = true, .duration = std::nan(""), .containerName = "wav"};
  probe.titleItems = {{"Walk", ""}, {"Spaziergang", "ger"}};
  probe.creationDate = platform::Date::dateWithTimeIntervalSince1970(1577934245.5);
  const platform::Error enoent = platform::posixError(ENOENT, "stat /a"),
                        noMovie(kRCMP4ErrorDomain, kRCMP4ErrorNoMovie, std::string(10000, 'm'));
  using enum RCMediaReply::Kind;
  for (const auto& [body, expected] : std::vector<std::pair<std::string, RCMediaReply>>{
           {RCMediaEncodeResult(7, &probe), {.id = 7, .kind = Result, .probe = probe}},
           {RCMediaEncodeItem(7, 63, probe), {.id = 7, .kind = Item, .index = 63, .probe = probe}},
           {RCMediaEncodeItem(7, 1, platform::fail(enoent)),
            {.id = 7, .kind = Item, .index = 1, .error = enoent}},
           {RCMediaEncodeError(8, noMovie), {.id = 8, .kind = Error, .error = noMovie}},
           {RCMediaEncodeProgress(9, 0.5), {.id = 9, .kind = Progress, .progress = 0.5}},
       }) {
    EXPECT_EQ(says(decodedReply(body)), says(expected)) << body;
  }
  // Long messages are cut.
  EXPECT_EQ(decodedReply(RCMediaEncodeError(8, noMovie)).error->localizedDescription().size(),
            4096u);

  // A compose that blames a segment: the index and what was found both arrive.
  const RCMediaReply reply = decodedReply(RCMediaEncodeError(
      10, RCComposerSegmentError(3, RCMediaError(RCMediaErrorCodeTruncated, "b.m4a ends early"))));
  EXPECT_EQ(RCComposerFailedSegment(*reply.error), 3u);
  ASSERT_NE(reply.error->underlyingError(), nullptr);
  EXPECT_EQ(*reply.error->underlyingError(), RCMediaError(RCMediaErrorCodeTruncated, ""));
  EXPECT_EQ(reply.error->underlyingError()->localizedDescription(), "b.m4a ends early");
}

TEST(MediaProtocolTest, MalformedMessagesAreErrorValues) {
  const std::string e = R"({"domain":"d","code":1,"message":""})";
  auto probe = [](const std::string& duration, const std::string& titles,
                  const std::string& created) {
    return R"({"playable":true,"duration":)" + duration + R"(,"container":"","titles":)" + titles +
           R"(,"created":)" + created + "}";
  };
  auto withId = [](const std::string& body) { return R"({"id":1,)" + body + "}"; };
  // clang-format off
  for (const std::string& reply : std::vector<std::string>{
           "", "[]", "not json", R"({"id":1})", R"({"id":-1,"result":{}})",
           R"({"id":"1","result":{}})", withId(R"("progress":"half")"), withId(R"("result":[])"),
           withId(R"("result":{"playable":1})"),
           withId(R"("result":)" + probe("-1", "[]", "null")),
           withId(R"("result":)" + probe("1", "[1]", "null")),
           withId(R"("result":)" + probe("1", "[]", "1e300")),
           withId(R"("error":{"domain":"","code":1,"message":""})"),
           withId(R"("error":{"domain":"d","code":1.5,"message":""})"),
           withId(R"("error":{"domain":"d","code":1,"message":"","underlying":7})"),
           // Only one level of underlying error crosses.
           withId(R"("error":{"domain":"d","code":1,"message":"","underlying":)"
                  R"({"domain":"d","code":1,"message":"","underlying":)" + e + "}}"),
           withId(R"("item":[])"), withId(R"("item":{"result":{}})"),
           withId(R"("item":{"index":-1,"error":)" + e + "}"),
           withId(R"("item":{"index":64,"error":)" + e + "}"),
           withId(R"("item":{"index":0})"), withId(R"("item":{"index":0,"result":{}})"),
           withId(R"("item":{"index":0,"result":)" + probe("1", "[]", "null") +
                  R"(,"error":)" + e + "}"),
       }) {
    // clang-format on
    auto decoded = RCMediaDecodeReply(reply);
    EXPECT_TRUE(!decoded && decoded.error() == RCMediaError(RCMediaErrorCodeWorkerFailed, ""))
        << reply;
  }
  std::string tooMany = R"("job":"probeMany","urls":["file:///a")";
  for (std::size_t i = 1; i <= kRCMediaMaxProbeBatch; ++i) tooMany += R"(,"file:///a")";
  // clang-format off
  for (const std::string& request : std::vector<std::string>{
           tooMany + "]", R"("job":"probeMany","urls":[])", R"("job":"probeMany","urls":"file:///a")",
           R"("job":"probeMany","urls":["file:///a",1])", R"("job":"probeMany","urls":["/a"])",
           R"("job":"format","url":"file:///a")", R"("job":"probe","url":"http://host/a.m4a")",
           R"("job":"probe","url":"/a.m4a")", R"("job":"waveform","url":"file:///a")",
           R"("job":"compose","url":"file:///a","segments":{},"waveform":null)",
       }) {
    // clang-format on
    EXPECT_FALSE(RCMediaDecodeRequest(withId(request))) << request;
  }
}

}  // namespace
}  // namespace quorvel
