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

void SavedRecordingService::_logMissingParameter(
    const char* parameter, const char* selector,
    const std::shared_ptr<platform::Connection>& xpcConnection) {
  QV_LOG(platform::kLogLevelError,
         "ERROR: received invalid message on connection {}.  {} parameter is required for "
         "invocations of -{}",
         xpcConnection ? xpcConnection->description() : std::string("(null)"), parameter, selector);
}

bool SavedRecordingService::_checkPrepareRequest(
    const char* selector, const char* kind, const std::optional<platform::URL>& url,
    AccessRequestHandler& handler, const std::shared_ptr<platform::Connection>& xpcConnection) {
  QV_LOG(platform::kLogLevelDebug, "Received request to prepare '{}' for {}...",
         url ? url->lastPathComponent() : std::string("(null)"), kind);
  // The handler test comes first: a request missing both gets no reply.
  if (!handler) {
    _logMissingParameter("accessRequestHandler", selector, xpcConnection);
    return false;
  }
  if (!url) {
    _logMissingParameter("compositionAVURL", selector, xpcConnection);
    handler(std::nullopt,
            RCSSavedRecordingServiceError(RCSSavedRecordingServiceErrorMissingCompositionAVURL));
    return false;
  }
  return true;
}

void SavedRecordingService::_prepareAccessSession(
    const char* selector, const char* kind, const char* sessionName, bool exclusive,
    std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler,
    std::shared_ptr<platform::Connection> xpcConnection) {
  if (!_checkPrepareRequest(selector, kind, compositionAVURL, accessRequestHandler, xpcConnection))
    return;
  _performOnServiceQueue(
      [this, self = shared_from_this(), sessionName, exclusive, url = std::move(*compositionAVURL),
       connection = std::move(xpcConnection), reply = std::move(accessRequestHandler)]() mutable {
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
    std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler,
    std::shared_ptr<platform::Connection> xpcConnection) {
  _prepareAccessSession("prepareToCaptureToCompositionAVURL:accessRequestHandler:", "capture",
                        "capture", true, std::move(compositionAVURL),
                        std::move(accessRequestHandler), std::move(xpcConnection));
}

void SavedRecordingService::prepareToPreviewCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler,
    std::shared_ptr<platform::Connection> xpcConnection) {
  _prepareAccessSession("prepareToPreviewCompositionAVURL:accessRequestHandler:", "preview",
                        "preview", false, std::move(compositionAVURL),
                        std::move(accessRequestHandler), std::move(xpcConnection));
}

void SavedRecordingService::prepareToTrimCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler,
    std::shared_ptr<platform::Connection> xpcConnection) {
  _prepareAccessSession("prepareToTrimCompositionAVURL:accessRequestHandler:", "trimming",
                        "trimming", true, std::move(compositionAVURL),
                        std::move(accessRequestHandler), std::move(xpcConnection));
}

void SavedRecordingService::endAccessSessionWithToken(
    std::optional<RCSSavedRecordingAccessToken> accessToken,
    std::shared_ptr<platform::Connection> xpcConnection) {
  QV_LOG(platform::kLogLevelDebug, "Ending access session: {}.",
         accessToken ? accessToken->debugDescription() : std::string("(null)"));
  if (!accessToken) {
    _logMissingParameter("accessToken", "endAccessSessionWithToken:", xpcConnection);
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
    std::optional<platform::URL> compositionAVURL, CompletionHandler completionBlock,
    std::shared_ptr<platform::Connection> xpcConnection) {
  _addDisabledOrphanCleanupForCompositionAVURL(
      std::move(compositionAVURL), std::move(xpcConnection), std::move(completionBlock));
}

void SavedRecordingService::enableOrphanedFragmentCleanupForCompositionAVURL(
    std::optional<platform::URL> compositionAVURL,
    std::shared_ptr<platform::Connection> xpcConnection) {
  _removeDisabledOrphanCleanupForCompositionAVURL(std::move(compositionAVURL),
                                                  std::move(xpcConnection));
}

}  // namespace quorvel
