// What the daemon reads from a media worker: a worker parsing a crafted file
// may be compromised, so its byte stream is outside data. Any bytes, split
// anywhere, must become frames, replies or error values; a reply that decodes
// must encode back to one that decodes the same. The worker decodes requests
// with the same care, and they must survive the trip back the same way.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "Quorvel/media/RCMediaProtocol.h"

namespace {

void checkRoundTrip(const quorvel::RCMediaReply& reply) {
  std::string again;
  switch (reply.kind) {
    case quorvel::RCMediaReply::Kind::Progress:
      again = quorvel::RCMediaEncodeProgress(reply.id, reply.progress);
      break;
    case quorvel::RCMediaReply::Kind::Item:
      again = quorvel::RCMediaEncodeItem(
          reply.id, reply.index,
          reply.probe ? platform::Result<quorvel::RCMediaProbe>(*reply.probe)
                      : platform::Result<quorvel::RCMediaProbe>(platform::fail(*reply.error)));
      break;
    case quorvel::RCMediaReply::Kind::Result:
      again = quorvel::RCMediaEncodeResult(reply.id, reply.probe ? &*reply.probe : nullptr);
      break;
    case quorvel::RCMediaReply::Kind::Error:
      again = quorvel::RCMediaEncodeError(reply.id, *reply.error);
      break;
  }
  auto decoded = quorvel::RCMediaDecodeReply(again);
  if (!decoded || decoded->id != reply.id || decoded->kind != reply.kind ||
      decoded->index != reply.index || decoded->probe.has_value() != reply.probe.has_value() ||
      (reply.error && !(*decoded->error == *reply.error))) {
    std::abort();
  }
  if (reply.probe && decoded->probe->titleItems.size() != reply.probe->titleItems.size()) {
    std::abort();
  }
}

void checkRequestRoundTrip(const quorvel::RCMediaRequest& request) {
  auto decoded = quorvel::RCMediaDecodeRequest(quorvel::RCMediaEncodeRequest(request));
  if (!decoded || decoded->id != request.id || decoded->kind != request.kind ||
      decoded->url != request.url || decoded->urls != request.urls ||
      decoded->segments.size() != request.segments.size()) {
    std::abort();
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const char* bytes = reinterpret_cast<const char*>(data);
  // The whole input as one message, as the reply decoder sees a frame body.
  if (auto reply = quorvel::RCMediaDecodeReply(std::string_view(bytes, size))) {
    checkRoundTrip(*reply);
  }
  if (auto request = quorvel::RCMediaDecodeRequest(std::string_view(bytes, size))) {
    checkRequestRoundTrip(*request);
  }
  // The input as a stream, read in chunks whose sizes its first byte picks.
  if (size == 0) return 0;
  const std::size_t chunk = 1 + data[0] % 64;
  quorvel::RCMediaFrameReader reader;
  for (std::size_t at = 1; at < size; at += chunk) {
    reader.append(bytes + at, std::min(chunk, size - at));
    for (;;) {
      auto body = reader.next();
      if (!body) return 0;  // over the limit: the daemon drops the worker
      if (!*body) break;
      if (auto reply = quorvel::RCMediaDecodeReply(**body)) checkRoundTrip(*reply);
    }
  }
  return 0;
}
