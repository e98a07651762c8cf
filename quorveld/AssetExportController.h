// AssetExportController: the daemon's one queue of finalization and
// waveform work. Per recording it keeps at most one pending finalization and
// one pending waveform operation, folds every further request into the one
// pending, makes a waveform operation wait for the recording's pending
// finalization, runs at most two operations at once, and answers each
// requester with the outcome of the operation it joined.
//
// Owned by the service (made with it). finalizeAssetWithCompositionAVURL()
// may be called from any thread (the service calls it on the service serial
// queue); it runs synchronously on the controller's own serial queue, which
// alone touches the two tables. Requesters are answered on the main queue,
// except the early answer for a recording whose finalization has finished
// while its waveform is still pending, which comes at once, inside the call.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <unordered_map>

#include "platform/Error.h"
#include "platform/OperationQueue.h"
#include "platform/SerialQueue.h"
#include "platform/URL.h"
#include "quorveld/AssetExportOperation.h"

namespace quorvel {

class AssetExportController : public std::enable_shared_from_this<AssetExportController> {
 public:
  using CompletionBlock = AssetExportOperation::ExportClientCompletionBlock;

  AssetExportController();
  ~AssetExportController();
  AssetExportController(const AssetExportController&) = delete;
  AssetExportController& operator=(const AssetExportController&) = delete;

  // Finalizes the recording (and, with cacheWaveform, computes its waveform
  // file), joining the work already pending for it. `completionBlock` (may
  // be empty) is called exactly once with the outcome of the operation it
  // joined.
  void finalizeAssetWithCompositionAVURL(const platform::URL& compositionAVURL, bool cacheWaveform,
                                         CompletionBlock completionBlock);

  // Tests: operations pending (queued or running, not yet answered).
  std::size_t pendingOperationCountForTesting();
  // Tests: 0 holds every operation back (requests still fold and queue);
  // the default lets two run.
  void setMaxConcurrentOperationCountForTesting(int count);
  // Tests: blocks until every queued operation has finished.
  void waitUntilAllOperationsAreFinishedForTesting();

 private:
  template <class OperationT>
  using Table = std::unordered_map<platform::URL, std::shared_ptr<OperationT>>;

  // Controller serial queue only: the removal from `table`, then the answers
  // on the main queue.
  template <class OperationT>
  void _setCompletionHandling(const std::shared_ptr<OperationT>& operation,
                              Table<OperationT> AssetExportController::*table);

  // Any thread.
  platform::OperationQueue _operationQueue;
  platform::SerialQueue _serialQueue;
  // Controller serial queue only:
  Table<CompositionExportOperation> _exportOperationsByCompositionAVURL;
  Table<GenerateWaveformOperation> _waveformOperationsByCompositionAVURL;
};

}  // namespace quorvel
