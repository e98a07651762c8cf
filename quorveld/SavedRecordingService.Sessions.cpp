// Access sessions on the service serial queue: the open step with its
// deferral, the close procedure with the work that waits for a close, and
// what a vanished client leaves behind.
//
// A close after the client vanished also finalizes the recording (with its
// waveform) before the session goes; a capture or trimming session closed
// normally leaves a recording with uncomposed fragments to a deferred
// finalization, so recordings are finalized in the background after every
// edit, not only on export.
//
// A close runs in steps on the service serial queue: the session is marked
// closing, its recording's orphaned fragments are cleaned (a hop through
// _performOnServiceQueue), and only then does it leave the registry,
// together with the closing list and the start of the recording's deferred
// work, in one step. A request that conflicts while any session is closing
// is deferred rather than refused, because a conflict may be about to go
// away; each recording keeps only its newest deferred request, and the one
// it replaces is answered with error 302.
//
// A deferred request belongs to its client. When the client's connection
// ends, its waiting request is dropped unanswered, and the open step never
// grants anything to a connection already marked invalid. Without both, a
// request re-issued after its client vanished would open a session that
// nothing ever closes, and that session's keep-alive would hold the daemon
// forever.
#include <fmt/format.h>

#include <algorithm>

#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"
#include "platform/Log.h"
#include "quorveld/RCSAdditions.h"
#include "quorveld/SavedRecordingService.h"

namespace quorvel {

namespace {

std::string describe(const std::shared_ptr<platform::Connection>& connection) {
  return connection ? connection->description() : std::string("(null)");
}

}  // namespace

void SavedRecordingService::_onServiceQueueOpenAccessSessionNamed(
    const std::string& name, const platform::URL& compositionAVURL, bool exclusive,
    std::shared_ptr<platform::Connection> xpcConnection,
    AccessSessionHandler accessSessionHandler) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  if (_onServiceQueueConnectionHasEnded(name, compositionAVURL, xpcConnection)) return;

  std::optional<platform::Error> error;
  auto session = _assetSesionController->openAccessSessionWithName(
      name, xpcConnection, compositionAVURL, exclusive, &error);
  if (session) {
    _onQueueNoteAccessSessionsChanged(compositionAVURL);
    // The client gets its token only once the recording's orphaned
    // fragments have been dealt with.
    _attemptOrphanedFragmentsCleanupForCompositionAVURL(
        compositionAVURL, session, [session, handler = std::move(accessSessionHandler)]() mutable {
          handler(session, std::nullopt);
        });
    return;
  }
  if (_closingSessions.empty()) {
    accessSessionHandler(nullptr, std::move(error));
    return;
  }

  auto earlier = _compositionAVURLsDeferredAccessRequestBlocksByAVURL.find(compositionAVURL);
  if (earlier != _compositionAVURLsDeferredAccessRequestBlocksByAVURL.end()) {
    // Answered with 302 now; the store below replaces it.
    earlier->second.run(true);
  }
  // The request is owned by the service's table, so it refers to the
  // service without owning it.
  DeferredAccessRequest request{
      .connection = xpcConnection,
      .run =
          [this, name, compositionAVURL, exclusive, xpcConnection,
           handler = std::move(accessSessionHandler)](bool cancelled) mutable {
            _onServiceQueueRunDeferredAccessRequest(name, compositionAVURL, exclusive,
                                                    std::move(xpcConnection), std::move(handler),
                                                    cancelled);
          },
      .name = name,
      .exclusive = exclusive};
  QV_LOG(platform::kLogLevelDebug, "scheduling deferred access for '{}' request", name);
  _compositionAVURLsDeferredAccessRequestBlocksByAVURL.insert_or_assign(compositionAVURL,
                                                                        std::move(request));
  _onQueueNoteAccessSessionsChanged(compositionAVURL);
}

