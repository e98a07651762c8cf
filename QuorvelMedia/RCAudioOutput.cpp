#include "QuorvelMedia/RCAudioOutput.h"

#include <algorithm>
#include <cctype>
#include <new>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
}

#include "Quorvel/errors/RCErrors.h"
#include "QuorvelMedia/RCFFmpegLogging.h"

namespace quorvel {
namespace {

std::string lowercase(std::string_view text) {
  std::string out(text);
  std::transform(out.begin(), out.end(), out.begin(),
                 [](unsigned char c) { return char(std::tolower(c)); });
  return out;
}

const char* muxerNameFor(std::string_view extension) {
  const std::string ext = lowercase(extension);
  if (ext == "m4a") return "ipod";
  if (ext == "flac") return "flac";
  if (ext == "wav") return "wav";
  return nullptr;
}

}  // namespace

bool RCAudioOutput::supportsExtension(std::string_view extension) {
  return muxerNameFor(extension) != nullptr;
}

RCAudioOutput::RCAudioOutput(RCAVOutputPtr format, AVStream* stream, std::string path)
    : format_(std::move(format)), stream_(stream), path_(std::move(path)) {}

RCAudioOutput::~RCAudioOutput() = default;

platform::Result<std::unique_ptr<RCAudioOutput>> RCAudioOutput::open(
    const std::string& path, std::string_view extension, const AVCodecParameters* parameters) {
  RCInstallFFmpegLogging();
  const char* muxer = muxerNameFor(extension);
  if (!muxer)
    return platform::fail(RCMediaError(RCMediaErrorCodeUnsupportedFormat,
                                       fmt::format("no audio container for \".{}\"", extension)));
  AVFormatContext* allocated = nullptr;
  int result = avformat_alloc_output_context2(&allocated, nullptr, muxer, nullptr);
  if (result < 0 || !allocated)
    return platform::fail(
        RCMediaErrorFromAV(RCMediaErrorCodeUnsupportedFormat, result, "cannot set up the muxer"));
  RCAVOutputPtr owned(allocated);
  AVFormatContext* format = owned.get();
  AVStream* stream = avformat_new_stream(format, nullptr);
  if (!stream) throw std::bad_alloc();
  std::unique_ptr<RCAudioOutput> output(new RCAudioOutput(std::move(owned), stream, path));
  result = avcodec_parameters_copy(stream->codecpar, parameters);
  if (result < 0) throw std::bad_alloc();
  stream->codecpar->codec_tag = 0;
  stream->time_base = AVRational{1, parameters->sample_rate};
  if (avformat_query_codec(format->oformat, parameters->codec_id, FF_COMPLIANCE_NORMAL) != 1)
    return platform::fail(RCMediaError(RCMediaErrorCodeUnsupportedFormat,
                                       fmt::format("\".{}\" files cannot hold {} audio", extension,
                                                   avcodec_get_name(parameters->codec_id))));
  result = avio_open(&format->pb, path.c_str(), AVIO_FLAG_WRITE);
  if (result < 0)
    return platform::fail(
        RCMediaErrorFromAV(RCMediaErrorCodeFileSystem, result, "cannot open " + path));
  return output;
}

AVCodecParameters* RCAudioOutput::mutableCodecParameters() { return stream_->codecpar; }

void RCAudioOutput::setMetadata(const std::string& key, const std::string& value) {
  av_dict_set(&format_->metadata, key.c_str(), value.c_str(), 0);
}

platform::Status RCAudioOutput::writeHeaderOnce() {
  if (headerWritten_) return {};
  AVDictionary* options = nullptr;
  // The files are ours alone: no encoder tag that changes with the library version.
  av_dict_set(&options, "fflags", "+bitexact", 0);
  const int result = avformat_write_header(format_.get(), &options);
  av_dict_free(&options);
  if (result < 0)
    return platform::fail(
        RCMediaErrorFromAV(RCMediaErrorCodeEncodeFailed, result, "cannot write the header"));
  headerWritten_ = true;
  return {};
}

platform::Status RCAudioOutput::writePacket(AVPacket* packet) {
  if (auto header = writeHeaderOnce(); !header) {
    av_packet_unref(packet);
    return header;
  }
  packet->stream_index = stream_->index;
  // The muxer may have chosen its own time base when writing the header.
  av_packet_rescale_ts(packet, AVRational{1, stream_->codecpar->sample_rate}, stream_->time_base);
  const int result = av_write_frame(format_.get(), packet);
  av_packet_unref(packet);
  if (result < 0)
    return platform::fail(
        RCMediaErrorFromAV(RCMediaErrorCodeEncodeFailed, result, "cannot write audio"));
  return {};
}

platform::Status RCAudioOutput::finish() {
  if (finished_) return {};
  if (auto header = writeHeaderOnce(); !header) return header;
  finished_ = true;
  int result = av_write_trailer(format_.get());
  const int closed = avio_closep(&format_->pb);
  if (result >= 0) result = closed;
  if (result < 0)
    return platform::fail(
        RCMediaErrorFromAV(RCMediaErrorCodeEncodeFailed, result, "cannot finish " + path_));
  return {};
}

}  // namespace quorvel
