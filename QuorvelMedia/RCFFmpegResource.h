// RCFFmpegResource: the one owner type for FFmpeg's allocated objects. Each is
// a std::unique_ptr whose deleter calls the object's own free function, so a
// frame, packet, codec context, input, resampler, sample FIFO or parameter set is released
// exactly once on every path, and "out of memory" from an allocation is
// std::bad_alloc, as the rest of the code expects.
//
// Owned by whoever holds the pointer; FFmpeg objects are not synchronized,
// so each is used on one thread at a time.
#pragma once

#include <memory>
#include <new>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/audio_fifo.h>
#include <libswresample/swresample.h>
}

namespace quorvel {

// Frees through FFmpeg's `free(T**)` convention.
template <typename T, void (*Free)(T**)>
struct RCAVDeleter {
  void operator()(T* object) const { Free(&object); }
};
template <typename T, void (*Free)(T**)>
using RCAVPtr = std::unique_ptr<T, RCAVDeleter<T, Free>>;

using RCAVFramePtr = RCAVPtr<AVFrame, av_frame_free>;
using RCAVPacketPtr = RCAVPtr<AVPacket, av_packet_free>;
using RCAVCodecContextPtr = RCAVPtr<AVCodecContext, avcodec_free_context>;
using RCAVCodecParametersPtr = RCAVPtr<AVCodecParameters, avcodec_parameters_free>;
// An input opened with avformat_open_input().
using RCAVInputPtr = RCAVPtr<AVFormatContext, avformat_close_input>;
using RCSwrContextPtr = RCAVPtr<SwrContext, swr_free>;

// Frees through a plain `free(T*)`.
template <typename T, void (*Free)(T*)>
struct RCAVPlainDeleter {
  void operator()(T* object) const { Free(object); }
};
// An output made with avformat_alloc_output_context2(), with its file when
// one was opened.
struct RCAVOutputDeleter {
  void operator()(AVFormatContext* output) const {
    if (output->pb) avio_closep(&output->pb);
    avformat_free_context(output);
  }
};
using RCAVOutputPtr = std::unique_ptr<AVFormatContext, RCAVOutputDeleter>;
using RCAVAudioFifoPtr =
    std::unique_ptr<AVAudioFifo, RCAVPlainDeleter<AVAudioFifo, av_audio_fifo_free>>;

// Takes ownership of what an allocation returned; nullptr is out of memory.
template <typename Pointer>
Pointer RCAVOwn(typename Pointer::pointer object) {
  if (!object) throw std::bad_alloc();
  return Pointer(object);
}
inline RCAVFramePtr RCAVMakeFrame() { return RCAVOwn<RCAVFramePtr>(av_frame_alloc()); }
inline RCAVPacketPtr RCAVMakePacket() { return RCAVOwn<RCAVPacketPtr>(av_packet_alloc()); }

}  // namespace quorvel
