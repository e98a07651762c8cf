// The media worker's protocol: how the daemon (RCMediaWorkerClient) and the
// quorvel-media process talk over their socket.
//
// Every message is a frame: a 4-byte little-endian length, then that many
// bytes of JSON. Both sides refuse a frame longer than kRCMediaMaxFrameBytes
// before reading its body, so a broken or hostile peer cannot make the other
// allocate without bound. URLs travel as percent-encoded file URL strings (any
// byte of a Linux file name survives); other text is UTF-8, invalid sequences
// replaced.
//
// Requests: {"id": N, "job": "probe"|"probeMany"|"compose"|"waveform"|"writeTitle", ...}
//   probe:      "url"
//   probeMany:  "urls": [...] (1 to kRCMediaMaxProbeBatch file URLs)
//   compose:    "segments": [{"url", "start", "duration"}...], "destination",
//               "waveform" (a URL, or null for none)
//   waveform:   "url" (the audio), "destination"
//   writeTitle: "url", "title", "language"
// Replies, each naming the request's id; a job gets any number of progress
// replies, then exactly one result or error:
//   {"id": N, "progress": 0.25}
//   {"id": N, "result": {}}   (a probe's result holds the probe's fields)
//   {"id": N, "error": {"domain": "...", "code": 4, "message": "..."}}
// An error object may carry the error it wraps as "underlying", an error
// object without one of its own (a compose that blames one segment:
// RCComposerSegmentError, whose code is the segment's index).
// A probeMany job answers each file, in order, with an item reply of its
// own, which also counts as progress; then an empty result ends the job:
//   {"id": N, "item": {"index": I, "result": {probe fields}}}
//   {"id": N, "item": {"index": I, "error": {...}}}
// Each file's answer is a frame of its own, so a batch's frames are as small
// as a single probe's, and a worker that dies mid-batch has already handed
// over the answers before the file it died on.
//
// Pure functions and value types; any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Quorvel/media/RCMediaEngine.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

inline constexpr std::size_t kRCMediaMaxFrameBytes = 1 << 20;
// The most files one probeMany request names. With every path at PATH_MAX,
// each byte percent-encoded, the request still fits in a frame.
inline constexpr std::size_t kRCMediaMaxProbeBatch = 64;
static_assert(kRCMediaMaxProbeBatch * (3 * 4096 + 64) < kRCMediaMaxFrameBytes);

// The bytes of one frame holding `body`.
std::string RCMediaEncodeFrame(std::string_view body);

// Splits a byte stream into frame bodies. Owned and used by one thread.
class RCMediaFrameReader {
 public:
  void append(const char* data, std::size_t size);
  // The next complete frame's body; nullopt when the bytes so far hold none.
  // Fails, for good, when a frame announces more than kRCMediaMaxFrameBytes.
  platform::Result<std::optional<std::string>> next();
  // Bytes received but not yet returned as frames.
  std::size_t pendingBytes() const { return buffer_.size() - offset_; }

 private:
  std::string buffer_;
  std::size_t offset_ = 0;
};

enum class RCMediaJobKind { Probe, ProbeMany, Compose, Waveform, WriteTitle };

// The name of a job kind on the wire ("probe", ...).
const char* RCMediaJobKindName(RCMediaJobKind kind);

struct RCMediaRequest {
  std::uint64_t id = 0;
  RCMediaJobKind kind = RCMediaJobKind::Probe;
  // probe, waveform and writeTitle: the file; compose: the destination.
  platform::URL url = platform::URL::fileURLWithPath("/");
  // probeMany: the files, in order (not `url`, which is not sent).
  std::vector<platform::URL> urls;
  // compose: the segments.
  std::vector<RCComposerSegment> segments;
  // compose: the waveform's destination, if any; waveform: the destination.
  std::optional<platform::URL> destination;
  // writeTitle.
  std::string title;
  std::string language;
};

std::string RCMediaEncodeRequest(const RCMediaRequest& request);
// Fails (RCMediaErrorCodeInvalidArgument) for anything but a well-formed request.
platform::Result<RCMediaRequest> RCMediaDecodeRequest(std::string_view body);

struct RCMediaReply {
  enum class Kind { Progress, Item, Result, Error };
  std::uint64_t id = 0;
  Kind kind = Kind::Result;
  double progress = 0;                   // Progress: in [0, 1]
  std::size_t index = 0;                 // Item: below kRCMediaMaxProbeBatch
  std::optional<RCMediaProbe> probe;     // Result of a probe; Item that probed
  std::optional<platform::Error> error;  // Error; Item that failed
};

std::string RCMediaEncodeProgress(std::uint64_t id, double fraction);
// `probe` for a probe's result, nullptr for the other jobs.
std::string RCMediaEncodeResult(std::uint64_t id, const RCMediaProbe* probe);
std::string RCMediaEncodeError(std::uint64_t id, const platform::Error& error);
// The answer for the file at `index` of a probeMany request.
std::string RCMediaEncodeItem(std::uint64_t id, std::size_t index,
                              const platform::Result<RCMediaProbe>& probe);
// Fails (RCMediaErrorCodeWorkerFailed) for anything but a well-formed reply.
platform::Result<RCMediaReply> RCMediaDecodeReply(std::string_view body);

}  // namespace quorvel
