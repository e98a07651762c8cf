// Finalization scheduling: the decision whether a recording may be finalized
// now, the hand-over to the export controller, the exporting set that
// clients query with its change signal, the daemon's own "finalize"
// sessions, and the export request, which finalizes before it answers.
//
// A recording is in the exporting set from the moment a finalization with
// work to do is handed over until the controller answers; every attempt
// that passes the exclusivity test signals the change twice (handed over,
// answered), whether or not there was work to do.
#include "quorveld/SavedRecordingService.h"
#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "platform/Log.h"
#include "quorveld/RCSAdditions.h"

namespace quorvel {

namespace {

constexpr const char* kFinalizeSessionName = "finalize";

}  // namespace

void SavedRecordingService::_attemptFinalizationOfCompositionAVURL(
    const platform::URL& compositionAVURL, bool cacheWaveform,
    std::shared_ptr<AssetAccessSession> ignoredAccessSession,
    FinalizationCompletionBlock completionBlock) {
  _performOnServiceQueue([this, self = shared_from_this(), url = compositionAVURL, cacheWaveform,
                          ignored = std::move(ignoredAccessSession),
                          completion = std::move(completionBlock)]() mutable {
    if (_onServiceQueueHasActiveExclusiveSessionForCompositionAVURL(url, ignored)) {
      if (completion) completion(false);
      return;
    }
    _serialQueue.sync([&] {
      auto composition =
          RCCompositionController::compositionControllerForComposedAVURL(url)->composition();
      if (composition && !composition->decomposedFragments().empty()) {
        _compositionAVURLsBeingExported.insert(url);
      }
    });
    _postExportingCompositionAVURLsChanged();
    _assetExportController->finalizeAssetWithCompositionAVURL(
        url, cacheWaveform,
        [this, self, url, completion = std::move(completion)](
            bool success, const std::optional<platform::Error>& /*error*/) mutable {
          _serialQueue.sync([&] { _compositionAVURLsBeingExported.erase(url); });
          if (completion) completion(success);
          _postExportingCompositionAVURLsChanged();
        });
  });  // may block: it reads the manifest and enters the export controller
}

void SavedRecordingService::_attemptToRunDeferredFinalizationOfCompositionAVURL(
    std::optional<platform::URL> compositionAVURL) {
  QV_LOG(platform::kLogLevelNotice, "Received request to schedule finalization of '{}'...",
         compositionAVURL ? compositionAVURL->lastPathComponent() : std::string("(null)"));
  if (!compositionAVURL) {
    _logMissingParameter("compositionAVURL",
                         "_attemptToRunDeferredFinalizationOfCompositionAVURL:");
    return;
  }
  _performOnServiceQueue(
      [this, self = shared_from_this(), url = std::move(*compositionAVURL)] {
        _onServiceQueueOpenAccessSessionNamed(
            kFinalizeSessionName, url, /*exclusive=*/false, /*xpcConnection=*/nullptr,
            [this, self, url](std::shared_ptr<AssetAccessSession> session,
                              std::optional<platform::Error> /*error*/) {
              if (!session) {
                // Waits for a later close of a session on the recording.
                _compositionAVURLsToFinalize.push_back(url);
                return;
              }
              _attemptFinalizationOfCompositionAVURL(
                  url, /*cacheWaveform=*/true, session, [this, self, session](bool /*success*/) {
                    _performOnServiceQueue(
                        [this, self, session] { _onQueueCloseAccessSession(session, true); },
                        WorkLength::Short);
                  });
            });
      },
      WorkLength::Short);
}

void SavedRecordingService::_onQueueScheduleFinalizationAfterEditing(
    const std::shared_ptr<AssetAccessSession>& session) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  if (session->accessToken().accessType() != RCSSavedRecordingAccessTypeExclusive) return;
  const std::optional<platform::URL>& url = session->accessToken().compositionAVURL();
  if (!url) return;
  auto composition =
      RCCompositionController::compositionControllerForComposedAVURL(*url)->composition();
  if (!composition || composition->decomposedFragments().empty()) return;
  _attemptToRunDeferredFinalizationOfCompositionAVURL(*url);
}

void SavedRecordingService::_postExportingCompositionAVURLsChanged() {
  if (auto listener = _xpcListener) {
    listener->emitSignal(
        RCSavedRecordingServiceDidChangeExportingCompositionAVURLsDistributedNotification);
  }
}

void SavedRecordingService::prepareToExportCompositionAVURL(
    std::optional<platform::URL> compositionAVURL, bool cacheWaveform,
    AccessRequestHandler accessRequestHandler,
    std::shared_ptr<platform::Connection> xpcConnection) {
  if (!_checkPrepareRequest("prepareToExportCompositionAVURL:cacheWaveform:accessRequestHandler:",
                            "export", compositionAVURL, accessRequestHandler, xpcConnection)) {
    return;
  }
  _performOnServiceQueue(
      [this, self = shared_from_this(), url = std::move(*compositionAVURL), cacheWaveform,
       connection = std::move(xpcConnection), reply = std::move(accessRequestHandler)]() mutable {
        _onServiceQueueOpenAccessSessionNamed(
            "export", url, /*exclusive=*/false, std::move(connection),
            [this, self, url, cacheWaveform, reply = std::move(reply)](
                std::shared_ptr<AssetAccessSession> session,
                std::optional<platform::Error> error) mutable {
              if (!session) {
                reply(std::nullopt, std::move(error));
                return;
              }
              _attemptFinalizationOfCompositionAVURL(
                  url, cacheWaveform, session,
                  [this, self, session, reply = std::move(reply)](bool finalized) mutable {
                    _performOnServiceQueue(
                        [this, self, session, finalized, reply = std::move(reply)]() mutable {
                          if (finalized) {
                            reply(session->accessToken(), std::nullopt);
                            return;
                          }
                          _onQueueCloseAccessSession(session, true);
                          reply(std::nullopt, std::nullopt);
                        },
                        WorkLength::Short);
                  });
            });
      },
      WorkLength::Short);
}

void SavedRecordingService::fetchExportingCompositionAVURLs(URLSetHandler reply) {
  // Without a reply the request is ignored altogether.
  if (!reply) return;
  _performOnServiceQueue(
      [this, self = shared_from_this(), reply = std::move(reply)]() mutable {
        std::set<platform::URL> snapshot;
        _serialQueue.sync([&] {
          snapshot.insert(_compositionAVURLsBeingExported.begin(),
                          _compositionAVURLsBeingExported.end());
        });
        reply(std::move(snapshot));
      },
      WorkLength::Short);  // the instance queue only ever runs blocks like this one
}

}  // namespace quorvel
