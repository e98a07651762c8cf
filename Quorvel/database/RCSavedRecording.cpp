#include "Quorvel/database/RCSavedRecording.h"

#include "Quorvel/database/RCSavedRecordingsModel.h"

namespace quorvel {

RCSavedRecording::RCSavedRecording(std::weak_ptr<RCSavedRecordingsModel> model,
                                   std::string directory, platform::UUID uniqueID,
                                   std::string storedPath, std::string customLabel,
                                   platform::Date date, double duration, bool isNew)
    : model_(std::move(model)),
      directory_(std::move(directory)),
      uniqueID_(uniqueID),
      storedPath_(std::move(storedPath)),
      customLabel_(std::move(customLabel)),
      date_(date),
      duration_(duration),
      isNew_(isNew) {}

std::optional<platform::UUID> RCSavedRecording::uniqueIDFromURIRepresentation(
    std::string_view uri) {
  if (!uri.starts_with(kURIPrefix)) return std::nullopt;
  return platform::UUID::fromString(uri.substr(kURIPrefix.size()));
}

std::optional<platform::URL> RCSavedRecording::url() const {
  if (storedPath_.empty()) return std::nullopt;
  if (storedPath_.front() == '/') return platform::URL::fileURLWithPath(storedPath_);
  return platform::URL::fileURLWithPath(directory_ + "/" + storedPath_);
}

std::string RCSavedRecording::URIRepresentation() const {
  return std::string(kURIPrefix) + uniqueID_.string();
}

void RCSavedRecording::setCustomLabel(std::string customLabel) {
  customLabel_ = std::move(customLabel);
  didChange();
}

void RCSavedRecording::setDate(platform::Date date) {
  date_ = date;
  didChange();
}

void RCSavedRecording::setDuration(double duration) {
  duration_ = duration;
  didChange();
}

void RCSavedRecording::didChange() {
  isChanged_ = true;
  if (auto model = model_.lock()) model->recordingDidChange(shared_from_this());
}

}  // namespace quorvel
