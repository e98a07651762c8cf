#include "Quorvel/composition/RCCompositionEditor.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>

#include "Quorvel/composition/RCCaptureFormat.h"
#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCFileConfinement.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "Quorvel/media/RCAudioAsset.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "platform/Log.h"
#include "platform/UUID.h"

namespace quorvel {
namespace {

constexpr double kDurationTolerance = 0.001;
constexpr int kMaximumNameAttempts = 10000;

platform::Error invalidEdit(std::string reason) {
  return RCError(RCErrorCodeInvalidEdit, std::move(reason));
}

bool isValidUTF8(std::string_view text) {
  std::size_t i = 0;
  while (i < text.size()) {
    unsigned char c = static_cast<unsigned char>(text[i]);
    std::size_t length = c < 0x80           ? 1
                         : (c >> 5) == 0x6  ? 2
                         : (c >> 4) == 0xE  ? 3
                         : (c >> 3) == 0x1E ? 4
                                            : 0;
    if (length == 0 || i + length > text.size()) return false;
    for (std::size_t k = 1; k < length; ++k) {
      if ((static_cast<unsigned char>(text[i + k]) >> 6) != 0x2) return false;
    }
    i += length;
  }
  return true;
}

bool exists(const std::string& path) {
  struct stat info {};
  return ::lstat(path.c_str(), &info) == 0;
}

double fileDuration(const platform::URL& url) {
  auto asset = RCAudioAsset::assetWithURL(url);
  return asset ? asset->duration() : std::nan("");
}

platform::Status copyFile(const std::string& source, const std::string& directory,
                          const std::string& name) {
  RCScopedFd in(::open(source.c_str(), O_RDONLY | O_CLOEXEC));
  if (!in) return platform::fail(platform::posixError(errno, "open " + source));
  RCScopedFd dir(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!dir) return platform::fail(platform::posixError(errno, "open " + directory));
  RCScopedFd out(::openat(dir.get(), name.c_str(),
                          O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
  if (!out) return platform::fail(platform::posixError(errno, "create " + name));
  char buffer[65536];
  for (;;) {
    auto got = RCReadFully(in.get(), buffer, sizeof buffer, source);
    if (!got) return platform::fail(got.error());
    if (*got == 0) break;
    if (auto written = RCWriteFully(out.get(), std::string_view(buffer, *got), name); !written) {
      return written;
    }
    if (*got < sizeof buffer) break;
  }
  if (::fsync(out.get()) != 0) return platform::fail(platform::posixError(errno, "fsync"));
  return out.close();
}

void markAllDecomposed(RCCompositionManifest& manifest) {
  for (auto& entry : manifest.fragments) entry.composed = false;
}

std::string newFragmentName(std::string_view extension) {
  return platform::UUID::random().string() + "." + std::string(extension);
}

}  // namespace

platform::Result<RCCompositionEditor> RCCompositionEditor::createCompositionForNewRecording(
    RCSavedRecordingsModel& model, std::string_view baseName, std::string_view captureExtension,
    platform::Date date) {
  if (!RCIsPlainFileName(baseName) || !isValidUTF8(baseName)) {
    return platform::fail(
        invalidEdit(fmt::format("'{}' is not a plain UTF-8 file name", baseName)));
  }
  if (!RCCaptureFormat::isFileExtensionSupported(captureExtension)) {
    return platform::fail(
        invalidEdit(fmt::format("'{}' is not a capture format's extension", captureExtension)));
  }
  const std::string& directory = model.directory();
  std::string name;
  for (int attempt = 1; attempt <= kMaximumNameAttempts && name.empty(); ++attempt) {
    std::string candidate = attempt == 1 ? std::string(baseName)
                                         : std::string(baseName) + " " + std::to_string(attempt);
    bool taken = exists(directory + "/" + candidate + ".waveform");
    for (const std::string& extension : RCCaptureFormat::fileExtensionsSupported()) {
      taken = taken || exists(directory + "/" + candidate + "." + extension);
    }
    if (taken) continue;
    // Creating the bundle reserves the name against another app doing the same.
    std::string bundle = directory + "/" + candidate + "." + RCComposition::kBundleExtension;
    if (::mkdir(bundle.c_str(), 0755) == 0) {
      name = candidate;
    } else if (errno != EEXIST) {
      return platform::fail(platform::posixError(errno, "create " + bundle));
    }
  }
  if (name.empty()) return platform::fail(invalidEdit("no free name for a new recording"));

  platform::URL composed =
      platform::URL::fileURLWithPath(directory + "/" + name + "." + std::string(captureExtension));
  platform::URL bundle = RCComposition::compositionBundleURLForComposedAVURL(composed);
  auto recording = model.insertRecordingWithAudioFile(composed.path(), 0, date);
  if (auto saved = model.saveIfNecessary(); !saved) {
    (void)RCRemoveItemConfinedToDirectory(bundle, directory);
    return platform::fail(saved.error());
  }
  RCCompositionManifest manifest;
  manifest.composedName = composed.lastPathComponent();
  manifest.savedRecordingURI = recording->URIRepresentation();
  auto composition = std::make_shared<RCComposition>(bundle, std::move(manifest));
  if (auto saved = composition->saveMetadataToDefaultLocation(); !saved) {
    return platform::fail(saved.error());
  }
  return RCCompositionEditor(std::move(composition));
}

platform::Result<RCCompositionEditor> RCCompositionEditor::editorForComposedAVURL(
    const platform::URL& composedAVURL) {
  std::string directory = RCSavedRecordingsDirectory();
  if (!RCIsURLDirectlyInsideDirectory(composedAVURL, directory) ||
      !RCCaptureFormat::isFileExtensionSupported(composedAVURL.pathExtension())) {
    return platform::fail(
        RCError(RCErrorCodeNotConfined,
                composedAVURL.path() + " is not a recording's audio file in " + directory));
  }
  auto composition = RCComposition::load(
      RCComposition::compositionBundleURLForComposedAVURL(composedAVURL.URLByStandardizingPath()));
  if (!composition) return platform::fail(composition.error());
  return RCCompositionEditor(std::move(*composition));
}

platform::Status RCCompositionEditor::commit(RCCompositionManifest manifest) {
  manifest.recomputeTimeRanges();
  auto next = std::make_shared<RCComposition>(composition_->bundleURL(), std::move(manifest));
  if (auto saved = next->saveMetadataToDefaultLocation(); !saved) return saved;
  composition_ = std::move(next);
  return {};
}

platform::Status RCCompositionEditor::decomposeComposedFileIfNeeded() {
  if (!composition_->manifest().fragments.empty()) return {};
  platform::URL composed = composition_->composedAVURL();
  if (!exists(composed.path())) return {};
  double duration = fileDuration(composed);
  if (!std::isfinite(duration)) {
    return platform::fail(
        RCError(RCErrorCodeUnreadableAudio, composed.lastPathComponent() + " cannot be read"));
  }
  std::string name = newFragmentName(composed.pathExtension());
  std::string target = composition_->bundleURL().path() + "/" + name;
  // The composer replaces the composed file by renaming a new one over it,
  // so a hard link keeps this audio whatever happens to the composed file.
  if (::link(composed.path().c_str(), target.c_str()) != 0) {
    if (auto copied = copyFile(composed.path(), composition_->bundleURL().path(), name); !copied) {
      return copied;
    }
  }
  RCCompositionManifest manifest = composition_->manifest();
  manifest.fragments.push_back({name, {}, 0, duration, true});
  return commit(std::move(manifest));
}

platform::Result<platform::URL> RCCompositionEditor::beginFragment(
    std::string_view captureExtension) {
  if (!RCCaptureFormat::isFileExtensionSupported(captureExtension)) {
    return platform::fail(
        invalidEdit(fmt::format("'{}' is not a capture format's extension", captureExtension)));
  }
  if (auto decomposed = decomposeComposedFileIfNeeded(); !decomposed) {
    return platform::fail(decomposed.error());
  }
  std::string name = newFragmentName(captureExtension);
  RCCompositionManifest manifest = composition_->manifest();
  markAllDecomposed(manifest);
  manifest.fragments.push_back({name, {}, 0, std::nullopt, false});
  if (auto committed = commit(std::move(manifest)); !committed) {
    return platform::fail(committed.error());
  }
  return composition_->URLForFragmentFile(name);
}

platform::Status RCCompositionEditor::finishFragment(const platform::URL& fragmentURL) {
  RCCompositionManifest manifest = composition_->manifest();
  for (auto& entry : manifest.fragments) {
    if (composition_->URLForFragmentFile(entry.file) != fragmentURL) continue;
    double duration = fileDuration(fragmentURL);
    if (!std::isfinite(duration)) {
      return platform::fail(
          RCError(RCErrorCodeUnreadableAudio, fragmentURL.lastPathComponent() + " cannot be read"));
    }
    entry.contentDuration = std::max(0.0, duration - entry.contentStart);
    return commit(std::move(manifest));
  }
  return platform::fail(
      invalidEdit(fragmentURL.lastPathComponent() + " is not a fragment of this composition"));
}

platform::Result<RCCompositionFragment> RCCompositionEditor::appendFragmentFromAudioFile(
    const platform::URL& audioFile) {
  std::string extension = audioFile.pathExtension();
  if (!RCCaptureFormat::isFileExtensionSupported(extension)) {
    return platform::fail(
        invalidEdit(audioFile.lastPathComponent() + " does not have a capture format's extension"));
  }
  double duration = fileDuration(audioFile);
  if (!std::isfinite(duration) || duration <= 0) {
    return platform::fail(RCError(RCErrorCodeUnreadableAudio,
                                  audioFile.lastPathComponent() + " holds no readable audio"));
  }
  auto fragmentURL = beginFragment(extension);
  if (!fragmentURL) return platform::fail(fragmentURL.error());
  platform::Status written = copyFile(audioFile.path(), composition_->bundleURL().path(),
                                      fragmentURL->lastPathComponent());
  if (written) written = finishFragment(*fragmentURL);
  if (!written) {
    // Take the entry back out, then its file: the other order could leave an
    // entry whose file is gone, which repair would handle but need not.
    RCCompositionManifest manifest = composition_->manifest();
    std::erase_if(manifest.fragments, [&](const RCCompositionManifestFragment& entry) {
      return entry.file == fragmentURL->lastPathComponent();
    });
    if (commit(std::move(manifest))) (void)RCRemoveItemInSavedRecordingsDirectory(*fragmentURL);
    return platform::fail(written.error());
  }
  return composition_->fragments().back();
}

platform::Status RCCompositionEditor::setContentRangeOfFragment(std::size_t index, double start,
                                                                double duration) {
  RCCompositionManifest manifest = composition_->manifest();
  if (index >= manifest.fragments.size()) return platform::fail(invalidEdit("no such fragment"));
  if (!std::isfinite(start) || !std::isfinite(duration) || start < 0 || duration < 0) {
    return platform::fail(invalidEdit("a range needs finite, non-negative start and duration"));
  }
  auto& entry = manifest.fragments[index];
  double available = fileDuration(composition_->URLForFragmentFile(entry.file));
  if (std::isfinite(available) && start + duration > available + kDurationTolerance) {
    return platform::fail(invalidEdit("the range goes past the end of " + entry.file));
  }
  entry.contentStart = start;
  entry.contentDuration = duration;
  markAllDecomposed(manifest);
  return commit(std::move(manifest));
}

platform::Status RCCompositionEditor::trimToTimeRange(RCTimeRange range) {
  if (!std::isfinite(range.start) || !std::isfinite(range.duration) || range.start < 0 ||
      range.duration <= 0) {
    return platform::fail(invalidEdit("a trim needs a finite, non-empty range"));
  }
  if (auto decomposed = decomposeComposedFileIfNeeded(); !decomposed) return decomposed;
  RCCompositionManifest manifest = composition_->manifest();
  manifest.recomputeTimeRanges();
  std::vector<RCCompositionManifestFragment> kept;
  for (auto entry : manifest.fragments) {
    if (!entry.contentDuration) {
      return platform::fail(invalidEdit("fragment " + entry.file + " is still being captured"));
    }
    double from = std::max(entry.timeRangeInComposition.start, range.start);
    double to = std::min(entry.timeRangeInComposition.end(), range.end());
    if (to - from <= kDurationTolerance) continue;
    entry.contentStart += from - entry.timeRangeInComposition.start;
    entry.contentDuration = to - from;
    kept.push_back(std::move(entry));
  }
  if (kept.empty()) return platform::fail(invalidEdit("the range holds no audio"));
  manifest.fragments = std::move(kept);
  markAllDecomposed(manifest);
  return commit(std::move(manifest));
}

platform::Status RCCompositionEditor::removeFragment(std::size_t index) {
  RCCompositionManifest manifest = composition_->manifest();
  if (index >= manifest.fragments.size()) return platform::fail(invalidEdit("no such fragment"));
  manifest.fragments.erase(manifest.fragments.begin() + static_cast<std::ptrdiff_t>(index));
  markAllDecomposed(manifest);
  if (manifest.fragments.empty()) {
    // Without fragments the composed file would stand for the recording.
    platform::URL composed = composition_->composedAVURL();
    for (const platform::URL& url : {composed, RCWaveform::waveformURLForAVURL(composed)}) {
      auto removed = RCRemoveItemInSavedRecordingsDirectory(url);
      if (!removed && removed.error().code() != ENOENT) return removed;
    }
    manifest.composedDuration = 0;
  }
  return commit(std::move(manifest));
}

platform::Status RCCompositionEditor::setTitle(RCSavedRecordingsModel& model, std::string title) {
  const std::string& uri = composition_->savedRecordingURI();
  auto recording = model.recordingWithURIRepresentation(uri);
  if (!recording) return platform::fail(recording.error());
  if (!*recording) {
    return platform::fail(invalidEdit("the recording has no database record ('" + uri + "')"));
  }
  (*recording)->setCustomLabel(title);
  if (auto saved = model.saveIfNecessary(); !saved) return saved;
  platform::URL composed = composition_->composedAVURL();
  if (composed.pathExtension() == "m4a" && exists(composed.path())) {
    if (auto written = RCMediaEngine::current()->writeTitle(composed, title, ""); !written) {
      QV_LOG(platform::kLogLevelError, "WARNING: cannot write the title into {}: {}",
             composed.lastPathComponent(), written.error().localizedDescription());
    }
  }
  return {};
}

}  // namespace quorvel
