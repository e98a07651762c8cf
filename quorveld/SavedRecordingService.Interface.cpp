// The ten requests of the service interface, as they arrive on the
// delivery thread: the arrival line, the required-parameter checks, taking
// note of the calling connection (known only during delivery), and the
// hand-over to the service serial queue, where all of their work is done.
#include <fmt/format.h>

#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"
#include "platform/Log.h"
#include "platform/dbus/Connection.h"
#include "quorveld/RCSAdditions.h"
#include "quorveld/SavedRecordingService.h"

namespace quorvel {

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

void SavedRecordingService::_prepareAccessSession(const char* selector, const char* kind,
                                                  const char* sessionName, bool exclusive,
                                                  std::optional<platform::URL> compositionAVURL,
                                                  AccessRequestHandler accessRequestHandler) {
  if (!_checkPrepareRequest(selector, kind, compositionAVURL, accessRequestHandler)) return;
  _performOnServiceQueue(
      [this, self = shared_from_this(), sessionName, exclusive, url = std::move(*compositionAVURL),
       connection = rcs_currentConnection(), reply = std::move(accessRequestHandler)]() mutable {
        _onServiceQueueOpenAccessSessionNamed(
            sessionName, url, exclusive, std::move(connection),
            [reply = std::move(reply)](std::shared_ptr<AssetAccessSession> session,
                                       std::optional<platform::Error> error) mutable {
              reply(session ? std::optional(session->accessToken()) : std::nullopt,
                    std::move(error));
            });
      },
      WorkLength::Short);
}

void SavedRecordingService::prepareToCaptureToCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler) {
  _prepareAccessSession("prepareToCaptureToCompositionAVURL:accessRequestHandler:", "capture",
                        "capture", true, std::move(compositionAVURL),
                        std::move(accessRequestHandler));
}

void SavedRecordingService::prepareToPreviewCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler) {
  _prepareAccessSession("prepareToPreviewCompositionAVURL:accessRequestHandler:", "preview",
                        "preview", false, std::move(compositionAVURL),
                        std::move(accessRequestHandler));
}

void SavedRecordingService::prepareToTrimCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler) {
  _prepareAccessSession("prepareToTrimCompositionAVURL:accessRequestHandler:", "trimming",
                        "trimming", true, std::move(compositionAVURL),
                        std::move(accessRequestHandler));
}

void SavedRecordingService::endAccessSessionWithToken(
    std::optional<RCSSavedRecordingAccessToken> accessToken) {
  QV_LOG(platform::kLogLevelDebug, "Ending access session: {}.",
         accessToken ? accessToken->debugDescription() : std::string("(null)"));
  if (!accessToken) {
    _logMissingParameter("accessToken", "endAccessSessionWithToken:");
    return;
  }
  // Any holder of an equal token ends the session: tokens are capabilities.
  _performOnServiceQueue(
      [this, self = shared_from_this(), token = std::move(*accessToken)] {
        _onQueueCloseAccessSession(_assetSesionController->activeSessionWithAccessToken(token),
                                   true);
      },
      WorkLength::Short);
}

void SavedRecordingService::disableOrphanedFragmentCleanupForCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, CompletionHandler completionBlock) {
  _addDisabledOrphanCleanupForCompositionAVURL(std::move(compositionAVURL), rcs_currentConnection(),
                                               std::move(completionBlock));
}

void SavedRecordingService::enableOrphanedFragmentCleanupForCompositionAVURL(
    std::optional<platform::URL> compositionAVURL) {
  _removeDisabledOrphanCleanupForCompositionAVURL(std::move(compositionAVURL),
                                                  rcs_currentConnection());
}

}  // namespace quorvel