void SavedRecordingService::_onServiceQueueRunDeferredAccessRequest(
    const std::string& name, const platform::URL& compositionAVURL, bool exclusive,
    std::shared_ptr<platform::Connection> xpcConnection, AccessSessionHandler accessSessionHandler,
    bool cancelled) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  QV_LOG(platform::kLogLevelDebug, "running deferred access block for '{}' request -- {}", name,
         cancelled ? "was canceled!" : "will re-issue request");
  if (cancelled) {
    accessSessionHandler(nullptr, RCSSavedRecordingServiceError(
                                      RCSSavedRecordingServiceErrorDeferredRequestSuperseded));
    return;
  }
  _performOnServiceQueue(
      [this, self = shared_from_this(), name, compositionAVURL, exclusive,
       xpcConnection = std::move(xpcConnection),
       handler = std::move(accessSessionHandler)]() mutable {
        // The request left the recording's table when a session closed; a
        // client gone since then leaves nobody to take the turn, so the work
        // that waited behind the request gets it.
        if (_onServiceQueueConnectionHasEnded(name, compositionAVURL, xpcConnection)) {
          _onServiceQueueRunDeferredWorkForCompositionAVURL(compositionAVURL);
          return;
        }
        _onServiceQueueOpenAccessSessionNamed(name, compositionAVURL, exclusive,
                                              std::move(xpcConnection), std::move(handler));
      },
      WorkLength::Short);
}

bool SavedRecordingService::_onServiceQueueConnectionHasEnded(
    const std::string& name, const platform::URL& compositionAVURL,
    const std::shared_ptr<platform::Connection>& xpcConnection) {
  if (!xpcConnection || rcs_isValid(*xpcConnection)) return false;
  QV_LOG(platform::kLogLevelNotice,
         "Not opening '{}' access session for '{}': connection {} has ended", name,
         compositionAVURL.lastPathComponent(), xpcConnection->description());
  return true;
}

bool SavedRecordingService::_onServiceQueueHasActiveExclusiveSessionForCompositionAVURL(
    const platform::URL& compositionAVURL,
    const std::shared_ptr<AssetAccessSession>& ignoredAccessSession) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  return std::ranges::any_of(
      _assetSesionController->activeSessionsWithWithCompositionAVURL(compositionAVURL),
      [&](const auto& session) {
        return session != ignoredAccessSession &&
               session->accessToken().accessType() == RCSSavedRecordingAccessTypeExclusive;
      });
}

bool SavedRecordingService::_onServiceQueueHasActiveSessionsForCompositionAVURL(
    const platform::URL& compositionAVURL,
    const std::shared_ptr<AssetAccessSession>& ignoredAccessSession) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  return std::ranges::any_of(
      _assetSesionController->activeSessionsWithWithCompositionAVURL(compositionAVURL),
      [&](const auto& session) { return session != ignoredAccessSession; });
}

void SavedRecordingService::_onQueueCloseAccessSession(
    const std::shared_ptr<AssetAccessSession>& session, bool normalTermination) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  if (!session) return;
  _closingSessions.push_back(session);
  _onQueueNoteAccessSessionsChanged(session->compositionAVURL());
  QV_LOG(platform::kLogLevelNotice, "Closing access session: {}.", session->debugDescription());
  QV_LOG(platform::kLogLevelNotice, "Scheduling orphan fragment cleanup for closing session");
  const platform::URL& url = *session->accessToken().compositionAVURL();
  _attemptOrphanedFragmentsCleanupForCompositionAVURL(
      url, session, [this, self = shared_from_this(), session, normalTermination] {
        if (normalTermination) {
          _performOnServiceQueue(
              [this, self, session] {
                QV_LOG(platform::kLogLevelNotice, "Finally closing access session: {}",
                       session->debugDescription());
                // An edit is finalized once: not again when the close has just
                // started the recording's waiting finalization, nor while one
                // still waits for a later close.
                if (!_onQueueFinishClosingAccessSession(session)) {
                  _onQueueScheduleFinalizationAfterEditing(session);
                }
              },
              WorkLength::Short);
          return;
        }
        // The client is gone: finalize what it left, with its waveform,
        // before the session goes, whatever the outcome.
        _attemptFinalizationOfCompositionAVURL(
            *session->accessToken().compositionAVURL(),
            /*cacheWaveform=*/true, session, [this, self, session](bool /*success*/) {
              _performOnServiceQueue(
                  [this, self, session] { _onQueueFinishClosingAccessSession(session); },
                  WorkLength::Short);
            });
      });
}

