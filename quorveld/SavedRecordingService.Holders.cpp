// Who holds a recording: the listings of the Sessions interface and the
// AccessSessionsChanged signal.
//
// The listings are snapshots taken on the service serial queue; the holders'
// credentials are asked of the bus afterwards, by the D-Bus edge, so nothing
// here waits for the bus. The signal is coalesced: the first change of a turn
// queues one flush behind the work already queued, and every recording that
// changed until the flush runs gets one signal, however often it changed.
#include <algorithm>
#include <utility>

#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "platform/DispatchQueue.h"
#include "quorveld/SavedRecordingService.h"

namespace quorvel {

void SavedRecordingService::listAccessSessions(AccessListingHandler reply) {
  _performOnServiceQueue(
      [this, self = shared_from_this(), reply = std::move(reply)]() mutable {
        std::vector<AccessListing> listing;
        for (const auto& session : _assetSesionController->activeSessions()) {
          const bool closing =
              std::ranges::find(_closingSessions, session) != _closingSessions.end();
          listing.push_back(AccessListing{
              .accessName = session->accessToken().accessName(),
              .exclusive =
                  session->accessToken().accessType() == RCSSavedRecordingAccessTypeExclusive,
              .compositionAVURL = session->compositionAVURL(),
              .state = closing ? RCSAccessSessionStateClosing : RCSAccessSessionStateOpen,
              .since = session->openedAt(),
              .connection = session->xpcConnection()});
        }
        reply(std::move(listing));
      },
      WorkLength::Short);
}

void SavedRecordingService::listDeferredRequests(AccessListingHandler reply) {
  _performOnServiceQueue(
      [this, self = shared_from_this(), reply = std::move(reply)]() mutable {
        std::vector<AccessListing> listing;
        for (const auto& [url, request] : _compositionAVURLsDeferredAccessRequestBlocksByAVURL) {
          listing.push_back(AccessListing{.accessName = request.name,
                                          .exclusive = request.exclusive,
                                          .compositionAVURL = url,
                                          .since = request.since,
                                          .connection = request.connection});
        }
        std::ranges::sort(listing, {}, &AccessListing::since);
        reply(std::move(listing));
      },
      WorkLength::Short);
}

void SavedRecordingService::_onQueueNoteAccessSessionsChanged(
    const platform::URL& compositionAVURL) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  const bool flushQueued = !_accessSessionsChangedCompositionAVURLs.empty();
  _accessSessionsChangedCompositionAVURLs.insert(compositionAVURL);
  if (flushQueued) return;
  _performOnServiceQueue(
      [this, self = shared_from_this()] {
        auto changed = std::exchange(_accessSessionsChangedCompositionAVURLs, {});
        auto listener = _xpcListener;
        if (!listener) return;
        for (const platform::URL& url : changed) {
          listener->emitSignal(RCSSignalAccessSessionsChanged, {url.absoluteString()});
        }
      },
      WorkLength::Short);
}

}  // namespace quorvel
