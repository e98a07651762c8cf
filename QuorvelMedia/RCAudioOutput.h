// RCAudioOutput: an audio file being written (libavformat): one audio stream
// in the container that the file extension names (m4a, flac, wav), written to
// a given path (normally an RCAtomicFile's temporary file).
//
// Owned by one user and used on one thread at a time; not synchronized.
// Failures are Errors in kRCMediaErrorDomain (UnsupportedFormat, EncodeFailed).
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "QuorvelMedia/RCFFmpegResource.h"
#include "platform/Error.h"

namespace quorvel {

class RCAudioOutput {
 public:
  // Whether this file extension (without the dot, any case) names a
  // container the framework writes.
  static bool supportsExtension(std::string_view extension);

  // Opens `path` for writing a container of kind `extension`, with one
  // stream described by `parameters` (copied) and time base 1/sample rate.
  // The header is written by the first writePacket() or by finish().
  static platform::Result<std::unique_ptr<RCAudioOutput>> open(const std::string& path,
                                                               std::string_view extension,
                                                               const AVCodecParameters* parameters);
  ~RCAudioOutput();
  RCAudioOutput(const RCAudioOutput&) = delete;
  RCAudioOutput& operator=(const RCAudioOutput&) = delete;

  AVStream* stream() const { return stream_; }
  // Sets a container metadata entry ("creation_time", "title"); before the
  // header is written.
  void setMetadata(const std::string& key, const std::string& value);
  // Lets the caller adjust the stream's parameters before the header is written.
  AVCodecParameters* mutableCodecParameters();

  // Writes one packet whose timestamps count audio frames (time base
  // 1/sample rate, whatever the muxer chose for the file). Takes
  // the packet's reference (the packet is left blank).
  platform::Status writePacket(AVPacket* packet);
  // Writes the trailer and closes the file.
  platform::Status finish();

 private:
  RCAudioOutput(RCAVOutputPtr format, AVStream* stream, std::string path);
  platform::Status writeHeaderOnce();
  RCAVOutputPtr format_;
  AVStream* stream_ = nullptr;
  std::string path_;
  bool headerWritten_ = false;
  bool finished_ = false;
};

}  // namespace quorvel
