#include "QuorvelMedia/RCFFmpegLogging.h"

extern "C" {
#include <libavutil/error.h>
#include <libavutil/log.h>
}

#include <cerrno>
#include <cstdarg>
#include <mutex>
#include <string>

#include "Quorvel/errors/RCErrors.h"
#include "platform/Log.h"

namespace quorvel {
namespace {

// FFmpeg may print one line in several calls; each thread keeps the part of a
// line it has not finished yet, together with av_log's prefix state.
struct PendingLine {
  std::string text;
  int printPrefix = 1;
};

void routeFFmpegLog(void* avcl, int level, const char* format, va_list args) {
  // The custom callback sees every message; honour FFmpeg's own level so the
  // decoders' debug output is not even formatted.
  if (level > av_log_get_level()) return;
  if (!platform::LoggingShouldLog(platform::kLogLevelDebug, platform::LogCategory::Default) &&
      !platform::shouldLogToConsole(platform::kLogLevelDebug, platform::LogCategory::Default)) {
    return;
  }
  thread_local PendingLine pending;
  char buffer[1024];
  va_list copy;
  va_copy(copy, args);
  av_log_format_line2(avcl, level, format, copy, buffer, sizeof buffer, &pending.printPrefix);
  va_end(copy);
  pending.text += buffer;
  std::size_t newline;
  while ((newline = pending.text.find('\n')) != std::string::npos) {
    std::string line = pending.text.substr(0, newline);
    pending.text.erase(0, newline + 1);
    while (!line.empty() && (line.back() == '\r' || line.back() == ' ')) line.pop_back();
    if (!line.empty()) QV_LOG(platform::kLogLevelDebug, "ffmpeg: {}", line);
  }
  // A runaway partial line is flushed rather than kept forever.
  if (pending.text.size() > 4096) {
    QV_LOG(platform::kLogLevelDebug, "ffmpeg: {}", pending.text);
    pending.text.clear();
  }
}

}  // namespace

void RCInstallFFmpegLogging() {
  static std::once_flag once;
  std::call_once(once, [] { av_log_set_callback(&routeFFmpegLog); });
}

bool RCIsSystemAVError(int averror) {
  switch (AVUNERROR(averror)) {
    case EACCES:
    case EPERM:
    case EIO:
    case ENOMEM:
    case EMFILE:
    case ENFILE:
    case ENOENT:
    case EAGAIN:
    case EINTR:
    case ENXIO:
    case ENODEV:
    case EBUSY:
    case ETIMEDOUT:
    case ELOOP:
      return true;
    default:
      return false;
  }
}

platform::Error RCMediaErrorFromAV(RCMediaErrorCode code, int averror, std::string_view what) {
  if (averror < 0 && RCIsSystemAVError(averror)) {
    return platform::posixError(AVUNERROR(averror), what);
  }
  char text[AV_ERROR_MAX_STRING_SIZE] = {};
  av_strerror(averror, text, sizeof text);
  return RCMediaError(code, fmt::format("{}: {}", what, text));
}

}  // namespace quorvel
