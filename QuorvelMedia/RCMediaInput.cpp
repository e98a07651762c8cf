#include "QuorvelMedia/RCMediaInput.h"

#include <atomic>

extern "C" {
#include <libavformat/avformat.h>
#include <libavutil/dict.h>
}

namespace quorvel {
namespace {

std::atomic<bool> restricted{false};

// Demuxer names as FFmpeg lists them; a demuxer whose name list shares one
// entry with this list is allowed.
constexpr const char* kAllowedFormats = "mov,mp4,m4a,3gp,3g2,mj2,flac,wav,mp3,ogg";

}  // namespace

void RCRestrictMediaInputs() { restricted = true; }

int RCOpenMediaInput(AVFormatContext** context, const char* path) {
  if (!restricted) return avformat_open_input(context, path, nullptr, nullptr);
  AVDictionary* options = nullptr;
  av_dict_set(&options, "protocol_whitelist", "file", 0);
  av_dict_set(&options, "format_whitelist", kAllowedFormats, 0);
  const int result = avformat_open_input(context, path, nullptr, &options);
  av_dict_free(&options);
  return result;
}

}  // namespace quorvel
