#include "tools/quorvelctl/Recordings.h"

#include <fmt/format.h>
#include <unistd.h>

#include <cstdio>
#include <nlohmann/json.hpp>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "Quorvel/locale/RCLocalizedRecordingDate.h"
#include "Quorvel/waveform/RCWaveform.h"

namespace quorvelctl {

namespace {

int fail(const std::string& message) {
  std::fprintf(stderr, "quorvelctl: %s\n", message.c_str());
  return 1;
}

platform::URL fileURL(const std::string& text) {
  if (auto url = platform::URL::fromFileURLStringOrPath(text)) return *url;
  return platform::URL::fileURLWithPath(text);  // a relative path
}

bool exists(const platform::URL& url) { return ::access(url.path().c_str(), F_OK) == 0; }

}  // namespace

int newRecording(const std::string& title, const std::vector<std::string>& files, bool json) {
  auto model =
      quorvel::RCSavedRecordingsModel::modelWithDirectory(quorvel::RCSavedRecordingsDirectory());
  if (!model) return fail("cannot open the recordings database: " + model.error().description());
  auto editor = quorvel::RCCompositionEditor::createCompositionForNewRecording(**model, title);
  if (!editor) return fail("cannot make the recording: " + editor.error().description());
  for (const auto& file : files) {
    auto fragment = editor->appendFragmentFromAudioFile(fileURL(file));
    if (!fragment) {
      return fail(fmt::format("cannot add {}: {}", file, fragment.error().description()));
    }
  }
  std::string url = editor->composedAVURL().absoluteString();
  std::printf("%s\n",
              json ? nlohmann::json{{"compositionAVURL", url}}.dump().c_str() : url.c_str());
  return 0;
}

int listRecordings(bool json) {
  auto model =
      quorvel::RCSavedRecordingsModel::modelWithDirectory(quorvel::RCSavedRecordingsDirectory());
  if (!model) return fail("cannot open the recordings database: " + model.error().description());
  nlohmann::json list = nlohmann::json::array();
  auto walked = (*model)->enumerateExistingRecordingsWithBlock([&](const auto& recording, bool&) {
    std::string url = recording->url() ? recording->url()->absoluteString() : std::string();
    if (json) {
      list.push_back({{"title", recording->customLabel()},
                      {"date", recording->date().ISO8601String()},
                      {"duration", recording->duration()},
                      {"compositionAVURL", url}});
      return;
    }
    std::printf("%s\t%s\t%.1f s\t%s\n", recording->customLabel().c_str(),
                quorvel::RCLocalizedRecordingDateWithOptions(recording->date(), 3).c_str(),
                recording->duration(), url.c_str());
  });
  if (!walked) return fail("cannot read the recordings: " + walked.error().description());
  if (json) std::printf("%s\n", nlohmann::json{{"recordings", list}}.dump().c_str());
  return 0;
}

int showRecording(const std::string& text, bool json) {
  platform::URL url = fileURL(text);
  auto composition = quorvel::RCComposition::load(
      quorvel::RCComposition::compositionBundleURLForComposedAVURL(url));
  if (!composition)
    return fail(fmt::format("no composition for {}: {}", text, composition.error().description()));
  const auto& manifest = (*composition)->manifest();
  platform::URL waveform = quorvel::RCWaveform::waveformURLForAVURL(url);
  if (json) {
    nlohmann::json fragments = nlohmann::json::array();
    for (const auto& fragment : manifest.fragments) {
      fragments.push_back({{"file", fragment.file},
                           {"composed", fragment.composed},
                           {"unreadable", fragment.unreadable}});
    }
    std::printf("%s\n", nlohmann::json{{"compositionAVURL", url.absoluteString()},
                                       {"composedDuration", manifest.composedDuration},
                                       {"composedFileExists", exists(url)},
                                       {"waveformExists", exists(waveform)},
                                       {"fragments", fragments}}
                            .dump()
                            .c_str());
    return 0;
  }
  std::printf("%s\n  composed file: %s, %.1f s\n  waveform: %s\n  fragments:\n",
              url.absoluteString().c_str(), exists(url) ? "present" : "missing",
              manifest.composedDuration, exists(waveform) ? "present" : "missing");
  for (const auto& fragment : manifest.fragments) {
    std::printf("    %s (%s)\n", fragment.file.c_str(),
                fragment.unreadable ? "unreadable: left out of the composed file"
                : fragment.composed ? "composed"
                                    : "not composed yet");
  }
  return 0;
}

}  // namespace quorvelctl
