// RCSavedRecording: one recording of the recordings database (UUID, audio
// file, title, date, duration). Objects come from RCSavedRecordingsModel,
// which hands out one object per recording while someone holds it. Setters
// record a change with the model, which saves it at once, or at the next
// saveIfNecessary while saving is disabled. Used on the model's queue only.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Date.h"
#include "platform/URL.h"
#include "platform/UUID.h"

namespace quorvel {

class RCSavedRecordingsModel;

class RCSavedRecording : public std::enable_shared_from_this<RCSavedRecording> {
 public:
  // "quorvel://recording/"
  static constexpr std::string_view kURIPrefix = "quorvel://recording/";

  // The UUID named by a URIRepresentation; nullopt for anything else.
  static std::optional<platform::UUID> uniqueIDFromURIRepresentation(std::string_view uri);

  const platform::UUID& uniqueID() const { return uniqueID_; }
  // The file URL of its audio file; nullopt when the record names none.
  std::optional<platform::URL> url() const;
  // "quorvel://recording/<UUID>": identifies the record in the database.
  std::string URIRepresentation() const;

  // The title.
  const std::string& customLabel() const { return customLabel_; }
  void setCustomLabel(std::string customLabel);
  const platform::Date& date() const { return date_; }
  void setDate(platform::Date date);
  // Seconds.
  double duration() const { return duration_; }
  void setDuration(double duration);

  // Whether it holds changes the database does not have yet.
  bool hasChanges() const { return isNew_ || isChanged_; }

  // Made by the model only.
  RCSavedRecording(std::weak_ptr<RCSavedRecordingsModel> model, std::string directory,
                   platform::UUID uniqueID, std::string storedPath, std::string customLabel,
                   platform::Date date, double duration, bool isNew);

 private:
  friend class RCSavedRecordingsModel;
  void didChange();

  std::weak_ptr<RCSavedRecordingsModel> model_;
  std::string directory_;
  platform::UUID uniqueID_;
  // Relative to the recordings directory when the file lies inside it,
  // absolute otherwise; empty when there is no file.
  std::string storedPath_;
  std::string customLabel_;
  platform::Date date_;
  double duration_;
  bool isNew_;
  bool isChanged_ = false;
};

}  // namespace quorvel
