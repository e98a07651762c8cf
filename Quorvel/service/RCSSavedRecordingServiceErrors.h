// The saved-recording service's errors (codes in Quorvel/errors/RCErrors.h): the
// D-Bus error names they travel under, and the mapping both ways between
// error values and D-Bus error replies (name, message).
//
// The message of a D-Bus error is the error's description,
//   Error Domain=<domain> Code=<code>[ "<text>"][ (underlying error: <same form>)]
// so a client turns any reply back into an error with the same domain and
// code (and the underlying chain), whatever library it uses. Plain functions;
// safe to call from any thread.
#pragma once

#include <string>
#include <string_view>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "platform/Error.h"

namespace quorvel {

// An error in RCSSavedRecordingServiceErrorDomain with `code` and no further
// information.
platform::Error RCSSavedRecordingServiceError(RCSSavedRecordingServiceErrorCode code);

// D-Bus error names.
inline constexpr const char* RCSDBusErrorMissingCompositionAVURL =
    "org.quorvel.SavedRecordingService.Error.MissingCompositionAVURL";
inline constexpr const char* RCSDBusErrorConflictingSession =
    "org.quorvel.SavedRecordingService.Error.ConflictingSession";
inline constexpr const char* RCSDBusErrorDeferredRequestSuperseded =
    "org.quorvel.SavedRecordingService.Error.DeferredRequestSuperseded";
inline constexpr const char* RCSDBusErrorCompositionFailed =
    "org.quorvel.SavedRecordingService.Error.CompositionFailed";
// Every other error (the framework's, the operating system's, unknown codes).
inline constexpr const char* RCSDBusErrorGeneric = "org.quorvel.Error.Generic";

struct RCSDBusError {
  std::string name;
  std::string message;
};

// The D-Bus error reply for `error`: the service-domain codes above get their
// own names, everything else the generic name; the message is
// error.description().
RCSDBusError RCSDBusErrorFromError(const platform::Error& error);

// The error a D-Bus error reply stands for. A message in the form above gives
// its domain, code, text and underlying errors back. Otherwise one of the
// service's own names gives the service domain and its code, the generic name
// the framework's generic error with the message as its text; any other name
// (a bus error such as org.freedesktop.DBus.Error.NoReply) becomes an error
// whose domain is that name, code 0, and text the message.
platform::Error RCSErrorFromDBusError(std::string_view name, std::string_view message);

}  // namespace quorvel
