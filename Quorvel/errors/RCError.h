// Framework errors: the domain and codes of the errors libquorvel builds
// itself, and the generic error that wraps another one. Plain functions
// returning immutable values; safe to call from any thread.
#pragma once

#include <string>

#include "platform/Error.h"

namespace quorvel {

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

}  // namespace quorvel
