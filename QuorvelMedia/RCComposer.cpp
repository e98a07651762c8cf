// Composing, in detail.
//
// Stream copy. Every fragment is opened first; the copy is taken only when all
// of them are AAC with byte-identical decoder setup (rate, channels, profile,
// extradata) and the target is m4a. Packets are selected by timestamp: those
// overlapping [contentStart, contentStart + contentDuration) plus the one just
// before (the "pre-roll"). AAC frames overlap their neighbours, so a packet
// decodes correctly only after its predecessor; copying the predecessor keeps
// the first used frame of each later fragment clean, and the join is the one
// pre-roll frame, where the previous fragment's tail fades into this one's.
//
// Output timestamps run on without gaps, one frame per packet: a fragment's
// short last packet still decodes to a whole frame, so it is counted as one
// (the container's duration then equals what a decoder produces). Only the
// very last packet of the output keeps a shorter duration, trimmed to the end
// of the last range. The first fragment's packets are placed so that its range
// start is time 0: its pre-roll and the part of its first packet before the
// range have negative times, which the muxer turns into an edit list that
// players skip. So the first range starts exactly, later ranges start on a
// frame boundary with one pre-roll frame, and each range ends on a frame
// boundary.
//
// Re-encoding. Each fragment is decoded from its start, trimmed to the sample,
// converted to the output's rate, channels and sample format (that of the
// first fragment, in the codec the target's container calls for) and fed
// through a FIFO into the encoder in its frame size.
//
// Waveform. Built from the audio as it goes into the output: in the re-encode
// path from the converted samples, in the copy path by decoding the copied
// packets in output order with their output timestamps, which is exactly what
// a player decoding the composed file hears (edit list included).
#include "QuorvelMedia/RCComposer.h"

#include <sys/stat.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>
#include <memory>
#include <new>
#include <optional>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libswresample/swresample.h>
}

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFileStatus.h"
#include "Quorvel/files/RCReplacementFile.h"
#include "Quorvel/waveform/RCWaveformFile.h"
#include "QuorvelMedia/RCAudioDecoder.h"
#include "QuorvelMedia/RCAudioEncoder.h"
#include "QuorvelMedia/RCAudioOutput.h"
#include "QuorvelMedia/RCFFmpegLogging.h"
#include "QuorvelMedia/RCFFmpegResource.h"
#include "QuorvelMedia/RCMP4Atoms.h"
#include "QuorvelMedia/RCMediaInput.h"
#include "QuorvelMedia/RCWaveformBuilder.h"
#include "platform/Log.h"

namespace quorvel {
namespace {

using PacketPtr = RCAVPacketPtr;
PacketPtr makePacket() { return RCAVMakePacket(); }

// One segment's fragment. The first kOpenFragments stay open from the start
// (opening a long fragment parses its whole index, so most recordings are
// opened once); the others are opened only while they are composed, so a
// recording of hundreds of fragments holds a bounded number of files open.
// The codec parameters, read when composing starts, stay.
constexpr std::size_t kOpenFragments = 16;

struct Input {
  RCComposerSegment segment;
  RCAVCodecParametersPtr parameters;
  std::unique_ptr<RCAudioDecoder> decoder;

  platform::Status open() {
    if (decoder) return {};
    auto opened = RCAudioDecoder::open(segment.fragmentURL);
    if (!opened) return platform::fail(opened.error());
    decoder = std::move(*opened);
    return {};
  }
};

// Reports how much of the segments' total length has been composed.
class Progress {
 public:
  Progress(const RCComposerProgress& report, const std::vector<RCComposerSegment>& segments)
      : report_(report) {
    for (const RCComposerSegment& segment : segments) total_ += segment.contentDuration;
  }
  // `seconds` into the used range of `input`, which follows every segment
  // finished before.
  // Reports in steps of a thousandth at most: it runs once per packet.
  void at(const Input& input, double seconds) {
    if (!report_ || !(total_ > 0)) return;
    const double fraction =
        (done_ + std::clamp(seconds, 0.0, input.segment.contentDuration)) / total_;
    if (fraction < reported_ + 0.001 && fraction < 1) return;
    reported_ = fraction;
    report_(fraction);
  }
  void finished(const Input& input) { done_ += input.segment.contentDuration; }

