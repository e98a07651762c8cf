// RCCompositionController: the daemon's handle on one recording's
// composition: loads it (only for a composed AVURL directly inside the
// recordings directory), repairs its fragment metadata, and composes its
// fragments into the composed audio file.
//
// Thread-safe: every member may be called from any thread. composition()
// hands out the current composition; the controller never changes one it
// has handed out, it replaces it (after a repair or a compose).
#pragma once

#include <functional>
#include <memory>
#include <mutex>

#include "Quorvel/composition/RCComposition.h"
#include "platform/URL.h"

namespace quorvel {

class RCCompositionController {
 public:
  using CompletionBlock = std::move_only_function<void(bool success)>;

  // The controller of the recording whose composed audio file is
  // `composedAVURL`. Its composition is nullptr (the reason logged) when the
  // URL is not a file with a capture extension directly inside the recordings
  // directory, or its bundle does not load. Reads the file system.
  static std::shared_ptr<RCCompositionController> compositionControllerForComposedAVURL(
      const platform::URL& composedAVURL);

  // A controller of `composition` (which may be nullptr).
  explicit RCCompositionController(std::shared_ptr<RCComposition> composition);
  static std::shared_ptr<RCCompositionController> initWithComposition(
      std::shared_ptr<RCComposition> composition) {
    return std::make_shared<RCCompositionController>(std::move(composition));
  }

  // The current composition, or nullptr when there is none.
  std::shared_ptr<RCComposition> composition() const;

  // Brings the fragment metadata into a consistent state and saves it when it
  // changed: fragments whose files are gone (or empty) are dropped; each
  // remaining fragment's used range is checked against its file's duration
  // (an open-ended one, left by a capture that never finished, is closed at
  // the file's end; one longer than its file is cut to it); the fragments are
  // laid end to end and the composed duration recomputed. A fragment whose
  // file the media engine found holding no usable audio stays, marked
  // unreadable (no time in the composition, never composed, its file kept);
  // one marked so whose file reads again is unmarked, so the next compose
  // takes it back. A file that cannot be looked at now leaves its entry as it
  // is. Blocks on the file system, and reads the files it has no verdict on
  // yet in one media job.
  void rcs_repairDecomposedFragmentMetadataIfNecessary();

  // True when the repair above would change nothing and no orphaned
  // fragment lies in the bundle, told from durations already read: never
  // starts a media job and writes nothing, so it may run where blocking is
  // not allowed. False when the composition did not load, or when telling
  // would need a file's audio read.
  bool hasNothingToRepairOrCleanUp() const;
  // True when hasNothingToRepairOrCleanUp() said so of the recording before
  // and neither its bundle directory, its manifest nor a fragment file has
  // changed since: a few stats, without loading the composition.
  static bool isKnownToHaveNothingToRepairOrCleanUp(const platform::URL& composedAVURL);

  // Composes every fragment's used range, in order, into the composed audio
  // file (and, with composeWaveform, its waveform file beside it), on the
  // global queue; returns at once. A fragment whose audio the media engine
  // finds unusable, before or while composing, is marked unreadable and left
  // out; composing fails when no fragment is left, or when a file cannot be
  // looked at (then nothing is marked). On success every other fragment is
  // marked composed and the manifest saved; with deleteFragments the
  // manifest drops the fragments first and their files are removed after,
  // unless a fragment was left out (then every fragment and file stays, so
  // it can be composed back in its place). Nothing to compose (no
  // decomposed fragments, and not every fragment unreadable) is a success
  // that touches nothing but the database's duration of the recording, when
  // it differs from the composed one (a compose interrupted after its
  // manifest was saved). A database that does not take the new duration
  // after a compose fails it.
  // `completionBlock` runs exactly once, on a global queue thread.
  // canGenerateWaveformByProcessingAVURL is accepted for the interface; the
  // composer always computes the waveform from the audio it writes.
  void rcs_composeToFinalDestinationAndDeleteDecomposedFragments(
      bool deleteFragments, bool composeWaveform, bool canGenerateWaveformByProcessingAVURL,
      CompletionBlock completionBlock);

  // The composing itself, on the calling thread (blocks for the whole job).
  // Composes of one bundle run one at a time, however its URL is spelled:
  // a compose that waited for another starts from the manifest that one
  // left, and finds nothing to do when it composed everything.
  platform::Status composeNow(bool deleteFragments, bool composeWaveform);

 private:
  struct State {
    mutable std::mutex mutex;
    std::shared_ptr<RCComposition> composition;
  };
  std::shared_ptr<State> state_;
};

}  // namespace quorvel
