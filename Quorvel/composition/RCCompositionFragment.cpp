#include "Quorvel/composition/RCCompositionFragment.h"

#include "Quorvel/files/RCFileConfinement.h"

namespace quorvel {

RCCompositionFragment::RCCompositionFragment(platform::URL AVOutputURL,
                                             RCTimeRange timeRangeInComposition,
                                             double contentStart,
                                             std::optional<double> contentDuration, bool composed)
    : AVOutputURL_(std::move(AVOutputURL)),
      timeRangeInComposition_(timeRangeInComposition),
      contentStart_(contentStart),
      contentDuration_(contentDuration),
      composed_(composed) {}

RCCompositionFragment::RCCompositionFragment(platform::URL AVOutputURL)
    : AVOutputURL_(std::move(AVOutputURL)) {}

platform::Status RCCompositionFragment::deleteFromFilesystem() const {
  return RCRemoveItemInSavedRecordingsDirectory(AVOutputURL_);
}

}  // namespace quorvel
