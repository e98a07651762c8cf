// Orphan handling control: the cleanup of a recording's orphaned fragments
// with the holds clients place on it, and the switch of the orphan recovery
// run.
//
// The cleanup runs when a session on the recording opens or closes and when
// a hold on it is released, and deletes nothing while another session is
// open on the recording or any client holds it off. Holds are counted per
// recording, one per connection, and remembered on the connection itself,
// so a client that vanishes releases them: each release is its own step on
// the service serial queue, queued behind the closes of the client's
// sessions, whose cleanups therefore still see the holds. Files go only
// through the framework's confined removal.
#include <fmt/format.h>

#include <set>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionController.h"
#include "platform/Log.h"
#include "quorveld/RCSAdditions.h"
#include "quorveld/SavedRecordingService.h"

namespace quorvel {

namespace {

constexpr const char* kDisabledOrphanedFragmentCleanupAVURLsKey =
    "disabledOrphanedFragmentCleanupAVURLs";

// The connection's set of held recordings, stored on the connection as a
// shared set so it can be changed in place; nullptr when none was made.
using HeldURLs = std::shared_ptr<std::set<platform::URL>>;

HeldURLs heldURLs(const platform::Connection& connection) {
  std::any value = rc_userInfoForKey(connection, kDisabledOrphanedFragmentCleanupAVURLsKey);
  auto* held = std::any_cast<HeldURLs>(&value);
  return held ? *held : nullptr;
}

}  // namespace

std::size_t SavedRecordingService::orphanedFragmentCleanupHoldCount(
    const platform::URL& url) const {
  auto found = _disabledOrphanedFragmentCleanupByCompositionAVURL.find(url);
  return found == _disabledOrphanedFragmentCleanupByCompositionAVURL.end() ? 0 : found->second;
}

void SavedRecordingService::_attemptOrphanedFragmentsCleanupForCompositionAVURL(
    const platform::URL& compositionAVURL, std::shared_ptr<AssetAccessSession> ignoredAccessSession,
    WorkBlock completionBlock) {
  _performOnServiceQueue([this, self = shared_from_this(), compositionAVURL,
                          ignored = std::move(ignoredAccessSession),
                          completion = std::move(completionBlock)]() mutable {
    _onQueueCleanUpOrphanedFragments(compositionAVURL, ignored);
    if (completion) completion();
  });
}

void SavedRecordingService::_onQueueCleanUpOrphanedFragments(
    const platform::URL& compositionAVURL, const std::shared_ptr<AssetAccessSession>& ignored) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  if (orphanedFragmentCleanupHoldCount(compositionAVURL) > 0 ||
      _onServiceQueueHasActiveSessionsForCompositionAVURL(compositionAVURL, ignored)) {
    return;
  }
  auto controller =
      RCCompositionController::compositionControllerForComposedAVURL(compositionAVURL);
  if (!controller->composition()) {
    QV_LOG(platform::kLogLevelError,
           "WARNING: attempt to delete orphaned fragments for {} failed because the composition "
           "failed to load",
           compositionAVURL.absoluteString());
    return;
  }
  controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
  auto repaired = controller->composition();
  if (!repaired) return;
  repaired->enumerateOrphanedFragmentsWithBlock([](const RCCompositionFragment& fragment, bool&) {
    QV_LOG(platform::kLogLevelNotice,
           "NOTE: cleaning (deleting) orphaned fragment '{}' no longer in use.",
           fragment.AVOutputURL().path());
    // What the removal refuses or fails to do is left for the next cleanup.
    (void)fragment.deleteFromFilesystem();
  });
}

void SavedRecordingService::_addDisabledOrphanCleanupForCompositionAVURL(
    std::optional<platform::URL> compositionAVURL,
    std::shared_ptr<platform::Connection> xpcConnection, CompletionHandler completionBlock) {
  _performOnServiceQueue([this, self = shared_from_this(), url = std::move(compositionAVURL),
                          connection = std::move(xpcConnection),
                          completion = std::move(completionBlock)]() mutable {
    if (connection) {
      HeldURLs held = heldURLs(*connection);
      if (!held) {
        held = std::make_shared<std::set<platform::URL>>();
        rc_setUserInfo(*connection, held, kDisabledOrphanedFragmentCleanupAVURLsKey);
      }
      if (url && held->insert(*url).second) {
        ++_disabledOrphanedFragmentCleanupByCompositionAVURL[*url];
      }
    }
    if (completion) completion(std::nullopt);
  });
}

void SavedRecordingService::_removeDisabledOrphanCleanupForCompositionAVURL(
    std::optional<platform::URL> compositionAVURL,
    std::shared_ptr<platform::Connection> xpcConnection) {
  _performOnServiceQueue([this, self = shared_from_this(), url = std::move(compositionAVURL),
                          connection = std::move(xpcConnection)] {
    if (!url || !connection) return;
    HeldURLs held = heldURLs(*connection);
    if (!held || held->erase(*url) == 0) return;  // not held by this connection
    auto count = _disabledOrphanedFragmentCleanupByCompositionAVURL.find(*url);
    if (count != _disabledOrphanedFragmentCleanupByCompositionAVURL.end() && --count->second == 0) {
      _disabledOrphanedFragmentCleanupByCompositionAVURL.erase(count);
    }
    _attemptOrphanedFragmentsCleanupForCompositionAVURL(*url, nullptr, nullptr);
  });
}

void SavedRecordingService::_removeDisabledOrphanCleanupAVURLsForConnection(
    const std::shared_ptr<platform::Connection>& xpcConnection) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  HeldURLs held = heldURLs(*xpcConnection);
  if (!held) return;
  const std::set<platform::URL> snapshot = *held;
  for (const auto& url : snapshot)
    _removeDisabledOrphanCleanupForCompositionAVURL(url, xpcConnection);
}

void SavedRecordingService::disableOrphanHandlingWithCompletionBlock(
    CompletionHandler completionBlock) {
  _performOnServiceQueue(
      [this, self = shared_from_this(), completion = std::move(completionBlock)]() mutable {
        _isOrphanHandlingEnabled = false;
        if (completion) completion(std::nullopt);
      });
}

void SavedRecordingService::enableOrphanHandlingWithCompletionBlock(
    CompletionHandler completionBlock) {
  // The recovery run can take seconds on a large directory: it runs on the
  // service queue's own thread, so the bus keeps being read meanwhile.
  _performOnServiceQueue(
      [this, self = shared_from_this(), completion = std::move(completionBlock)]() mutable {
        _isOrphanHandlingEnabled = true;
        // Every enable runs the recovery now, even when it was already on.
        _onQueuePerformOrphanHandlingIfEnabled();
        if (completion) completion(std::nullopt);
      },
      WorkLength::MayTakeLong);
}

}  // namespace quorvel
