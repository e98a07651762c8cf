// Every error domain and code of the recordings framework and the service, in
// one place: the framework's own errors, the audio work's (composing,
// decoding, waveform files), MP4 atom editing, audio assets, file digests,
// and the codes of the service domain (whose D-Bus mapping lives beside the
// service). Codes are unscoped, prefixed `long` enumerators so they compare
// directly with platform::Error::code(). The constructors are plain functions
// returning immutable values; safe to call from any thread.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Error.h"

namespace quorvel {

// ---- The framework domain ----

// The domain of every error the recordings framework creates itself.
inline constexpr const char* RCErrorDomain = "org.quorvel.ErrorDomain";

enum RCErrorCode : long {
  // Something failed; the underlying error, when there is one, says what.
  RCErrorCodeGeneric = 1,
  // The recordings database cannot be read: not a database, or damaged.
  RCErrorCodeDatabaseUnreadable = 10,
  // The recordings database was written by a newer schema than this build knows.
  RCErrorCodeDatabaseSchemaTooNew = 11,
  // The recordings database file holds tables this framework did not create.
  RCErrorCodeDatabaseUnrecognized = 12,
  // A database statement failed (busy past the timeout, disk full, ...).
  RCErrorCodeDatabaseFailed = 13,
  // A composition manifest cannot be used (not JSON, wrong fields, unsafe names).
  RCErrorCodeInvalidManifest = 20,
  // A file operation was refused because the path leaves the recordings directory
  // or passes through a symbolic link.
  RCErrorCodeNotConfined = 30,
  // A file was replaced by someone else while it was being rewritten; the
  // rewrite was not applied (read the new file and try again).
  RCErrorCodeChangedMeanwhile = 31,
  // A composition or fragment cannot be edited as asked (bad index, bad range).
  RCErrorCodeInvalidEdit = 40,
  // An audio file cannot be opened or has no audio.
  RCErrorCodeUnreadableAudio = 41,
};

// A framework error with the given code and description.
platform::Error RCError(RCErrorCode code, std::string description);

// The generic framework error (RCErrorDomain, RCErrorCodeGeneric) without an
// underlying error.
platform::Error RCGenericError();

// The generic framework error carrying `underlying`, reachable through
// platform::Error::underlyingError().
platform::Error RCGenericErrorWithUnderlyingError(const platform::Error& underlying);

// ---- The media domain: composing, decoding, waveform files ----

inline constexpr const char* kRCMediaErrorDomain = "org.quorvel.Media";

enum RCMediaErrorCode : long {
  // A request that cannot be carried out as asked.
  RCMediaErrorCodeInvalidArgument = 1,
  // The file is not a media file that can be opened (one that is missing or
  // cannot be read at all is a POSIX error).
  RCMediaErrorCodeCannotOpen = 2,
  // The file opened but holds no audio.
  RCMediaErrorCodeNoAudioStream = 3,
  // The audio could not be read or decoded.
  RCMediaErrorCodeDecodeFailed = 4,
  // Writing the output failed inside the codec or muxer.
  RCMediaErrorCodeEncodeFailed = 5,
  // The audio ends before the range or duration it declares.
  RCMediaErrorCodeTruncated = 6,
  // No container/codec for this extension.
  RCMediaErrorCodeUnsupportedFormat = 7,
  // Temporary file, fsync, rename.
  RCMediaErrorCodeFileSystem = 8,
  // A waveform file that is not a valid waveform.
  RCMediaErrorCodeCorruptWaveform = 9,
  // The media worker could not run the job: it cannot be started, died,
  // stalled or broke the protocol (or no media engine is installed).
  RCMediaErrorCodeWorkerFailed = 10,
};

platform::Error RCMediaError(RCMediaErrorCode code, std::string description);
// An error for a negative FFmpeg result `averror`, described as "<what>: <FFmpeg's text>".
// A system error (RCIsSystemAVError) becomes a POSIX error with its errno:
// it tells that the file could not be read, not what the file holds.
// Defined in libquorvel-media (RCFFmpegLogging.cpp), with the rest of the FFmpeg code.
platform::Error RCMediaErrorFromAV(RCMediaErrorCode code, int averror, std::string_view what);
// True when the FFmpeg result `averror` is the operating system's failure
// (EIO, ENOMEM, EACCES, ENOENT…) rather than FFmpeg's finding about the data.
bool RCIsSystemAVError(int averror);

// True when `error` is the media engine's verdict on a file it read: not a
// media file, invalid data, no audio stream, audio that does not decode or
// ends early (the asset domain, and those codes of the media domain). Any
// other error (POSIX, a media worker that died or timed out, a failure to
// write) says nothing about the file, and nothing may be concluded from it.
bool RCIsAudioDataError(const platform::Error& error);

// ---- Composing: the fragment whose audio cannot be read ----

// The domain of a compose that failed because one segment's fragment holds
// unusable audio (RCIsAudioDataError): the code is that segment's index in
// the compose request, the underlying error what reading it found. Failures
// to read at all never take this form.
inline constexpr const char* kRCComposerSegmentErrorDomain = "org.quorvel.ComposerSegment";

platform::Error RCComposerSegmentError(std::size_t segmentIndex, const platform::Error& underlying);
// The index of the segment `error` blames, when it is a segment error.
std::optional<std::size_t> RCComposerFailedSegment(const platform::Error& error);

// ---- MP4 atom reading and title writing ----

inline constexpr const char* kRCMP4ErrorDomain = "org.quorvel.MP4Atoms";

enum RCMP4ErrorCode : long {
  kRCMP4ErrorMalformed = 1,    // sizes that do not add up
  kRCMP4ErrorNoMovie = 2,      // no complete `moov` atom
  kRCMP4ErrorBadArgument = 3,  // language or title that cannot be stored
  kRCMP4ErrorIO = 4,           // reading or writing the file failed
  kRCMP4ErrorTooLarge = 5,     // an offset or atom that does not fit its field
};

// ---- Audio assets ----

inline constexpr const char* kRCAudioAssetErrorDomain = "org.quorvel.AudioAsset";

// ---- File digests ----

inline constexpr const char* kRCMD5ErrorDomain = "org.quorvel.MD5";

enum RCMD5ErrorCode : long {
  // The crypto library offers no MD5 implementation.
  RCMD5ErrorCodeUnavailable = 1,
};

// ---- The service domain (RCSSavedRecordingServiceErrorDomain) ----

enum RCSSavedRecordingServiceErrorCode : long {
  // A prepare request came without a composition AVURL.
  RCSSavedRecordingServiceErrorMissingCompositionAVURL = 101,
  // The session registry refused a session that conflicts with an open one.
  RCSSavedRecordingServiceErrorConflictingSession = 301,
  // A deferred access request was replaced by a newer one for the same recording.
  RCSSavedRecordingServiceErrorDeferredRequestSuperseded = 302,
  // Composing a recording's fragments into its final audio file failed.
  RCSSavedRecordingServiceErrorCompositionFailed = 401,
};

}  // namespace quorvel
