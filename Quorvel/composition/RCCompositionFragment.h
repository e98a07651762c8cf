// RCCompositionFragment: one audio file of a composition bundle, with the
// part of its audio the composition uses and where that part sits in the
// composition. A value type, safe to copy and share across threads; it
// describes a file, it does not hold it open.
//
// Fragments handed out by orphan enumeration are files the manifest does not
// use: only their AVOutputURL is meaningful.
#pragma once

#include <optional>

#include "Quorvel/composition/RCCompositionManifest.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

class RCCompositionFragment {
 public:
  RCCompositionFragment(platform::URL AVOutputURL, RCTimeRange timeRangeInComposition,
                        double contentStart, std::optional<double> contentDuration);
  // A fragment that is only a file (an orphan).
  explicit RCCompositionFragment(platform::URL AVOutputURL);

  // The fragment's audio file, inside its bundle.
  const platform::URL& AVOutputURL() const { return AVOutputURL_; }
  const RCTimeRange& timeRangeInComposition() const { return timeRangeInComposition_; }
  // Seconds into the file where the used audio starts.
  double contentStart() const { return contentStart_; }
  // Seconds of the file used; nullopt while it is being captured (to the end).
  const std::optional<double>& contentDuration() const { return contentDuration_; }

  // Removes the file through the confined removal of the recordings directory:
  // refused outside it or through a symbolic link. Blocks on the file system.
  platform::Status deleteFromFilesystem() const;

 private:
  platform::URL AVOutputURL_;
  RCTimeRange timeRangeInComposition_;
  double contentStart_ = 0;
  std::optional<double> contentDuration_;
};

}  // namespace quorvel