 private:
  const RCComposerProgress& report_;
  double total_ = 0;
  double done_ = 0;
  double reported_ = -1;
};

std::string lowercase(std::string text) {
  std::transform(text.begin(), text.end(), text.begin(),
                 [](unsigned char c) { return char(std::tolower(c)); });
  return text;
}

bool sameDecoderSetup(const AVCodecParameters* a, const AVCodecParameters* b) {
  return a->codec_id == b->codec_id && a->sample_rate == b->sample_rate &&
         av_channel_layout_compare(&a->ch_layout, &b->ch_layout) == 0 && a->profile == b->profile &&
         a->extradata_size == b->extradata_size &&
         (a->extradata_size == 0 ||
          std::memcmp(a->extradata, b->extradata, a->extradata_size) == 0);
}

bool canCopy(const std::string& extension, const std::vector<Input>& inputs) {
  if (extension != "m4a") return false;
  const AVCodecParameters* first = inputs.front().parameters.get();
  if (first->codec_id != AV_CODEC_ID_AAC || first->extradata_size <= 0) return false;
  return std::all_of(inputs.begin(), inputs.end(), [first](const Input& input) {
    return sameDecoderSetup(first, input.parameters.get());
  });
}

// How far short of its range a fragment's audio may end before it counts as
// truncated: rounding of durations to codec frames, not missing audio.
std::int64_t shortfallTolerance(int rate, std::int64_t frameSize) {
  return std::max<std::int64_t>(2 * frameSize, rate / 20);
}

// A failure while the segment at `index` was read. When it is the media
// engine's verdict on that fragment's audio (RCIsAudioDataError), it names
// the segment, so the caller can leave that fragment out and compose the
// rest; a failure to read at all (I/O, memory) stays as it is.
platform::Status blamingSegment(platform::Status status, std::size_t index) {
  if (status || !RCIsAudioDataError(status.error())) return status;
  return platform::fail(RCComposerSegmentError(index, status.error()));
}

platform::Error truncatedError(const Input& input, double endSeconds) {
  return RCMediaError(RCMediaErrorCodeTruncated,
                      fmt::format("{} ends at {:.3f}s, before the end of its range at {:.3f}s",
                                  input.segment.fragmentURL.lastPathComponent(), endSeconds,
                                  input.segment.contentStart + input.segment.contentDuration));
}

// --- Stream copy -----------------------------------------------------------

class StreamCopier {
 public:
  StreamCopier(RCAudioOutput& output, const AVCodecParameters* parameters,
               RCWaveformBuilder* waveform)
      : output_(output),
        rate_(parameters->sample_rate),
        frameSize_(parameters->frame_size > 0 ? parameters->frame_size : 1024),
        waveform_(waveform),
        held_(makePacket()) {}

  platform::Status openWaveformDecoder(const AVCodecParameters* parameters) {
    if (!waveform_) return {};
    const AVCodec* codec = avcodec_find_decoder(parameters->codec_id);
    if (!codec) return platform::fail(RCMediaError(RCMediaErrorCodeDecodeFailed, "no AAC decoder"));
    waveformDecoder_ = RCAVOwn<RCAVCodecContextPtr>(avcodec_alloc_context3(codec));
    frame_ = RCAVMakeFrame();
    avcodec_parameters_to_context(waveformDecoder_.get(), parameters);
    waveformDecoder_->pkt_timebase = AVRational{1, rate_};
    waveformDecoder_->thread_count = 1;
    const int result = avcodec_open2(waveformDecoder_.get(), codec, nullptr);
    if (result < 0)
      return platform::fail(
          RCMediaErrorFromAV(RCMediaErrorCodeDecodeFailed, result, "cannot open the decoder"));
    return {};
  }

