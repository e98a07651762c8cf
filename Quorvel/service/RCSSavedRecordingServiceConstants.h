// The names of the saved-recording service on the bus: what the daemon owns
// and exports, and what clients address. Compile-time constants, usable from
// any thread. packaging/org.quorvel.SavedRecordingService1.xml describes the
// interface's methods and errors; the two must agree.
#pragma once

namespace quorvel {

// The well-known bus name the daemon owns on the session bus.
inline constexpr const char* RCSSavedRecordingServiceMachServiceName =
    "org.quorvel.SavedRecordingService";
// The object that carries the interface.
inline constexpr const char* RCSSavedRecordingServiceObjectPath =
    "/org/quorvel/SavedRecordingService";
// The interface with the ten requests and the exporting-set signal.
inline constexpr const char* RCSSavedRecordingServiceInterfaceName =
    "org.quorvel.SavedRecordingService1";
// The daemon's bundle identifier (its process information and journald tag).
inline constexpr const char* RCSSavedRecordingServiceBundleIdentifier = "org.quorvel.quorveld";

// The error domain of every error the daemon creates itself.
inline constexpr const char* RCSSavedRecordingServiceErrorDomain =
    "org.quorvel.SavedRecordingService.ErrorDomain";

// The notification that the set of recordings being exported may have changed:
// a signal of this name, without arguments, on the service object and
// interface above. Observers read the set with FetchExportingCompositionAVURLs.
inline constexpr const char*
    RCSavedRecordingServiceDidChangeExportingCompositionAVURLsDistributedNotification =
        "ExportingCompositionAVURLsChanged";

// Method names of the interface, in the order the interface declares them.
inline constexpr const char* RCSMethodPrepareToCapture = "PrepareToCapture";
inline constexpr const char* RCSMethodPrepareToPreview = "PrepareToPreview";
inline constexpr const char* RCSMethodPrepareToExport = "PrepareToExport";
inline constexpr const char* RCSMethodPrepareToTrim = "PrepareToTrim";
inline constexpr const char* RCSMethodEndAccessSession = "EndAccessSession";
inline constexpr const char* RCSMethodDisableOrphanedFragmentCleanup =
    "DisableOrphanedFragmentCleanup";
inline constexpr const char* RCSMethodEnableOrphanedFragmentCleanup =
    "EnableOrphanedFragmentCleanup";
inline constexpr const char* RCSMethodDisableOrphanHandling = "DisableOrphanHandling";
inline constexpr const char* RCSMethodEnableOrphanHandling = "EnableOrphanHandling";
inline constexpr const char* RCSMethodFetchExportingCompositionAVURLs =
    "FetchExportingCompositionAVURLs";

// The second interface of the service object: who holds which recording, and
// a signal when that changes (packaging/org.quorvel.SavedRecordingService1.Sessions.xml).
inline constexpr const char* RCSSavedRecordingServiceSessionsInterfaceName =
    "org.quorvel.SavedRecordingService1.Sessions";
// Every open and closing session: a(sissxsuus) of (access name, access type,
// composition AVURL, state "open" or "closing", opened in microseconds since
// the Unix epoch, holder's bus name, process id, user id, command name).
inline constexpr const char* RCSMethodListAccessSessions = "ListAccessSessions";
// Each recording's waiting request: a(sisxsuus) of (access name, access type,
// composition AVURL, waiting since, holder's bus name, process id, user id,
// command name).
inline constexpr const char* RCSMethodListDeferredRequests = "ListDeferredRequests";
// AccessSessionsChanged(s compositionAVURL): the recording's sessions or its
// waiting request changed; at most once per recording per turn of the
// daemon's service queue.
inline constexpr const char* RCSSignalAccessSessionsChanged = "AccessSessionsChanged";
// The states ListAccessSessions reports.
inline constexpr const char* RCSAccessSessionStateOpen = "open";
inline constexpr const char* RCSAccessSessionStateClosing = "closing";
// A holder without a user id: the daemon's own session, or credentials the
// bus would not give.
inline constexpr unsigned RCSUnknownUserID = 0xFFFFFFFF;

}  // namespace quorvel
