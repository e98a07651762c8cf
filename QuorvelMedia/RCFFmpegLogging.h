// FFmpeg log routing: everything libavformat/libavcodec print goes to our log
// at level 7 (trace) instead of stderr.
//
// RCInstallFFmpegLogging() installs the callback once per process (later calls
// do nothing); every framework entry point that touches FFmpeg calls it first.
// Thread-safe: may be called from any thread, and the callback itself runs on
// whatever thread FFmpeg logs from.
#pragma once

namespace quorvel {

void RCInstallFFmpegLogging();

}  // namespace quorvel
