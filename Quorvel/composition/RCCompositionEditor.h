// RCCompositionEditor: what an app (and the command-line client, and tests)
// needs to make and change a recording: create a composition for a new
// recording, append a fragment from an audio file, trim, set a title. The
// daemon never edits compositions.
//
// An app edits a recording while it holds the daemon's capture or trimming
// session for it. Every change is written to the manifest (atomically)
// before the audio it describes, so a crash at any point leaves a bundle the
// daemon's repair brings back to a consistent state. After an edit that
// changes the audio, every fragment counts as decomposed until the next
// finalization composes them again.
//
// One editor per recording at a time; not synchronized: use it from one
// thread at a time. Blocks on the file system (and the database for titles).
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "platform/Date.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

class RCCompositionEditor {
 public:
  // Creates a new recording in the model's directory (the saved-recordings
  // directory): a free name "<baseName>.<ext>", else "<baseName> 2.<ext>",
  // …; its bundle; a database record (title: that name, the given date,
  // duration 0, saved at once); and a manifest without fragments naming the
  // record. `baseName` must be a plain file name in UTF-8; `captureExtension`
  // one of the capture formats'.
  static platform::Result<RCCompositionEditor> createCompositionForNewRecording(
      RCSavedRecordingsModel& model, std::string_view baseName = "New Recording",
      std::string_view captureExtension = "m4a", platform::Date date = platform::Date::now());

  // An editor of the recording whose composed audio file is `composedAVURL`.
  static platform::Result<RCCompositionEditor> editorForComposedAVURL(
      const platform::URL& composedAVURL);

  const std::shared_ptr<RCComposition>& composition() const { return composition_; }
  platform::URL composedAVURL() const { return composition_->composedAVURL(); }

  // Appends a fragment holding a copy of `audioFile` (a readable audio file
  // with a capture extension and a positive duration), all of it used. The
  // manifest names the new fragment, to the end of its file, before the
  // first byte is copied; once the copy is on disk its duration is recorded.
  platform::Result<RCCompositionFragment> appendFragmentFromAudioFile(
      const platform::URL& audioFile);

  // For a recorder writing audio itself: appends an open-ended fragment
  // (manifest saved) and returns the file URL to write it to (the file is
  // not created).
  platform::Result<platform::URL> beginFragment(std::string_view captureExtension);
  // Records the duration of the fragment written at `fragmentURL`.
  platform::Status finishFragment(const platform::URL& fragmentURL);

  // Uses `duration` seconds of fragment `index`'s file from `start` on.
  platform::Status setContentRangeOfFragment(std::size_t index, double start, double duration);
  // Keeps only [range.start, range.end()) of the composition; fragments
  // wholly outside it leave the manifest (their files become orphaned
  // fragments the daemon deletes). A composition whose fragments were
  // composed and deleted first gets its composed file back as a fragment.
  platform::Status trimToTimeRange(RCTimeRange range);
  // Removes fragment `index` from the composition; removing the last one
  // also removes the composed file (the recording is then empty).
  platform::Status removeFragment(std::size_t index);

  // Sets the recording's title: the database record's customLabel (saved at
  // once) and, for an m4a composed file that exists, its untagged title.
  platform::Status setTitle(RCSavedRecordingsModel& model, std::string title);

 private:
  explicit RCCompositionEditor(std::shared_ptr<RCComposition> composition)
      : composition_(std::move(composition)) {}
  // Saves `manifest` and makes it the current composition.
  platform::Status commit(RCCompositionManifest manifest);
  // Gives a composition without fragments its composed file back as one.
  platform::Status decomposeComposedFileIfNeeded();

  std::shared_ptr<RCComposition> composition_;
};

}  // namespace quorvel