  platform::Status copy(Input& input, bool isFirst, Progress& progress) {
    RCAudioDecoder& decoder = *input.decoder;
    const AVRational streamBase = decoder.stream()->time_base;
    const AVRational base{1, rate_};
    const std::int64_t start = std::llround(input.segment.contentStart * rate_);
    const std::int64_t end =
        std::llround((input.segment.contentStart + input.segment.contentDuration) * rate_);
    PacketPtr packet = makePacket();
    PacketPtr previous = makePacket();
    bool havePrevious = false;
    bool inRange = false;
    std::int64_t reachedEnd = std::numeric_limits<std::int64_t>::min();
    for (;;) {
      auto more = decoder.readPacket(packet.get());
      if (!more) return platform::fail(more.error());
      if (!*more) break;
      av_packet_rescale_ts(packet.get(), streamBase, base);
      const std::int64_t pts = packet->pts != AV_NOPTS_VALUE ? packet->pts : packet->dts;
      if (pts == AV_NOPTS_VALUE) {
        av_packet_unref(packet.get());
        return platform::fail(RCMediaError(
            RCMediaErrorCodeDecodeFailed,
            input.segment.fragmentURL.lastPathComponent() + " has audio without timestamps"));
      }
      const std::int64_t duration = packet->duration > 0 ? packet->duration : frameSize_;
      packet->pts = pts;
      if (pts + duration <= start) {
        std::swap(packet, previous);
        av_packet_unref(packet.get());
        havePrevious = true;
        continue;
      }
      if (pts >= end) {
        av_packet_unref(packet.get());
        break;
      }
      if (!inRange) {
        inRange = true;
        if (isFirst) nextPts_ = (havePrevious ? previous->pts : pts) - start;
        if (havePrevious) {
          if (auto sent =
                  push(previous.get(), previous->duration > 0 ? previous->duration : frameSize_,
                       std::numeric_limits<std::int64_t>::max());
              !sent)
            return sent;
        }
      }
      reachedEnd = pts + duration;
      progress.at(input, double(pts - start) / rate_);
      if (auto sent = push(packet.get(), duration, end - pts); !sent) return sent;
    }
    if (!inRange) return platform::fail(truncatedError(input, 0.0));
    if (reachedEnd < end - shortfallTolerance(rate_, frameSize_))
      return platform::fail(truncatedError(input, double(reachedEnd) / rate_));
    return {};
  }

  // Writes the held-back packet as the output's last one.
  platform::Status finish() {
    if (!haveHeld_)
      return platform::fail(RCMediaError(RCMediaErrorCodeInvalidArgument, "nothing to compose"));
    held_->duration = std::clamp<std::int64_t>(std::min(heldDuration_, heldRoom_), 1, frameSize_);
    endPts_ = held_->pts + held_->duration;
    if (auto written = write(held_.get(), true); !written) return written;
    haveHeld_ = false;
    return output_.finish();
  }

  double composedSeconds() const { return double(endPts_) / rate_; }

 private:
  // Takes `packet`'s content and holds it back until the next one arrives;
  // `duration` is its own length, `room` how much of it the range still uses.
  platform::Status push(AVPacket* packet, std::int64_t duration, std::int64_t room) {
    if (haveHeld_) {
      if (auto written = write(held_.get(), false); !written) return written;
    }
    av_packet_unref(held_.get());
    av_packet_move_ref(held_.get(), packet);
    held_->pts = held_->dts = nextPts_;
    held_->duration = frameSize_;
    held_->pos = -1;
    heldDuration_ = duration;
    heldRoom_ = room;
    haveHeld_ = true;
    nextPts_ += frameSize_;
    return {};
  }

  platform::Status write(AVPacket* packet, bool last) {
    if (waveformDecoder_) {
      if (auto decoded = decodeForWaveform(packet, last); !decoded) return decoded;
    }
    return output_.writePacket(packet);
  }

  platform::Status decodeForWaveform(const AVPacket* packet, bool last) {
    PacketPtr copy = makePacket();
    if (av_packet_ref(copy.get(), packet) < 0) throw std::bad_alloc();
    // The output's timeline decides what is heard, not the fragment's trims
    // (its skip side data, its priming packets marked for discarding).
    av_packet_free_side_data(copy.get());
    copy->flags &= ~AV_PKT_FLAG_DISCARD;
    const std::int64_t limit = last ? endPts_ : std::numeric_limits<std::int64_t>::max();
    int result = avcodec_send_packet(waveformDecoder_.get(), copy.get());
    if (last && result >= 0) result = avcodec_send_packet(waveformDecoder_.get(), nullptr);
    if (result < 0 && result != AVERROR_INVALIDDATA)
      return platform::fail(
          RCMediaErrorFromAV(RCMediaErrorCodeDecodeFailed, result, "cannot decode audio"));
    for (;;) {
      result = avcodec_receive_frame(waveformDecoder_.get(), frame_.get());
      if (result == AVERROR(EAGAIN) || result == AVERROR_EOF) return {};
      if (result == AVERROR_INVALIDDATA) continue;
      if (result < 0)
        return platform::fail(
            RCMediaErrorFromAV(RCMediaErrorCodeDecodeFailed, result, "cannot decode audio"));
      const std::int64_t first = frame_->pts != AV_NOPTS_VALUE ? frame_->pts : decodedUntil_;
      const std::int64_t from =
          std::max<std::int64_t>(first, std::max<std::int64_t>(0, decodedUntil_));
      const std::int64_t to = std::min<std::int64_t>(first + frame_->nb_samples, limit);
      if (to > from) waveform_->append(frame_.get(), int(from - first), int(to - from));
      decodedUntil_ = std::max(decodedUntil_, to);
      av_frame_unref(frame_.get());
    }
  }

