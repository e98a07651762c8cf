// The export operations. Their lines log under the export controller's tag.
#define QV_LOG_TAG "AssetExportController"
#include "quorveld/AssetExportOperation.h"

#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFileConfinement.h"
#include "Quorvel/files/RCFileStatus.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "platform/Log.h"

namespace quorvel {

AssetExportOperation::AssetExportOperation(platform::URL compositionAVURL)
    : _compositionAVURL(std::move(compositionAVURL)) {}

std::string AssetExportOperation::description() const {
  return fmt::format("{} : {}", platform::Operation::description(), _compositionAVURL.path());
}

void AssetExportOperation::addExportClientCompletionBlock(ExportClientCompletionBlock block) {
  if (block) _exportClientCompletionBlock.push_back(std::move(block));
}

void AssetExportOperation::invokeExportClientCompletionBlocks() {
  for (auto& block : _exportClientCompletionBlock) block(_exportSuccess, _exportError);
}

void AssetExportOperation::main() {
  if (auto failed = _firstDependencyError()) {
    QV_LOG(platform::kLogLevelError,
           "ERROR: Skipping {} because a dependency failed with error: {}", description(),
           failed->description());
    _exportSuccess = false;
    _exportError = RCGenericErrorWithUnderlyingError(*failed);
    return;
  }
  std::optional<platform::Error> error;
  _exportSuccess = run(&error);
  _exportError = error;
  if (error) {
    QV_LOG(platform::kLogLevelError, "ERROR: {} failed with error: {}", description(),
           error->description());
  }
}

bool AssetExportOperation::run(std::optional<platform::Error>* /*error*/) { return false; }

std::optional<platform::Error> AssetExportOperation::_firstDependencyError() const {
  for (const auto& dependency : dependencies()) {
    auto* operation = dynamic_cast<const AssetExportOperation*>(dependency.get());
    if (operation && !operation->exportSuccess()) {
      return operation->exportError() ? *operation->exportError() : RCGenericError();
    }
  }
  return std::nullopt;
}

bool CompositionExportOperation::run(std::optional<platform::Error>* error) {
  auto controller =
      RCCompositionController::compositionControllerForComposedAVURL(compositionAVURL());
  auto composition = controller->composition();
  if (!composition) {
    // No bundle: nothing to finalize. A bundle that does not load is a
    // failure, not a success that would hand out stale audio.
    platform::URL bundle = RCComposition::compositionBundleURLForComposedAVURL(compositionAVURL());
    if (::access(bundle.path().c_str(), F_OK) != 0) return true;
    if (error) {
      *error = RCSSavedRecordingServiceError(RCSSavedRecordingServiceErrorCompositionFailed);
    }
    return false;
  }
  // A recording whose every fragment is left out as unreadable has no audio
  // to export: composing it fails, unless a fragment reads again.
  if (composition->decomposedFragments().empty() && !composition->allFragmentsUnreadable()) {
    return true;
  }

  // The old waveform describes the old audio; a failure (none there) is fine.
  (void)RCRemoveItemInSavedRecordingsDirectory(RCWaveform::waveformURLForAVURL(compositionAVURL()));
  QV_LOG(platform::kLogLevelDebug, "RUNNING asset finalization operation: {}", description());

  // Composed right here, on the operation's own thread: a compose takes
  // minutes and must not sit on a thread of the global queue meanwhile.
  platform::Status composed = controller->composeNow(/*deleteFragments=*/false,
                                                     /*composeWaveform=*/true);
  if (!composed) {
    QV_LOG(platform::kLogLevelError, "ERROR: composing {} failed: {}",
           compositionAVURL().lastPathComponent(), composed.error().description());
  }
  QV_LOG(platform::kLogLevelDebug, "FINISHED asset finalization operation: {}", description());
  if (!composed && error) {
    *error = RCSSavedRecordingServiceError(RCSSavedRecordingServiceErrorCompositionFailed);
  }
  return composed.has_value();
}

bool GenerateWaveformOperation::run(std::optional<platform::Error>* /*error*/) {
  platform::URL waveformURL = RCWaveform::waveformURLForAVURL(compositionAVURL());
  if (::access(waveformURL.path().c_str(), F_OK) == 0) return true;
  // Waveforms are written only beside recordings' own regular audio files.
  if (!RCIsURLDirectlyInsideDirectory(compositionAVURL(), RCSavedRecordingsDirectory()) ||
      !RCFileStatus::atPath(compositionAVURL().path()).isRegularFile()) {
    QV_LOG(platform::kLogLevelError,
           "ERROR: not computing a waveform for {}: it is not a regular file directly inside the "
           "recordings directory",
           compositionAVURL().path());
    return false;
  }
  QV_LOG(platform::kLogLevelDebug, "RUNNING waveform compute operation: {}", description());
  // The media worker decodes the audio and replaces the waveform file whole.
  platform::Status built =
      RCMediaEngine::current()->buildWaveform(compositionAVURL(), waveformURL, {});
  if (!built) {
    QV_LOG(platform::kLogLevelError, "ERROR: computing the waveform of {} failed: {}",
           compositionAVURL().lastPathComponent(), built.error().description());
  }
  bool finished = static_cast<bool>(built);
  QV_LOG(platform::kLogLevelDebug, "FINISHED waveform compute operation: {}", description());
  return finished;
}

}  // namespace quorvel
