// RCAudioDecoder: the first audio stream of a file, read packet by packet
// (libavformat) and, when asked, decoded (libavcodec, one thread).
//
// Owned by one user and used on one thread at a time; not synchronized.
// A failure of the data is an Error in kRCMediaErrorDomain: CannotOpen for
// an unrecognised file, NoAudioStream, DecodeFailed, Truncated. A failure to
// read at all (a missing file, EIO, EACCES, ENOMEM) is a POSIX error.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include "QuorvelMedia/RCFFmpegResource.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

class RCAudioDecoder {
 public:
  // Opens `url` and finds its audio stream. The stream's parameters are
  // probed by decoding a little only when the header leaves them incomplete.
  static platform::Result<std::unique_ptr<RCAudioDecoder>> open(const platform::URL& url);
  RCAudioDecoder(const RCAudioDecoder&) = delete;
  RCAudioDecoder& operator=(const RCAudioDecoder&) = delete;

  const platform::URL& url() const { return url_; }
  AVStream* stream() const { return stream_; }
  const AVCodecParameters* codecParameters() const;
  // The duration the container declares for the stream (or the file), in
  // seconds; 0 when it declares none.
  double declaredDurationSeconds() const;

  // Reads the next packet of the audio stream into `packet` (other streams'
  // packets are skipped). Returns false at the end of the file.
  platform::Result<bool> readPacket(AVPacket* packet);

  // Opens the codec (once). Needed before decode().
  platform::Status openCodec();
  using FrameHandler = std::function<platform::Status(AVFrame* frame)>;
  // Sends `packet` (nullptr: drain at the end) and hands every frame the
  // codec returns to `handler`, whose failure stops and is returned.
  platform::Status decode(const AVPacket* packet, const FrameHandler& handler);
  // Reads and decodes the whole stream from where it stands, then drains.
  // `cancelled`, when given, is asked before each packet; once it answers
  // true the decoding stops with a DecodeFailed error "cancelled".
  platform::Status decodeAll(const FrameHandler& handler,
                             const std::function<bool()>& cancelled = {});

 private:
  RCAudioDecoder(platform::URL url, RCAVInputPtr format, AVStream* stream);
  platform::URL url_;
  RCAVInputPtr format_;
  AVStream* stream_ = nullptr;
  RCAVCodecContextPtr codec_;
  RCAVFramePtr frame_;
  bool draining_ = false;
};

}  // namespace quorvel
