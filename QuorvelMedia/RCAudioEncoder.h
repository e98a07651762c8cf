// RCAudioEncoder: encodes PCM audio into a new file (libavcodec +
// RCAudioOutput). The codec follows the container the extension names: AAC
// for m4a, FLAC for flac, PCM for wav; rate, channels, bit depth and (for
// AAC) bit rate follow a model stream, normally the first fragment's.
//
// Owned by one user and used on one thread at a time; not synchronized.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "QuorvelMedia/RCFFmpegResource.h"
#include "platform/Error.h"

namespace quorvel {

class RCAudioOutput;

class RCAudioEncoder {
 public:
  static platform::Result<std::unique_ptr<RCAudioEncoder>> open(const std::string& path,
                                                                std::string_view extension,
                                                                const AVCodecParameters* model);
  ~RCAudioEncoder();
  RCAudioEncoder(const RCAudioEncoder&) = delete;
  RCAudioEncoder& operator=(const RCAudioEncoder&) = delete;

  // What write() takes.
  AVSampleFormat sampleFormat() const;
  int sampleRate() const;
  const AVChannelLayout& channelLayout() const;

  // Adds `count` frames in sampleFormat()'s layout (planes or one interleaved plane).
  platform::Status write(const std::uint8_t* const* data, int count);
  // Encodes what is buffered, drains the codec and finishes the file.
  platform::Status finish();
  // Frames written so far.
  std::int64_t framesWritten() const { return framesIn_; }

  // The file it writes into (for its metadata, before the first frame).
  RCAudioOutput& output() { return *output_; }

 private:
  RCAudioEncoder() = default;
  platform::Status encodeFromFifo(bool final);
  platform::Status encodeFrame(AVFrame* frame);

  RCAVCodecContextPtr codec_;
  std::unique_ptr<RCAudioOutput> output_;
  RCAVAudioFifoPtr fifo_;
  RCAVFramePtr frame_;
  RCAVPacketPtr packet_;
  int frameSize_ = 0;
  std::int64_t framesIn_ = 0;
  std::int64_t nextPts_ = 0;
};

}  // namespace quorvel
