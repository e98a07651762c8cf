#include "Quorvel/composition/RCCompositionManifest.h"

#include <nlohmann/json.hpp>

#include <cmath>

#include "Quorvel/composition/RCCaptureFormat.h"
#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFileConfinement.h"

namespace quorvel {
namespace {

using Json = nlohmann::json;

platform::Error invalid(std::string reason) {
  return RCError(RCErrorCodeInvalidManifest, std::move(reason));
}

std::string extensionOf(std::string_view name) {
  std::size_t dot = name.rfind('.');
  if (dot == std::string_view::npos || dot == 0) return {};
  return std::string(name.substr(dot + 1));
}

// The member `key` of `object`, or nullptr when it is missing.
const Json* member(const Json& object, const char* key) {
  auto found = object.find(key);
  return found == object.end() ? nullptr : &*found;
}

platform::Result<double> time(const Json& object, const char* key, const std::string& where) {
  const Json* value = member(object, key);
  if (value == nullptr) return platform::fail(invalid(where + key + " is missing"));
  if (!value->is_number()) return platform::fail(invalid(where + key + " is not a number"));
  double number = value->get<double>();
  if (!std::isfinite(number) || number < 0) {
    return platform::fail(invalid(where + key + " is not a finite non-negative number"));
  }
  return number;
}

platform::Result<std::string> audioFileName(const Json& object, const char* key,
                                            const std::string& where) {
  const Json* value = member(object, key);
  if (value == nullptr) return platform::fail(invalid(where + key + " is missing"));
  if (!value->is_string()) return platform::fail(invalid(where + key + " is not a string"));
  std::string name = value->get<std::string>();
  if (!RCIsPlainFileName(name)) {
    return platform::fail(invalid(where + key + " '" + name + "' is not a plain file name"));
  }
  if (!RCCaptureFormat::isFileExtensionSupported(extensionOf(name))) {
    return platform::fail(
        invalid(where + key + " '" + name + "' does not have a capture format's extension"));
  }
  return name;
}

platform::Result<RCTimeRange> timeRange(const Json& object, const char* key,
                                        const std::string& where) {
  const Json* value = member(object, key);
  if (value == nullptr) return platform::fail(invalid(where + key + " is missing"));
  if (!value->is_object()) return platform::fail(invalid(where + key + " is not an object"));
  std::string inner = where + key + ".";
  auto start = time(*value, "start", inner);
  if (!start) return platform::fail(start.error());
  auto duration = time(*value, "duration", inner);
  if (!duration) return platform::fail(duration.error());
  return RCTimeRange{*start, *duration};
}

platform::Result<RCCompositionManifestFragment> fragment(const Json& object,
                                                         const std::string& where) {
  if (!object.is_object()) return platform::fail(invalid(where + " is not an object"));
  std::string prefix = where + ".";
  RCCompositionManifestFragment result;
  auto file = audioFileName(object, "file", prefix);
  if (!file) return platform::fail(file.error());
  result.file = std::move(*file);
  if (result.file == RCCompositionManifest::kFileName) {
    return platform::fail(invalid(prefix + "file names the manifest"));
  }
  auto inComposition = timeRange(object, "timeRangeInComposition", prefix);
  if (!inComposition) return platform::fail(inComposition.error());
  result.timeRangeInComposition = *inComposition;

  const Json* content = member(object, "contentRange");
  if (content == nullptr) return platform::fail(invalid(prefix + "contentRange is missing"));
  if (!content->is_object()) {
    return platform::fail(invalid(prefix + "contentRange is not an object"));
  }
  auto start = time(*content, "start", prefix + "contentRange.");
  if (!start) return platform::fail(start.error());
  result.contentStart = *start;
  const Json* duration = member(*content, "duration");
  if (duration == nullptr) {
    return platform::fail(invalid(prefix + "contentRange.duration is missing"));
  }
  if (!duration->is_null()) {
    auto value = time(*content, "duration", prefix + "contentRange.");
    if (!value) return platform::fail(value.error());
    result.contentDuration = *value;
  }

  const Json* composed = member(object, "composed");
  if (composed == nullptr) return platform::fail(invalid(prefix + "composed is missing"));
  if (!composed->is_boolean()) {
    return platform::fail(invalid(prefix + "composed is not true or false"));
  }
  result.composed = composed->get<bool>();
  if (const Json* unreadable = member(object, "unreadable")) {  // optional
    if (!unreadable->is_boolean()) {
      return platform::fail(invalid(prefix + "unreadable is not true or false"));
    }
    result.unreadable = unreadable->get<bool>();
  }
  return result;
}

Json rangeJson(const RCTimeRange& range) {
  return Json{{"start", range.start}, {"duration", range.duration}};
}

}  // namespace

platform::Result<RCCompositionManifest> RCCompositionManifest::parse(std::string_view json) {
  if (json.size() > kMaximumSize) return platform::fail(invalid("the manifest is too large"));
  Json root = Json::parse(json, nullptr, /*allow_exceptions=*/false);
  if (root.is_discarded()) return platform::fail(invalid("the manifest is not JSON"));
  if (!root.is_object()) return platform::fail(invalid("the manifest is not a JSON object"));

  const Json* version = member(root, "formatVersion");
  if (version == nullptr) return platform::fail(invalid("formatVersion is missing"));
  if (!version->is_number_integer()) {
    return platform::fail(invalid("formatVersion is not an integer"));
  }
  if (version->get<std::int64_t>() != kFormatVersion) {
    return platform::fail(
        invalid("formatVersion " + version->dump() + " is not the one this framework knows (1)"));
  }

  RCCompositionManifest manifest;
  auto composed = audioFileName(root, "composedAVURL", "");
  if (!composed) return platform::fail(composed.error());
  manifest.composedName = std::move(*composed);
  auto duration = time(root, "composedDuration", "");
  if (!duration) return platform::fail(duration.error());
  manifest.composedDuration = *duration;

  const Json* uri = member(root, "savedRecordingURI");
  if (uri == nullptr) return platform::fail(invalid("savedRecordingURI is missing"));
  if (uri->is_string()) {
    manifest.savedRecordingURI = uri->get<std::string>();
  } else if (!uri->is_null()) {
    return platform::fail(invalid("savedRecordingURI is neither a string nor null"));
  }

  const Json* fragments = member(root, "fragments");
  if (fragments == nullptr) return platform::fail(invalid("fragments is missing"));
  if (!fragments->is_array()) return platform::fail(invalid("fragments is not an array"));
  std::size_t index = 0;
  for (const Json& entry : *fragments) {
    auto parsed = fragment(entry, "fragments[" + std::to_string(index++) + "]");
    if (!parsed) return platform::fail(parsed.error());
    manifest.fragments.push_back(std::move(*parsed));
  }
  return manifest;
}

void RCCompositionManifest::recomputeTimeRanges() {
  double at = 0;
  for (RCCompositionManifestFragment& entry : fragments) {
    double duration = entry.unreadable ? 0 : entry.contentDuration.value_or(0);
    entry.timeRangeInComposition = RCTimeRange{at, duration};
    at += duration;
  }
  if (!fragments.empty()) composedDuration = at;
}

std::string RCCompositionManifest::serialize() const {
  Json fragmentList = Json::array();
  for (const RCCompositionManifestFragment& entry : fragments) {
    Json content{{"start", entry.contentStart},
                 {"duration", entry.contentDuration ? Json(*entry.contentDuration) : Json()}};
    Json fragment{{"file", entry.file},
                  {"timeRangeInComposition", rangeJson(entry.timeRangeInComposition)},
                  {"contentRange", std::move(content)},
                  {"composed", entry.composed}};
    if (entry.unreadable) fragment["unreadable"] = true;
    fragmentList.push_back(std::move(fragment));
  }
  Json root{{"formatVersion", kFormatVersion},
            {"composedAVURL", composedName},
            {"composedDuration", composedDuration},
            {"savedRecordingURI", savedRecordingURI.empty() ? Json() : Json(savedRecordingURI)},
            {"fragments", std::move(fragmentList)}};
  // Replacement characters keep a file name that is not valid UTF-8 from
  // making dump() throw.
  return root.dump(2, ' ', false, Json::error_handler_t::replace) + "\n";
}

}  // namespace quorvel
