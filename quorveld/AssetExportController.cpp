// The export controller.
//
// A request runs with the operation queue suspended, so the operations it
// adds cannot start before their completion handling, dependency and
// callbacks are in place. An operation's completion handling removes it from
// its table on the serial queue before it answers anyone, so a request
// either joins an operation whose callers have not been answered yet, or
// finds no entry and makes a new one: nobody joins an operation whose
// answers are already being delivered.
#include "quorveld/AssetExportController.h"
#include "quorveld/RCSXPCTransaction.h"

#include "platform/Log.h"
#include "platform/MainQueue.h"

namespace quorvel {

namespace {

// Finalizations and waveforms are blocking jobs of a few cores' worth each.
constexpr int kMaxConcurrentExportOperations = 2;

}  // namespace

AssetExportController::AssetExportController() : _serialQueue("AssetExportController") {
  _operationQueue.setMaxConcurrentOperationCount(kMaxConcurrentExportOperations);
  _operationQueue.setSuspended(false);
}

AssetExportController::~AssetExportController() = default;

void AssetExportController::finalizeAssetWithCompositionAVURL(const platform::URL& compositionAVURL,
                                                              bool cacheWaveform,
                                                              CompletionBlock completionBlock) {
  _serialQueue.sync([&] {
    _operationQueue.setSuspended(true);
    auto finalization = _exportOperationsByCompositionAVURL.find(compositionAVURL);
    auto waveform = _waveformOperationsByCompositionAVURL.find(compositionAVURL);
    std::shared_ptr<CompositionExportOperation> exportOperation =
        finalization != _exportOperationsByCompositionAVURL.end() ? finalization->second : nullptr;
    std::shared_ptr<GenerateWaveformOperation> waveformOperation =
        waveform != _waveformOperationsByCompositionAVURL.end() ? waveform->second : nullptr;

    if (!exportOperation && waveformOperation && !cacheWaveform) {
      // The last finalization is over; only its waveform is still pending.
      if (completionBlock) completionBlock(true, std::nullopt);
      _operationQueue.setSuspended(false);
      return;
    }
    if (!exportOperation && !waveformOperation) {
      exportOperation = std::make_shared<CompositionExportOperation>(compositionAVURL);
      exportOperation->setDeleteFragmentsWhenFinished(false);
      QV_LOG(platform::kLogLevelDebug, "adding asset finalization operation: {}",
             exportOperation->description());
      _operationQueue.addOperation(exportOperation);
      _exportOperationsByCompositionAVURL[compositionAVURL] = exportOperation;
      _setCompletionHandling(exportOperation,
                             &AssetExportController::_exportOperationsByCompositionAVURL);
    }
    if (cacheWaveform && !waveformOperation) {
      waveformOperation = std::make_shared<GenerateWaveformOperation>(compositionAVURL);
      QV_LOG(platform::kLogLevelDebug, "adding waveform compute operation: {}",
             waveformOperation->description());
      _operationQueue.addOperation(waveformOperation);
      _waveformOperationsByCompositionAVURL[compositionAVURL] = waveformOperation;
      _setCompletionHandling(waveformOperation,
                             &AssetExportController::_waveformOperationsByCompositionAVURL);
      if (exportOperation) waveformOperation->addDependency(exportOperation);
    }
    if (cacheWaveform) {
      waveformOperation->addExportClientCompletionBlock(std::move(completionBlock));
    } else {
      exportOperation->addExportClientCompletionBlock(std::move(completionBlock));
    }
    _operationQueue.setSuspended(false);
  });
}

template <class OperationT>
void AssetExportController::_setCompletionHandling(
    const std::shared_ptr<OperationT>& operation, Table<OperationT> AssetExportController::*table) {
  // The daemon stays while an operation composes or computes, whatever
  // holds the session it was asked for under: the session of a client that
  // went away may close before the finalization its leaving started ends, and
  // an exit then would leave the composed file half made.
  auto keepAlive = RCSXPCTransaction::initWithName("Keep-alive for export operation");
  keepAlive->beginTransaction();
  operation->setCompletionBlock(
      [weak = std::weak_ptr<OperationT>(operation), self = shared_from_this(), table, keepAlive] {
        auto strong = weak.lock();
        if (strong) {
          self->_serialQueue.sync([&] {
            auto entry = (self.get()->*table).find(strong->compositionAVURL());
            if (entry != (self.get()->*table).end() && entry->second == strong) {
              (self.get()->*table).erase(entry);
            }
          });
        }
        platform::mainQueue().async([strong, keepAlive] {
          if (strong) strong->invokeExportClientCompletionBlocks();
          keepAlive->endTransaction();
        });
      });
}

std::size_t AssetExportController::pendingOperationCountForTesting() {
  std::size_t count = 0;
  _serialQueue.sync([&] {
    count =
        _exportOperationsByCompositionAVURL.size() + _waveformOperationsByCompositionAVURL.size();
  });
  return count;
}

void AssetExportController::setMaxConcurrentOperationCountForTesting(int count) {
  _operationQueue.setMaxConcurrentOperationCount(count);
}

void AssetExportController::waitUntilAllOperationsAreFinishedForTesting() {
  _operationQueue.waitUntilAllOperationsAreFinished();
}

}  // namespace quorvel