  RCAudioOutput& output_;
  const int rate_;
  const std::int64_t frameSize_;
  RCWaveformBuilder* waveform_;
  RCAVCodecContextPtr waveformDecoder_;
  RCAVFramePtr frame_;
  PacketPtr held_;
  bool haveHeld_ = false;
  std::int64_t heldDuration_ = 0;
  std::int64_t heldRoom_ = 0;
  std::int64_t nextPts_ = 0;
  std::int64_t endPts_ = std::numeric_limits<std::int64_t>::max();
  std::int64_t decodedUntil_ = 0;
};

// What a recording's composed file keeps across composes: its capture date
// (the old composed file's, else the first fragment's) and its titles. An
// m4a keeps every language-tagged title through the atom writer; other
// containers keep the untagged title through the muxer.
struct KeptMetadata {
  std::optional<std::string> creationTime;
  std::optional<std::string> title;

  void applyTo(RCAudioOutput& output) const {
    if (creationTime) output.setMetadata("creation_time", *creationTime);
    if (title) output.setMetadata("title", *title);
  }
};

KeptMetadata readKeptMetadata(const std::string& path) {
  KeptMetadata kept;
  AVFormatContext* opened = nullptr;
  if (RCOpenMediaInput(&opened, path.c_str()) < 0) return kept;
  RCAVInputPtr input(opened);
  if (const AVDictionaryEntry* entry = av_dict_get(input->metadata, "creation_time", nullptr, 0))
    kept.creationTime = entry->value;
  if (const AVDictionaryEntry* entry = av_dict_get(input->metadata, "title", nullptr, 0))
    kept.title = entry->value;
  return kept;
}

KeptMetadata keptMetadataFor(const platform::URL& destination,
                             const std::vector<RCComposerSegment>& segments) {
  KeptMetadata kept;
  if (RCFileStatus::atPathFollowing(destination.path()).isRegularFile())
    kept = readKeptMetadata(destination.path());
  if (!kept.creationTime)
    kept.creationTime = readKeptMetadata(segments.front().fragmentURL.path()).creationTime;
  // An m4a's titles travel through the atoms after muxing, every language.
  if (lowercase(destination.pathExtension()) == "m4a") kept.title.reset();
  return kept;
}

// Commits the composed file, carrying the titles of the file it replaces
// into it first (m4a). A title that cannot be carried over fails the
// compose: committing without it would lose it with the old file. A title
// written meanwhile replaces the file under us; the commit then fails as
// changed, and the titles are read again.
platform::Status commitKeepingTitles(RCReplacementFile& file, const platform::URL& destination,
                                     const std::string& extension) {
  constexpr int kAttempts = 5;
  for (int attempt = 0;; ++attempt) {
    const RCFileStatus old = RCFileStatus::atPath(destination.path());
    if (!old.isRegularFile()) return file.commit();
    if (extension == "m4a") {
      auto titles = RCMP4ReadTitleItems(destination.path());
      for (const RCMetadataItem& item : titles ? *titles : std::vector<RCMetadataItem>()) {
        if (auto written = RCMP4WriteTitle(file.tempPath(), item.stringValue, item.language);
            !written) {
          QV_LOG(platform::kLogLevelError, "ERROR: cannot keep a title of {}: {}",
                 destination.lastPathComponent(), written.error());
          return written;
        }
      }
    }
    auto committed = file.commitReplacing({old.info.st_dev, old.info.st_ino});
    if (committed || attempt + 1 == kAttempts || committed.error().domain() != RCErrorDomain ||
        committed.error().code() != RCErrorCodeChangedMeanwhile) {
      return committed;
    }
  }
}

platform::Status composeByCopy(std::vector<Input>& inputs, const std::string& path,
                               const std::string& extension, const KeptMetadata& kept,
                               RCWaveformBuilder* waveform, Progress& progress,
                               double* composedSeconds) {
  const AVCodecParameters* parameters = inputs.front().parameters.get();
  auto output = RCAudioOutput::open(path, extension, parameters);
  if (!output) return platform::fail(output.error());
  kept.applyTo(**output);
  StreamCopier copier(**output, parameters, waveform);
  if (auto opened = copier.openWaveformDecoder(parameters); !opened) return opened;
  for (std::size_t i = 0; i < inputs.size(); ++i) {
    if (auto opened = inputs[i].open(); !opened) return blamingSegment(opened, i);
    if (auto copied = copier.copy(inputs[i], i == 0, progress); !copied)
      return blamingSegment(copied, i);
    inputs[i].decoder.reset();
    progress.finished(inputs[i]);
  }
  if (auto finished = copier.finish(); !finished) return finished;
  *composedSeconds = copier.composedSeconds();
  return {};
}

// --- Re-encoding -----------------------------------------------------------

class Converter {
 public:
  Converter(RCAudioEncoder& encoder, RCWaveformBuilder* waveform)
      : encoder_(encoder), waveform_(waveform) {}
  ~Converter() {
    if (buffer_) av_freep(&buffer_[0]);
    av_freep(&buffer_);
  }

