#include "QuorvelMedia/RCInProcessMediaEngine.h"

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/dict.h>
}

#include <strings.h>
#include <sys/stat.h>

#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstring>
#include <limits>
#include <new>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFileStatus.h"
#include "Quorvel/waveform/RCWaveformFile.h"
#include "QuorvelMedia/RCComposer.h"
#include "QuorvelMedia/RCFFmpegLogging.h"
#include "QuorvelMedia/RCFFmpegResource.h"
#include "QuorvelMedia/RCMP4Atoms.h"
#include "QuorvelMedia/RCMediaInput.h"
#include "QuorvelMedia/RCWaveformDecoding.h"
#include "platform/Log.h"

namespace quorvel {
namespace {

using Input = RCAVInputPtr;

platform::Error assetError(long code, std::string text) {
  return platform::Error(kRCAudioAssetErrorDomain, code, std::move(text));
}

bool isSystemError(int status) { return RCIsSystemAVError(status); }

// Opens `path` with libavformat. Only regular files: a FIFO or a device
// would block the open or the reads forever.
platform::Result<Input> openInput(const std::string& path) {
  const RCFileStatus file = RCFileStatus::atPathFollowing(path);
  if (!file.exists()) return platform::fail(platform::posixError(file.error, "stat " + path));
  if (!file.isRegularFile()) return platform::fail(assetError(1, "not a regular file: " + path));
  AVFormatContext* raw = nullptr;
  const int status = RCOpenMediaInput(&raw, path.c_str());
  if (status < 0) {
    // A system error says nothing about the contents (the file could not be
    // read); everything else is libavformat finding no media it can open.
    if (isSystemError(status)) {
      return platform::fail(platform::posixError(AVUNERROR(status), "open " + path));
    }
    char text[AV_ERROR_MAX_STRING_SIZE] = {};
    av_strerror(status, text, sizeof text);
    return platform::fail(assetError(2, fmt::format("cannot open {}: {}", path, text)));
  }
  return Input(raw);
}

bool isMP4Family(const AVFormatContext& input) {
  return input.iformat != nullptr && std::strstr(input.iformat->name, "mp4") != nullptr;
}

double durationOf(const AVFormatContext& input, const AVStream& stream) {
  if (input.duration != AV_NOPTS_VALUE && input.duration >= 0) {
    return double(input.duration) / AV_TIME_BASE;
  }
  if (stream.duration != AV_NOPTS_VALUE && stream.duration >= 0 && stream.time_base.den != 0) {
    return double(stream.duration) * av_q2d(stream.time_base);
  }
  return std::numeric_limits<double>::quiet_NaN();
}

// "title" and "title-xxx" entries of a libavformat dictionary.
std::vector<RCMetadataItem> titlesFromDictionary(const AVDictionary* metadata) {
  std::vector<RCMetadataItem> items;
  const AVDictionaryEntry* entry = nullptr;
  while ((entry = av_dict_get(metadata, "", entry, AV_DICT_IGNORE_SUFFIX)) != nullptr) {
    const std::string_view key = entry->key;
    if (key.size() == 5 && ::strncasecmp(key.data(), "title", 5) == 0) {
      items.push_back(RCMetadataItem{entry->value, {}});
    } else if (key.size() == 9 && ::strncasecmp(key.data(), "title-", 6) == 0) {
      std::string language(key.substr(6));
      for (char& c : language) c = char(std::tolower(static_cast<unsigned char>(c)));
      items.push_back(RCMetadataItem{entry->value, language});
    }
  }
  return items;
}

// Calls `progress` at most every 50 ms (and always with 1 at the end), so a
// caller that forwards it does not flood its peer.
class ProgressThrottle {
 public:
  explicit ProgressThrottle(const RCMediaProgress& progress) : progress_(progress) {}
  void operator()(double fraction) {
    if (!progress_) return;
    auto now = std::chrono::steady_clock::now();
    if (fraction < 1 && now - last_ < std::chrono::milliseconds(50)) return;
    last_ = now;
    progress_(std::clamp(fraction, 0.0, 1.0));
  }

