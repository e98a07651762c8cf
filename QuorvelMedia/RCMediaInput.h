// Opening audio files for reading with libavformat, the one way the media
// library does it: optionally restricted (the media worker turns this on
// before its first job) to local files and the containers recordings and
// recovery use (mov/mp4/m4a, FLAC, WAV, MP3, Ogg), so a crafted file cannot
// make FFmpeg reach the network, open other files through playlist formats,
// or run one of its many other demuxers.
//
// RCRestrictMediaInputs() may be called from any thread, before or after
// other threads start opening; RCOpenMediaInput() from any thread.
#pragma once

struct AVFormatContext;

namespace quorvel {

// From now on, every RCOpenMediaInput in this process is restricted.
void RCRestrictMediaInputs();

// avformat_open_input(context, path) with the restrictions when they apply.
// Returns FFmpeg's result.
int RCOpenMediaInput(AVFormatContext** context, const char* path);

}  // namespace quorvel
