// Who holds a recording: the listings of the Sessions interface and the
// AccessSessionsChanged signal.
//
// The listings are snapshots taken on the service serial queue; the holders'
// credentials are asked of the bus afterwards, by the D-Bus edge, so nothing
// here waits for the bus.
//
// The signal is coalesced: the first change starts a short wait, then one
// flush on the service queue sends one signal for every recording that
// changed meanwhile, however often it changed. Each signal is a broadcast the
// bus matches against every client's rules, and a busy recording changes
// twice per session, so a burst of sessions costs the bus one signal per
// recording instead of two per session; a waiting client hears of the change
// a few milliseconds later.
#include <algorithm>
#include <utility>

#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "platform/DispatchQueue.h"
#include "platform/MainQueue.h"
#include "quorveld/SavedRecordingService.h"

namespace quorvel {
namespace {

// How long changes gather before their signals go out.
constexpr auto kAccessSessionsChangedCoalescing = std::chrono::milliseconds(5);

}  // namespace

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
  // The change's own request holds a keep-alive for a second after it, which
  // covers the wait.
  platform::mainQueue().after(kAccessSessionsChangedCoalescing, [self = shared_from_this()] {
    self->_serviceSerialQueue.async([self] {
      auto changed = std::exchange(self->_accessSessionsChangedCompositionAVURLs, {});
      auto listener = self->_xpcListener;
      if (!listener) return;
      for (const platform::URL& url : changed) {
        listener->emitSignal(RCSSignalAccessSessionsChanged, {url.absoluteString()});
      }
    });
  });
}

}  // namespace quorvel