 private:
  const RCMediaProgress& progress_;
  std::chrono::steady_clock::time_point last_{};
};

}  // namespace

platform::Result<RCMediaProbe> RCInProcessMediaEngine::probe(const platform::URL& url) {
  RCInstallFFmpegLogging();
  const std::string& path = url.path();
  auto input = openInput(path);
  if (!input) return platform::fail(input.error());
  RCMediaProbe probe;
  probe.duration = std::numeric_limits<double>::quiet_NaN();
  probe.containerName = (*input)->iformat->name;
  const AVDictionary* dictionary = (*input)->metadata;
  if (const AVDictionaryEntry* created = av_dict_get(dictionary, "creation_time", nullptr, 0)) {
    probe.creationDate = platform::Date::fromISO8601(created->value);
  }
  bool titlesRead = false;
  if (isMP4Family(**input)) {
    // libavformat reports each language-tagged title under the plain key as
    // well, so a file without an untagged title would seem to have one; the
    // atoms say what is really there. Where they hold no title at all,
    // libavformat may still have found one elsewhere.
    auto items = RCMP4ReadTitleItems(path);
    if (items && !items->empty()) {
      probe.titleItems = std::move(*items);
      titlesRead = true;
    } else if (!items) {
      QV_LOG(platform::kLogLevelDebug, "Reading titles from atoms of {} failed: {}", path,
             items.error());
    }
  }
  if (!titlesRead) probe.titleItems = titlesFromDictionary(dictionary);

  if (const int status = avformat_find_stream_info(input->get(), nullptr); status < 0) {
    // Running out of memory or a read error says nothing about the file;
    // only what libavformat read and could not make sense of does.
    if (isSystemError(status)) {
      return platform::fail(platform::posixError(AVUNERROR(status), "read " + path));
    }
    QV_LOG(platform::kLogLevelDebug, "{} is not playable: no stream information",
           url.lastPathComponent());
    return probe;
  }
  const int audio = av_find_best_stream(input->get(), AVMEDIA_TYPE_AUDIO, -1, -1, nullptr, 0);
  if (audio < 0) {
    QV_LOG(platform::kLogLevelDebug, "{} is not playable: no audio stream",
           url.lastPathComponent());
    return probe;
  }
  probe.playable = true;
  probe.duration = durationOf(**input, *(*input)->streams[audio]);
  return probe;
}

platform::Status RCInProcessMediaEngine::compose(
    const std::vector<RCComposerSegment>& segments, const platform::URL& destination,
    const std::optional<platform::URL>& waveformDestination, const RCMediaProgress& progress) {
  ProgressThrottle throttle(progress);
  RCComposerProgress onProgress;
  if (progress) onProgress = [&throttle](double fraction) { throttle(fraction); };
  return RCComposeAudio(segments, destination, waveformDestination, onProgress);
}

platform::Status RCInProcessMediaEngine::buildWaveform(const platform::URL& audio,
                                                       const platform::URL& destination,
                                                       const RCMediaProgress& progress) {
  ProgressThrottle throttle(progress);
  auto waveform =
      RCDecodeWaveform(audio, {.onFrame = [&](const RCWaveformBuilder&, double fraction) {
                         throttle(fraction);
                         return platform::Status();
                       }});
  if (!waveform) return platform::fail(waveform.error());
  if (auto written = RCWriteWaveformFile(*waveform, destination); !written) return written;
  throttle(1);
  return {};
}

platform::Status RCInProcessMediaEngine::writeTitle(const platform::URL& file,
                                                    const std::string& title,
                                                    const std::string& language) {
  return RCMP4WriteTitle(file.path(), title, language);
}

void RCUseInProcessMediaEngine() {
  RCMediaEngine::setCurrent(std::make_shared<RCInProcessMediaEngine>());
}

}  // namespace quorvel