  // Prepares for frames like `frame`.
  platform::Status configure(const AVFrame* frame) {
    swr_.reset();
    inFormat_ = AVSampleFormat(frame->format);
    inRate_ = frame->sample_rate;
    inChannels_ = frame->ch_layout.nb_channels;
    AVChannelLayout inLayout{};
    if (frame->ch_layout.order == AV_CHANNEL_ORDER_NATIVE)
      av_channel_layout_copy(&inLayout, &frame->ch_layout);
    else
      av_channel_layout_default(&inLayout, inChannels_);
    passThrough_ = inFormat_ == encoder_.sampleFormat() && inRate_ == encoder_.sampleRate() &&
                   av_channel_layout_compare(&inLayout, &encoder_.channelLayout()) == 0;
    int result = 0;
    if (!passThrough_) {
      SwrContext* swr = nullptr;
      result = swr_alloc_set_opts2(&swr, const_cast<AVChannelLayout*>(&encoder_.channelLayout()),
                                   encoder_.sampleFormat(), encoder_.sampleRate(), &inLayout,
                                   inFormat_, inRate_, 0, nullptr);
      swr_.reset(swr);
      if (result >= 0) result = swr_init(swr_.get());
    }
    av_channel_layout_uninit(&inLayout);
    if (result < 0)
      return platform::fail(RCMediaErrorFromAV(RCMediaErrorCodeDecodeFailed, result,
                                               "cannot convert the fragment's audio"));
    return {};
  }

  bool matches(const AVFrame* frame) const {
    return frame->format == inFormat_ && frame->sample_rate == inRate_ &&
           frame->ch_layout.nb_channels == inChannels_;
  }

  // Converts frames [offset, offset + count) of `frame` into the encoder.
  platform::Status push(const AVFrame* frame, int offset, int count) {
    const int bytes = av_get_bytes_per_sample(inFormat_);
    const bool planar = av_sample_fmt_is_planar(inFormat_);
    std::vector<const std::uint8_t*> planes(planar ? inChannels_ : 1);
    for (std::size_t i = 0; i < planes.size(); ++i)
      planes[i] =
          frame->extended_data[i] + std::size_t(offset) * bytes * (planar ? 1 : inChannels_);
    if (passThrough_) return emit(planes.data(), count);
    return convert(planes.data(), count);
  }

  // Flushes what the resampler still holds.
  platform::Status drain() {
    if (passThrough_ || !swr_) return {};
    return convert(nullptr, 0);
  }

 private:
  platform::Status convert(const std::uint8_t* const* planes, int count) {
    for (;;) {
      const int capacity = std::max(swr_get_out_samples(swr_.get(), count), 256);
      ensureCapacity(capacity);
      const int produced = swr_convert(swr_.get(), buffer_, capacity,
                                       const_cast<const std::uint8_t**>(planes), count);
      if (produced < 0)
        return platform::fail(RCMediaErrorFromAV(RCMediaErrorCodeDecodeFailed, produced,
                                                 "cannot convert the fragment's audio"));
      if (produced > 0) {
        if (auto emitted = emit(buffer_, produced); !emitted) return emitted;
      }
      if (planes || produced == 0) return {};
    }
  }

