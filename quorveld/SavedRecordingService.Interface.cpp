// The ten requests of the service interface, as they arrive on the
// delivery thread: the arrival line, the required-parameter checks, and the
// hand-over to the service serial queue.
//
// The work behind most requests (sessions, finalization, fragment cleanup,
// the orphan-handling switches) is not part of this daemon yet: after their checks, requests answer
// the bus's NotSupported error naming themselves, and requests that expect no reply are logged and
// dropped.
#include <fmt/format.h>

#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"
#include "platform/Log.h"
#include "platform/dbus/Connection.h"
#include "quorveld/RCSAdditions.h"
#include "quorveld/SavedRecordingService.h"

namespace quorvel {

namespace {

constexpr const char* kBusErrorNotSupported = "org.freedesktop.DBus.Error.NotSupported";

platform::Error notSupported(const char* selector) {
  return platform::Error(kBusErrorNotSupported, 0,
                         fmt::format("-{} is not supported by this daemon yet", selector));
}

void logNotSupported(const char* selector) {
  QV_LOG(platform::kLogLevelNotice, "-{} is not supported by this daemon yet; request dropped",
         selector);
}

}  // namespace

void SavedRecordingService::_logMissingParameter(const char* parameter, const char* selector) {
  auto connection = rcs_currentConnection();
  QV_LOG(platform::kLogLevelError,
         "ERROR: received invalid message on connection {}.  {} parameter is required for "
         "invocations of -{}",
         connection ? connection->description() : std::string("(null)"), parameter, selector);
}

bool SavedRecordingService::_checkPrepareRequest(const char* selector, const char* kind,
                                                 const std::optional<platform::URL>& url,
                                                 AccessRequestHandler& handler) {
  QV_LOG(platform::kLogLevelDebug, "Received request to prepare '{}' for {}...",
         url ? url->lastPathComponent() : std::string("(null)"), kind);
  // The handler test comes first: a request missing both gets no reply.
  if (!handler) {
    _logMissingParameter("accessRequestHandler", selector);
    return false;
  }
  if (!url) {
    _logMissingParameter("compositionAVURL", selector);
    handler(std::nullopt,
            RCSSavedRecordingServiceError(RCSSavedRecordingServiceErrorMissingCompositionAVURL));
    return false;
  }
  return true;
}

void SavedRecordingService::prepareToCaptureToCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler) {
  static constexpr const char* kSelector =
      "prepareToCaptureToCompositionAVURL:accessRequestHandler:";
  if (!_checkPrepareRequest(kSelector, "capture", compositionAVURL, accessRequestHandler)) return;
  accessRequestHandler(std::nullopt, notSupported(kSelector));
}

void SavedRecordingService::prepareToPreviewCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler) {
  static constexpr const char* kSelector = "prepareToPreviewCompositionAVURL:accessRequestHandler:";
  if (!_checkPrepareRequest(kSelector, "preview", compositionAVURL, accessRequestHandler)) return;
  accessRequestHandler(std::nullopt, notSupported(kSelector));
}

void SavedRecordingService::prepareToExportCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, bool /*cacheWaveform*/,
    AccessRequestHandler accessRequestHandler) {
  static constexpr const char* kSelector =
      "prepareToExportCompositionAVURL:cacheWaveform:accessRequestHandler:";
  if (!_checkPrepareRequest(kSelector, "export", compositionAVURL, accessRequestHandler)) return;
  accessRequestHandler(std::nullopt, notSupported(kSelector));
}

void SavedRecordingService::prepareToTrimCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler) {
  static constexpr const char* kSelector = "prepareToTrimCompositionAVURL:accessRequestHandler:";
  if (!_checkPrepareRequest(kSelector, "trimming", compositionAVURL, accessRequestHandler)) return;
  accessRequestHandler(std::nullopt, notSupported(kSelector));
}

void SavedRecordingService::endAccessSessionWithToken(
    std::optional<RCSSavedRecordingAccessToken> accessToken) {
  static constexpr const char* kSelector = "endAccessSessionWithToken:";
  QV_LOG(platform::kLogLevelDebug, "Ending access session: {}.",
         accessToken ? accessToken->debugDescription() : std::string("(null)"));
  if (!accessToken) {
    _logMissingParameter("accessToken", kSelector);
    return;
  }
  logNotSupported(kSelector);
}

void SavedRecordingService::disableOrphanedFragmentCleanupForCompositionAVURL(
    std::optional<platform::URL> /*compositionAVURL*/, CompletionHandler completionBlock) {
  static constexpr const char* kSelector =
      "disableOrphanedFragmentCleanupForCompositionAVURL:completionBlock:";
  if (!completionBlock) return logNotSupported(kSelector);
  completionBlock(notSupported(kSelector));
}

void SavedRecordingService::enableOrphanedFragmentCleanupForCompositionAVURL(
    std::optional<platform::URL> /*compositionAVURL*/) {
  logNotSupported("enableOrphanedFragmentCleanupForCompositionAVURL:");
}

void SavedRecordingService::disableOrphanHandlingWithCompletionBlock(
    CompletionHandler completionBlock) {
  static constexpr const char* kSelector = "disableOrphanHandlingWithCompletionBlock:";
  if (!completionBlock) return logNotSupported(kSelector);
  completionBlock(notSupported(kSelector));
}

void SavedRecordingService::enableOrphanHandlingWithCompletionBlock(
    CompletionHandler completionBlock) {
  static constexpr const char* kSelector = "enableOrphanHandlingWithCompletionBlock:";
  if (!completionBlock) return logNotSupported(kSelector);
  completionBlock(notSupported(kSelector));
}

void SavedRecordingService::fetchExportingCompositionAVURLs(URLSetHandler reply) {
  // Without a reply the request is ignored altogether.
  if (!reply) return;
  _performOnServiceQueue([this, self = shared_from_this(), reply = std::move(reply)]() mutable {
    std::set<platform::URL> snapshot;
    _serialQueue.sync([&] {
      snapshot.insert(_compositionAVURLsBeingExported.begin(),
                      _compositionAVURLsBeingExported.end());
    });
    reply(std::move(snapshot));
  });
}

}  // namespace quorvel