bool SavedRecordingService::_onQueueFinishClosingAccessSession(
    const std::shared_ptr<AssetAccessSession>& session) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  // One step: a session closed twice is listed twice, and the first final
  // step takes both entries out; the second finds nothing to remove, ends
  // the already ended transaction again and looks for deferred work again.
  std::erase(_closingSessions, session);
  _assetSesionController->closeSession(session);
  _onQueueNoteAccessSessionsChanged(session->compositionAVURL());
  return _onServiceQueueAttemptToRunningDeferredWorkAfterClosingSession(session);
}

bool SavedRecordingService::_onServiceQueueAttemptToRunningDeferredWorkAfterClosingSession(
    const std::shared_ptr<AssetAccessSession>& session) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  const std::optional<platform::URL>& url = session->accessToken().compositionAVURL();
  if (!url) return false;
  bool started = _onServiceQueueRunDeferredWorkForCompositionAVURL(*url);
  // Still waiting (an access request went first): no other finalization
  // may start beside it.
  return started || std::ranges::find(_compositionAVURLsToFinalize, *url) !=
                        _compositionAVURLsToFinalize.end();
}

bool SavedRecordingService::_onServiceQueueRunDeferredWorkForCompositionAVURL(
    const platform::URL& compositionAVURL) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  auto deferred = _compositionAVURLsDeferredAccessRequestBlocksByAVURL.find(compositionAVURL);
  if (deferred != _compositionAVURLsDeferredAccessRequestBlocksByAVURL.end()) {
    auto run = std::move(deferred->second.run);
    _compositionAVURLsDeferredAccessRequestBlocksByAVURL.erase(deferred);
    _onQueueNoteAccessSessionsChanged(compositionAVURL);
    run(false);
    return false;
  }
  // A waiting finalization goes after a waiting access request, and waits
  // for the next close when there was one.
  if (std::erase(_compositionAVURLsToFinalize, compositionAVURL) == 0) return false;
  _attemptToRunDeferredFinalizationOfCompositionAVURL(compositionAVURL);
  return true;
}

void SavedRecordingService::_handleXPCDisconnect(
    const std::shared_ptr<platform::Connection>& connection) {
  _performOnServiceQueue(
      [this, self = shared_from_this(), connection] {
        rcs_setValid(*connection, false);
        // Its waiting request goes unanswered: there is nobody left to
        // answer. What waited behind it gets the turn instead.
        std::vector<platform::URL> dropped;
        std::erase_if(_compositionAVURLsDeferredAccessRequestBlocksByAVURL, [&](const auto& entry) {
          if (entry.second.connection != connection) return false;
          dropped.push_back(entry.first);
          return true;
        });
        for (const platform::URL& url : dropped) {
          _onQueueNoteAccessSessionsChanged(url);
          _onServiceQueueRunDeferredWorkForCompositionAVURL(url);
        }
        for (const auto& session :
             _assetSesionController->activeSessionsWithXPCConnection(connection)) {
          QV_LOG(platform::kLogLevelNotice,
                 "Terminating access session {} for terminated connection: {}",
                 session->debugDescription(), describe(connection));
          _onQueueCloseAccessSession(session, false);
        }
        _removeDisabledOrphanCleanupAVURLsForConnection(connection);
      },
      WorkLength::Short);
}

std::vector<platform::URL>
SavedRecordingService::_onQueue_composedAVURLsWithActiveSessionsOrScheduledWork() {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  std::vector<platform::URL> inUse;
  for (const auto& [url, count] : _disabledOrphanedFragmentCleanupByCompositionAVURL) {
    if (count > 0) inUse.push_back(url);
  }
  for (const auto& [url, request] : _compositionAVURLsDeferredAccessRequestBlocksByAVURL) {
    inUse.push_back(url);
  }
  inUse.insert(inUse.end(), _compositionAVURLsToFinalize.begin(),
               _compositionAVURLsToFinalize.end());
  for (const auto& session : _assetSesionController->activeSessions()) {
    if (const auto& url = session->accessToken().compositionAVURL()) inUse.push_back(*url);
  }
  // Bundles being tidied right now.
  for (const auto& [bundle, cleanup] : _fragmentCleanupsInProgress) {
    inUse.push_back(cleanup.compositionAVURL);
  }
  return inUse;
}

}  // namespace quorvel
