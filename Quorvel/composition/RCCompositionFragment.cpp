#include "Quorvel/composition/RCCompositionFragment.h"

#include "Quorvel/files/RCFileConfinement.h"

namespace quorvel {

RCCompositionFragment::RCCompositionFragment(platform::URL AVOutputURL,
                                             RCTimeRange timeRangeInComposition,
                                             double contentStart,
                                             std::optional<double> contentDuration)
    : AVOutputURL_(std::move(AVOutputURL)),
      timeRangeInComposition_(timeRangeInComposition),
      contentStart_(contentStart),
      contentDuration_(contentDuration) {}

RCCompositionFragment::RCCompositionFragment(platform::URL AVOutputURL)
    : AVOutputURL_(std::move(AVOutputURL)) {}

platform::Status RCCompositionFragment::deleteFromFilesystem() const {
  return RCRemoveItemInSavedRecordingsDirectory(AVOutputURL_);
}

}  // namespace quorvel
