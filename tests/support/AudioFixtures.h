// Audio fixtures for tests: real audio files made with FFmpeg's encoders, and
// a decoder that reads any of them back as interleaved float PCM, so tests
// compare decoded audio within tolerances instead of encoder output bytes.
//
// Plain functions without shared state; safe to call from any thread.
#pragma once

#include <string>
#include <utility>
#include <vector>

#include "platform/Error.h"

namespace quorvel::testing {

// Where an m4a file keeps its movie header ("moov"): after the media data, as
// the muxer writes it by default, or before it ("faststart").
enum class M4ALayout { MoovAtEnd, MoovFirst };

struct ToneOptions {
  double seconds = 1.0;
  // "m4a" (AAC in MP4), "flac" or "wav" (16-bit PCM).
  std::string format = "m4a";
  int sampleRate = 44100;
  int channels = 1;
  double frequencyHz = 440.0;
  double amplitude = 0.5;
  M4ALayout layout = M4ALayout::MoovAtEnd;
  // Container metadata written by the muxer, e.g. {"title", "Walk"} or
  // {"creation_time", "2020-01-02T03:04:05Z"}.
  std::vector<std::pair<std::string, std::string>> metadata;
};

// Writes a sine tone to `path` (replacing any file there).
platform::Status writeTone(const std::string& path, const ToneOptions& tone);
platform::Status writeTone(const std::string& path, double seconds, const std::string& format,
                           int sampleRate = 44100, int channels = 1, double frequencyHz = 440.0,
                           double amplitude = 0.5, M4ALayout layout = M4ALayout::MoovAtEnd);

struct DecodedPCM {
  std::vector<float> samples;  // interleaved
  int sampleRate = 0;
  int channels = 0;

  std::size_t frames() const { return channels > 0 ? samples.size() / channels : 0; }
  double seconds() const { return sampleRate > 0 ? double(frames()) / sampleRate : 0.0; }
};

// Writes damaged and non-audio files into `dir`, one per way reading fails:
// empty.m4a, text.m4a (not audio), cut.m4a (2 s, movie header cut off the
// end), cutdata.m4a (2 s, header first, half the audio data cut), cut.wav
// (2 s, header declares more than is there) and video.m4a (no audio stream).
platform::Status writeDamagedAudio(const std::string& dir);

// Writes what an orphan run finds in `dir`: a bundle the database lacks
// (Lost.composition, one 1 s fragment, composed name Lost.m4a), a file it
// lacks (Found.m4a, 660 Hz, titled "Found on a card"), a copy of that file
// (Found again.m4a) and a file without audio (Noise.wav).
platform::Status writeOrphans(const std::string& dir);

// Decodes the first audio stream of `path` to interleaved float at the
// stream's own rate and channel count. Fails for files FFmpeg cannot open or
// that hold no audio stream.
platform::Result<DecodedPCM> decodeToPCM(const std::string& path);

// Measurements for comparing decoded audio.
// Frequency of channel 0 estimated from its rising zero crossings.
double estimatedFrequencyHz(const DecodedPCM& pcm, std::size_t beginFrame = 0,
                            std::size_t endFrame = 0);
// Largest absolute sample difference between two decodings over the frames
// both have (the longer one's tail is ignored). Infinity if their shapes differ.
double maxAbsDifference(const DecodedPCM& a, const DecodedPCM& b);

}  // namespace quorvel::testing
