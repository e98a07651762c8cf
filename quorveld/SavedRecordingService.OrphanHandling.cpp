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
//
// The decision is the service queue's; the work is not. Repairing a
// recording may read every fragment's audio in the media worker and saves
// the manifest with an fsync, so a cleanup with something to do runs on an
// operation queue of its own, and the service queue answers everyone else
// meanwhile. Cleanups of one recording (by bundle path) run one at a time;
// the next decides afresh once the running one is done. A hold's reply also
// waits for a running cleanup, so a client that hears its hold stands knows
// nothing is deleting in the bundle any more.
#include <fmt/format.h>

#include <set>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionController.h"
#include "platform/Log.h"
#include "platform/OperationQueue.h"
#include "quorveld/RCSAdditions.h"
#include "quorveld/RCSXPCTransaction.h"
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
  _performOnServiceQueue(
      [this, self = shared_from_this(), compositionAVURL, ignored = std::move(ignoredAccessSession),
       completion = std::move(completionBlock)]() mutable {
        _onQueueCleanUpOrphanedFragments(compositionAVURL, std::move(ignored),
                                         std::move(completion));
      },
      WorkLength::Short);
}

void SavedRecordingService::_onQueueCleanUpOrphanedFragments(
    const platform::URL& compositionAVURL, std::shared_ptr<AssetAccessSession> ignored,
    WorkBlock completion) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  auto finish = [&completion] {
    if (completion) completion();
  };
  const std::string bundle = compositionAVURL.URLByStandardizingPath().path();
  if (auto* waiting = _onQueueWorkWaitingForFragmentCleanup(bundle)) {
    // Decided afresh once the running one has finished: holds and sessions
    // may have changed by then.
    waiting->push_back([this, compositionAVURL, ignored = std::move(ignored),
                        completion = std::move(completion)]() mutable {
      _onQueueCleanUpOrphanedFragments(compositionAVURL, std::move(ignored), std::move(completion));
    });
    return;
  }
  if (orphanedFragmentCleanupHoldCount(compositionAVURL) > 0 ||
      _onServiceQueueHasActiveSessionsForCompositionAVURL(compositionAVURL, ignored)) {
    return finish();
  }
  // The common case, a recording whose fragments were read before and
  // that has nothing to tidy, is decided here at once.
  if (RCCompositionController::isKnownToHaveNothingToRepairOrCleanUp(compositionAVURL)) {
    return finish();
  }
  auto controller =
      RCCompositionController::compositionControllerForComposedAVURL(compositionAVURL);
  if (!controller->composition()) {
    QV_LOG(platform::kLogLevelError,
           "WARNING: attempt to delete orphaned fragments for {} failed because the composition "
           "failed to load",
           compositionAVURL.absoluteString());
    return finish();
  }
  if (controller->hasNothingToRepairOrCleanUp()) return finish();

  // Reading fragments' audio, saving the manifest and deleting files may
  // take long: that runs off the service queue, which goes on answering.
  // The recording's next cleanup waits for this one, and the session that
  // asked gets its token only when it is done, so nothing can start writing
  // into the bundle while it is tidied.
  _fragmentCleanupsInProgress.emplace(bundle,
                                      FragmentCleanup{.compositionAVURL = compositionAVURL});
  // Keeps the daemon alive while it reads and deletes, also when no session
  // asked (a released hold).
  auto keepAlive = RCSXPCTransaction::initWithName("Fragment cleanup of " +
                                                   compositionAVURL.lastPathComponent());
  keepAlive->beginTransaction();
  auto tidy = std::make_shared<platform::BlockOperation>([controller] {
    controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
    auto repaired = controller->composition();
    if (!repaired) return;
    repaired->enumerateOrphanedFragmentsWithBlock([](const RCCompositionFragment& fragment, bool&) {
      QV_LOG(platform::kLogLevelNotice,
             "NOTE: cleaning (deleting) orphaned fragment '{}' no longer in use.",
             fragment.AVOutputURL().path());
      // What the removal refuses or fails to do is left for the next
      // cleanup.
      (void)fragment.deleteFromFilesystem();
    });
  });
  // Holds the service weakly, and hands its reference on: the operation
  // queue is the service's own, and must not be destroyed from one of its
  // threads.
  tidy->setCompletionBlock([weak = weak_from_this(), bundle, keepAlive,
                            completion = std::move(completion)]() mutable {
    auto self = weak.lock();
    if (!self) return keepAlive->endTransaction();
    SavedRecordingService* service = self.get();
    service->_performOnServiceQueue(
        [self = std::move(self), bundle, keepAlive, completion = std::move(completion)]() mutable {
          self->_onQueueFinishFragmentCleanup(bundle, std::move(completion));
          keepAlive->endTransaction();
        },
        WorkLength::Short);
  });
  _fragmentCleanupOperationQueue->addOperation(std::move(tidy));
}

void SavedRecordingService::_onQueueFinishFragmentCleanup(const std::string& bundle,
                                                          WorkBlock completion) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  if (completion) completion();
  auto done = _fragmentCleanupsInProgress.extract(bundle);
  if (done.empty()) return;
  for (WorkBlock& next : done.mapped().waiting) next();
}

std::vector<SavedRecordingService::WorkBlock>*
SavedRecordingService::_onQueueWorkWaitingForFragmentCleanup(const std::string& bundle) {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  auto running = _fragmentCleanupsInProgress.find(bundle);
  return running == _fragmentCleanupsInProgress.end() ? nullptr : &running->second.waiting;
}

void SavedRecordingService::_addDisabledOrphanCleanupForCompositionAVURL(
    std::optional<platform::URL> compositionAVURL,
    std::shared_ptr<platform::Connection> xpcConnection, CompletionHandler completionBlock) {
  _performOnServiceQueue(
      [this, self = shared_from_this(), url = std::move(compositionAVURL),
       connection = std::move(xpcConnection), completion = std::move(completionBlock)]() mutable {
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
        if (!completion) return;
        // A cleanup of the recording that started before the hold may still be
        // deleting: the client hears that the hold stands only once it is done.
        auto* waiting =
            url ? _onQueueWorkWaitingForFragmentCleanup(url->URLByStandardizingPath().path())
                : nullptr;
        if (!waiting) return completion(std::nullopt);
        waiting->push_back(
            [completion = std::move(completion)]() mutable { completion(std::nullopt); });
      },
      WorkLength::Short);
}

void SavedRecordingService::_removeDisabledOrphanCleanupForCompositionAVURL(
    std::optional<platform::URL> compositionAVURL,
    std::shared_ptr<platform::Connection> xpcConnection) {
  _performOnServiceQueue(
      [this, self = shared_from_this(), url = std::move(compositionAVURL),
       connection = std::move(xpcConnection)] {
        if (!url || !connection) return;
        HeldURLs held = heldURLs(*connection);
        if (!held || held->erase(*url) == 0) return;  // not held by this connection
        auto count = _disabledOrphanedFragmentCleanupByCompositionAVURL.find(*url);
        if (count != _disabledOrphanedFragmentCleanupByCompositionAVURL.end() &&
            --count->second == 0) {
          _disabledOrphanedFragmentCleanupByCompositionAVURL.erase(count);
        }
        _attemptOrphanedFragmentsCleanupForCompositionAVURL(*url, nullptr, nullptr);
      },
      WorkLength::Short);
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
      },
      WorkLength::Short);
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
      WorkLength::MayBlock);
}

}  // namespace quorvel
