// The export operations: the daemon's blocking media jobs, run on the export
// controller's operation queue (see AssetExportController).
//
//  - AssetExportOperation: the base. Runs its subclass's run() once in
//    main(), records the outcome (exportSuccess(), exportError()), does not
//    run at all when an operation it depends on failed, and collects the
//    completion callbacks of every client that asked for this work.
//  - CompositionExportOperation: finalization. Composes the recording's
//    decomposed fragments into its audio file and waveform, and waits.
//  - GenerateWaveformOperation: computes and saves the recording's waveform
//    file, unless one exists.
//
// Owned through std::shared_ptr by the operation queue, the controller's
// table and pending callbacks. main() and run() run on a worker thread of
// the operation queue and block it for the whole job; the outcome is set
// before main() returns and never changes after. addExportClientCompletion-
// Block() is called on the controller's serial queue before the operation
// can finish; invokeExportClientCompletionBlocks() on the main queue after
// it has finished. The rest may be called from any thread.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "platform/Error.h"
#include "platform/Operation.h"
#include "platform/URL.h"

namespace quorvel {

class AssetExportOperation : public platform::Operation {
 public:
  using ExportClientCompletionBlock =
      std::move_only_function<void(bool success, std::optional<platform::Error> error)>;

  explicit AssetExportOperation(platform::URL compositionAVURL);

  const platform::URL& compositionAVURL() const { return _compositionAVURL; }
  bool exportSuccess() const { return _exportSuccess; }
  const std::optional<platform::Error>& exportError() const { return _exportError; }

  // "<Class: 0x…> : /path/of/the/recording.m4a"; every log line of the
  // export subsystem names an operation this way.
  std::string description() const override;

  // Appends `block` (an empty one is ignored); never removed.
  void addExportClientCompletionBlock(ExportClientCompletionBlock block);
  // Calls every collected block, in the order added, with the outcome.
  void invokeExportClientCompletionBlocks();

  void main() final;

 protected:
  // The work; main() calls it once. The base does nothing and fails.
  virtual bool run(std::optional<platform::Error>* error);

 private:
  // The error of the first dependency (in the order added) that failed, a
  // generic error when it failed without one; nullopt when none failed.
  std::optional<platform::Error> _firstDependencyError() const;

  const platform::URL _compositionAVURL;
  // Controller's serial queue until finished, then the main queue.
  std::vector<ExportClientCompletionBlock> _exportClientCompletionBlock;
  // Written by main() before the operation finishes.
  bool _exportSuccess = false;
  std::optional<platform::Error> _exportError;
};

class CompositionExportOperation final : public AssetExportOperation {
 public:
  using AssetExportOperation::AssetExportOperation;

  // The controller sets it to false; composing never deletes fragments
  // here, the orphaned-fragment cleanup does.
  bool deleteFragmentsWhenFinished() const { return _deleteFragmentsWhenFinished; }
  void setDeleteFragmentsWhenFinished(bool value) { _deleteFragmentsWhenFinished = value; }

 protected:
  bool run(std::optional<platform::Error>* error) override;

 private:
  bool _deleteFragmentsWhenFinished = false;
};

class GenerateWaveformOperation final : public AssetExportOperation {
 public:
  using AssetExportOperation::AssetExportOperation;

 protected:
  // A failure is false without an error.
  bool run(std::optional<platform::Error>* error) override;
};

}  // namespace quorvel
