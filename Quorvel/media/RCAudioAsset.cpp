#include "Quorvel/media/RCAudioAsset.h"

extern "C" {
#include <libavformat/avformat.h>
#include <libavutil/dict.h>
}

#include <sys/stat.h>

#include <strings.h>
#include <cmath>
#include <cstring>
#include <limits>

#include "Quorvel/media/RCAssetMetadataLoader.h"
#include "Quorvel/media/RCFFmpegLogging.h"
#include "Quorvel/media/RCMP4Atoms.h"
#include "platform/Log.h"

namespace quorvel {
namespace {

struct InputDeleter {
  void operator()(AVFormatContext* context) const { avformat_close_input(&context); }
};
using Input = std::unique_ptr<AVFormatContext, InputDeleter>;

platform::Error assetError(long code, std::string text) {
  return platform::Error(kRCAudioAssetErrorDomain, code, std::move(text));
}

// Opens `path` with libavformat. Only regular files: a FIFO or a device
// would block the open or the reads forever.
platform::Result<Input> openInput(const std::string& path) {
  struct stat info {};
  if (::stat(path.c_str(), &info) != 0) {
    return platform::fail(platform::posixError(errno, "stat " + path));
  }
  if (!S_ISREG(info.st_mode)) return platform::fail(assetError(1, "not a regular file: " + path));
  AVFormatContext* raw = nullptr;
  const int status = avformat_open_input(&raw, path.c_str(), nullptr, nullptr);
  if (status < 0) {
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

platform::Result<RCCommonMetadata> readCommonMetadata(const std::string& path) {
  RCInstallFFmpegLogging();
  auto input = openInput(path);
  if (!input) return platform::fail(input.error());
  RCCommonMetadata metadata;
  const AVDictionary* dictionary = (*input)->metadata;
  if (const AVDictionaryEntry* created = av_dict_get(dictionary, "creation_time", nullptr, 0)) {
    metadata.creationDate = platform::Date::fromISO8601(created->value);
  }
  if (isMP4Family(**input)) {
    // libavformat reports each language-tagged title under the plain key as
    // well, so a file without an untagged title would seem to have one; the
    // atoms say what is really there.
    auto items = RCMP4ReadTitleItems(path);
    if (items) {
      metadata.titleItems = std::move(*items);
      return metadata;
    }
    QV_LOG(platform::kLogLevelDebug, "Reading titles from atoms of {} failed: {}", path,
           items.error());
  }
  metadata.titleItems = titlesFromDictionary(dictionary);
  return metadata;
}

}  // namespace

RCAudioAsset::RCAudioAsset(platform::URL url, double duration, std::string containerName)
    : url_(std::move(url)), duration_(duration), containerName_(std::move(containerName)) {}

std::shared_ptr<RCAudioAsset> RCAudioAsset::assetWithURL(const platform::URL& url) {
  RCInstallFFmpegLogging();
  auto input = openInput(url.path());
  if (!input) {
    QV_LOG(platform::kLogLevelDebug, "No asset for {}: {}", url.lastPathComponent(), input.error());
    return nullptr;
  }
  if (avformat_find_stream_info(input->get(), nullptr) < 0) {
    QV_LOG(platform::kLogLevelDebug, "No asset for {}: no stream information",
           url.lastPathComponent());
    return nullptr;
  }
  const int audio = av_find_best_stream(input->get(), AVMEDIA_TYPE_AUDIO, -1, -1, nullptr, 0);
  if (audio < 0) {
    QV_LOG(platform::kLogLevelDebug, "No asset for {}: no audio stream", url.lastPathComponent());
    return nullptr;
  }
  const double duration = durationOf(**input, *(*input)->streams[audio]);
  return std::make_shared<RCAudioAsset>(url, duration, (*input)->iformat->name);
}

platform::Result<RCCommonMetadata> RCAudioAsset::loadCommonMetadata() const {
  return readCommonMetadata(url_.path());
}

void RCAudioAsset::loadCommonMetadataAsync(CommonMetadataCompletion completion) const {
  RCAssetMetadataLoader::shared().submit(
      [path = url_.path(), completion = std::move(completion)]() mutable {
        completion(readCommonMetadata(path));
      });
}

}  // namespace quorvel