  platform::Status emit(const std::uint8_t* const* planes, int count) {
    if (waveform_)
      waveform_->append(planes, encoder_.sampleFormat(), encoder_.channelLayout().nb_channels, 0,
                        count);
    return encoder_.write(planes, count);
  }

  void ensureCapacity(int samples) {
    if (samples <= capacity_) return;
    if (buffer_) av_freep(&buffer_[0]);
    av_freep(&buffer_);
    if (av_samples_alloc_array_and_samples(&buffer_, nullptr, encoder_.channelLayout().nb_channels,
                                           samples, encoder_.sampleFormat(), 0) < 0)
      throw std::bad_alloc();
    capacity_ = samples;
  }

  RCAudioEncoder& encoder_;
  RCWaveformBuilder* waveform_;
  RCSwrContextPtr swr_;
  bool passThrough_ = false;
  AVSampleFormat inFormat_ = AV_SAMPLE_FMT_NONE;
  int inRate_ = 0;
  int inChannels_ = 0;
  std::uint8_t** buffer_ = nullptr;
  int capacity_ = 0;
};

platform::Status reencodeSegment(Input& input, RCAudioEncoder& encoder, RCWaveformBuilder* waveform,
                                 Progress& progress) {
  RCAudioDecoder& decoder = *input.decoder;
  if (auto opened = decoder.openCodec(); !opened) return opened;
  Converter converter(encoder, waveform);
  bool configured = false;
  std::int64_t position = 0;  // frames decoded so far, at the fragment's rate
  std::int64_t start = -1, end = -1;
  int rate = 0;
  auto handle = [&](AVFrame* frame) -> platform::Status {
    if (!configured) {
      rate = frame->sample_rate;
      start = std::llround(input.segment.contentStart * rate);
      end = std::llround((input.segment.contentStart + input.segment.contentDuration) * rate);
      if (auto set = converter.configure(frame); !set) return set;
      configured = true;
    } else if (!converter.matches(frame)) {
      return platform::fail(RCMediaError(
          RCMediaErrorCodeDecodeFailed,
          input.segment.fragmentURL.lastPathComponent() + " changes its audio format midway"));
    }
    const std::int64_t from = std::max(position, start);
    const std::int64_t to = std::min(position + frame->nb_samples, end);
    position += frame->nb_samples;
    progress.at(input, double(position) / rate - input.segment.contentStart);
    if (to > from)
      return converter.push(frame, int(from - (position - frame->nb_samples)), int(to - from));
    return {};
  };
  PacketPtr packet = makePacket();
  for (;;) {
    if (configured && position >= end) break;
    auto more = decoder.readPacket(packet.get());
    if (!more) return platform::fail(more.error());
    auto decoded = decoder.decode(*more ? packet.get() : nullptr, handle);
    av_packet_unref(packet.get());
    if (!decoded) return decoded;
    if (!*more) break;
  }
  if (!configured || position < end - shortfallTolerance(rate, 1024))
    return platform::fail(truncatedError(input, rate > 0 ? double(position) / rate : 0.0));
  return converter.drain();
}

platform::Status composeByReencoding(std::vector<Input>& inputs, const std::string& path,
                                     const std::string& extension, const KeptMetadata& kept,
                                     std::unique_ptr<RCWaveformBuilder>* waveform,
                                     Progress& progress, double* composedSeconds) {
  auto encoder = RCAudioEncoder::open(path, extension, inputs.front().parameters.get());
  if (!encoder) return platform::fail(encoder.error());
  kept.applyTo((*encoder)->output());
  if (*waveform) *waveform = std::make_unique<RCWaveformBuilder>((*encoder)->sampleRate());
  for (std::size_t i = 0; i < inputs.size(); ++i) {
    Input& input = inputs[i];
    if (auto opened = input.open(); !opened) return blamingSegment(opened, i);
    if (auto done = reencodeSegment(input, **encoder, waveform->get(), progress); !done)
      return blamingSegment(done, i);
    input.decoder.reset();
    progress.finished(input);
  }
  if (auto finished = (*encoder)->finish(); !finished) return finished;
  *composedSeconds = double((*encoder)->framesWritten()) / (*encoder)->sampleRate();
  return {};
}

platform::Status validate(const std::vector<RCComposerSegment>& segments,
                          const platform::URL& destination, const std::string& extension) {
  if (segments.empty())
    return platform::fail(RCMediaError(RCMediaErrorCodeInvalidArgument, "no fragments to compose"));
  if (!RCAudioOutput::supportsExtension(extension))
    return platform::fail(RCMediaError(RCMediaErrorCodeUnsupportedFormat,
                                       fmt::format("cannot compose into {}: unknown audio format",
                                                   destination.lastPathComponent())));
  for (const RCComposerSegment& segment : segments) {
    if (!std::isfinite(segment.contentStart) || !std::isfinite(segment.contentDuration) ||
        segment.contentStart < 0 || segment.contentDuration <= 0 ||
        segment.contentStart + segment.contentDuration > 1e7)
      return platform::fail(RCMediaError(
          RCMediaErrorCodeInvalidArgument,
          fmt::format("invalid range [{}, +{}] of {}", segment.contentStart,
                      segment.contentDuration, segment.fragmentURL.lastPathComponent())));
  }
  return {};
}

platform::Status compose(const std::vector<RCComposerSegment>& segments,
                         const platform::URL& destination,
                         const std::optional<platform::URL>& waveformDestination,
                         const RCComposerProgress& report) {
  Progress progress(report, segments);
  const std::string extension = lowercase(destination.pathExtension());
  if (auto valid = validate(segments, destination, extension); !valid) return valid;

  std::vector<Input> inputs;
  inputs.reserve(segments.size());
  for (const RCComposerSegment& segment : segments) {
    Input input{segment, nullptr, nullptr};
    if (auto opened = input.open(); !opened) return blamingSegment(opened, inputs.size());
    input.parameters.reset(avcodec_parameters_alloc());
    if (!input.parameters ||
        avcodec_parameters_copy(input.parameters.get(), input.decoder->codecParameters()) < 0) {
      throw std::bad_alloc();
    }
    if (inputs.size() >= kOpenFragments) input.decoder.reset();
    inputs.push_back(std::move(input));
  }

  const KeptMetadata kept = keptMetadataFor(destination, segments);
  auto file = RCReplacementFile::create(destination);
  if (!file) return platform::fail(file.error());
  const bool copying = canCopy(extension, inputs);
  std::unique_ptr<RCWaveformBuilder> waveform;
  double seconds = 0;
  platform::Status composed;
  if (copying) {
    if (waveformDestination)
      waveform = std::make_unique<RCWaveformBuilder>(inputs.front().parameters->sample_rate);
    composed = composeByCopy(inputs, file->tempPath(), extension, kept, waveform.get(), progress,
                             &seconds);
  } else {
    // The builder is created once the output's rate is known.
    if (waveformDestination) waveform = std::make_unique<RCWaveformBuilder>(1);
    composed = composeByReencoding(inputs, file->tempPath(), extension, kept, &waveform, progress,
                                   &seconds);
  }
  if (!composed) return composed;

  std::optional<RCReplacementFile> waveformFile;
  if (waveformDestination) {
    waveform->finish();
    auto created = RCReplacementFile::create(*waveformDestination);
    if (!created) return platform::fail(created.error());
    waveformFile.emplace(std::move(*created));
    if (auto written = waveformFile->write(RCEncodeWaveformFile(waveform->waveform())); !written)
      return written;
  }
  if (auto committed = commitKeepingTitles(*file, destination, extension); !committed)
    return committed;
  if (waveformFile) {
    if (auto committed = waveformFile->commit(); !committed) return committed;
  }
  QV_LOG(platform::kLogLevelDebug, "Composed {} fragment(s) into {} by {}: {:.3f}s",
         segments.size(), destination.lastPathComponent(), copying ? "stream copy" : "re-encoding",
         seconds);
  return {};
}

}  // namespace

platform::Status RCComposeAudio(const std::vector<RCComposerSegment>& segments,
                                const platform::URL& destination,
                                const std::optional<platform::URL>& waveformDestination,
                                const RCComposerProgress& progress) {
  RCInstallFFmpegLogging();
  QV_LOG(platform::kLogLevelDebug, "Composing {} fragment(s) into {}", segments.size(),
         destination.lastPathComponent());
  auto status = compose(segments, destination, waveformDestination, progress);
  if (!status)
    QV_LOG(platform::kLogLevelError, "ERROR: Composing {} failed: {}",
           destination.lastPathComponent(), status.error());
  return status;
}

}  // namespace quorvel
