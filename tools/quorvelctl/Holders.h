// quorvelctl's view of who holds a recording: the sessions and waiting
// requests as a table like `systemd-inhibit --list` or as JSON, the
// "held by …" text a refusal prints, and waiting for a recording to be free
// as `flock -w` waits for a lock. All of it goes through the daemon's Sessions
// interface. Called from main() only.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include "Quorvel/service/SavedRecordingServiceClient.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvelctl {

// `quorvelctl sessions [URL]`: every open, closing and waiting session (or
// those of URL). Returns the exit status.
int listSessions(quorvel::SavedRecordingServiceClient& client,
                 const std::optional<platform::URL>& url, bool json);

// "held by quorvelctl (pid 42) for capture since 12:03:04", for each holder
// of `url` (joined with "; "); empty when the daemon names none.
std::string describeHolders(quorvel::SavedRecordingServiceClient& client, const platform::URL& url);

// Asks with `request` until access is granted or `seconds` have passed
// (forever when negative): each refusal for a conflicting session (301)
// waits for the recording's AccessSessionsChanged, then asks again. The
// client must have been connected with Options::watchAccessSessions. The
// last answer: the token, or the error (a 301 when the time was up).
platform::Result<quorvel::RCSSavedRecordingAccessToken> waitForAccess(
    quorvel::SavedRecordingServiceClient& client, const platform::URL& url, double seconds,
    const std::function<platform::Result<quorvel::RCSSavedRecordingAccessToken>()>& request);

// Whether `error` is the daemon's refusal for a conflicting session (301).
bool isConflict(const platform::Error& error);

}  // namespace quorvelctl
