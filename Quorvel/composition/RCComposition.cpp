#include "Quorvel/composition/RCComposition.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <set>

#include "Quorvel/composition/RCCaptureFormat.h"
#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCDirectoryListing.h"
#include "Quorvel/files/RCDurableFile.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCFileConfinement.h"
#include "Quorvel/files/RCFileStatus.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "platform/Log.h"

namespace quorvel {
namespace {

platform::Error refused(std::string reason) {
  return RCError(RCErrorCodeInvalidManifest, std::move(reason));
}

std::string stemOf(const std::string& name) {
  std::size_t dot = name.rfind('.');
  return dot == std::string::npos || dot == 0 ? name : name.substr(0, dot);
}

std::string extensionOf(const std::string& name) {
  std::size_t dot = name.rfind('.');
  return dot == std::string::npos || dot == 0 ? std::string() : name.substr(dot + 1);
}

std::uint64_t regularFileSize(const std::string& path) {
  const RCFileStatus status = RCFileStatus::atPath(path);
  return status.isRegularFile() ? static_cast<std::uint64_t>(status.info.st_size) : 0;
}

}  // namespace

RCComposition::RCComposition(platform::URL bundleURL, RCCompositionManifest manifest)
    : bundleURL_(std::move(bundleURL)), manifest_(std::move(manifest)) {}

platform::URL RCComposition::compositionBundleURLForComposedAVURL(
    const platform::URL& composedAVURL) {
  return composedAVURL.URLByDeletingPathExtension().URLByAppendingPathExtension(kBundleExtension);
}

platform::Result<std::shared_ptr<RCComposition>> RCComposition::load(
    const platform::URL& bundleURL) {
  std::string directory = RCSavedRecordingsDirectory();
  platform::URL bundle = bundleURL.URLByStandardizingPath();
  if (!RCIsURLDirectlyInsideDirectory(bundle, directory)) {
    return platform::fail(refused("the bundle is not directly inside " + directory));
  }
  if (bundle.pathExtension() != kBundleExtension) {
    return platform::fail(refused("the bundle's extension is not .composition"));
  }
  const RCFileStatus status = RCFileStatus::atPath(bundle.path());
  if (!status.exists()) return platform::fail(platform::posixError(status.error, "the bundle"));
  if (status.isSymbolicLink()) return platform::fail(refused("the bundle is a symbolic link"));
  if (!status.isDirectory()) return platform::fail(refused("the bundle is not a directory"));

  auto text = RCReadFileNoFollow(bundle.path(), RCCompositionManifest::kFileName,
                                 RCCompositionManifest::kMaximumSize);
  if (!text) return platform::fail(text.error());
  auto manifest = RCCompositionManifest::parse(*text);
  if (!manifest) return platform::fail(manifest.error());

  std::string bundleName = bundle.lastPathComponent();
  if (stemOf(manifest->composedName) != stemOf(bundleName)) {
    return platform::fail(refused("composedAVURL '" + manifest->composedName +
                                  "' is not the audio file of this bundle"));
  }
  for (const RCCompositionManifestFragment& entry : manifest->fragments) {
    const RCFileStatus fragment = RCFileStatus::atPath(bundle.path() + "/" + entry.file);
    if (fragment.error == ENOENT) continue;  // gone: the repair drops it
    if (!fragment.exists()) {
      return platform::fail(platform::posixError(fragment.error, "fragment " + entry.file));
    }
    if (fragment.isSymbolicLink()) {
      return platform::fail(refused("fragment '" + entry.file + "' is a symbolic link"));
    }
    if (!fragment.isRegularFile()) {
      return platform::fail(refused("fragment '" + entry.file + "' is not a regular file"));
    }
  }
  return std::make_shared<RCComposition>(bundle, std::move(*manifest));
}

std::shared_ptr<RCComposition> RCComposition::compositionLoadedFromCompositionBundleURL(
    const platform::URL& bundleURL) {
  auto loaded = load(bundleURL);
  if (loaded) return *loaded;
  // A recording without a bundle (made from a file, or never captured into)
  // simply has no composition; only a bundle that is there and fails to load
  // is worth a line.
  struct stat info {};
  if (::lstat(bundleURL.URLByStandardizingPath().path().c_str(), &info) != 0 && errno == ENOENT) {
    return nullptr;
  }
  QV_LOG(platform::kLogLevelError, "ERROR: cannot load the composition '{}': {}",
         bundleURL.lastPathComponent(), loaded.error().localizedDescription());
  return nullptr;
}

platform::URL RCComposition::composedAVURL() const {
  return bundleURL_.URLByDeletingLastPathComponent().URLByAppendingPathComponent(
      manifest_.composedName);
}

platform::URL RCComposition::URLForFragmentFile(const std::string& name) const {
  return platform::URL::fileURLWithPath(bundleURL_.path() + "/" + name);
}

RCCompositionFragment RCComposition::fragmentFor(const RCCompositionManifestFragment& entry) const {
  return RCCompositionFragment(URLForFragmentFile(entry.file), entry.timeRangeInComposition,
                               entry.contentStart, entry.contentDuration);
}

std::vector<RCCompositionFragment> RCComposition::fragments() const {
  std::vector<RCCompositionFragment> result;
  for (const auto& entry : manifest_.fragments) result.push_back(fragmentFor(entry));
  return result;
}

std::vector<RCCompositionFragment> RCComposition::decomposedFragments() const {
  std::vector<RCCompositionFragment> result;
  for (const auto& entry : manifest_.fragments) {
    if (!entry.composed && !entry.unreadable) result.push_back(fragmentFor(entry));
  }
  return result;
}

bool RCComposition::allFragmentsUnreadable() const {
  return !manifest_.fragments.empty() &&
         std::ranges::all_of(manifest_.fragments, [](const RCCompositionManifestFragment& entry) {
           return entry.unreadable;
         });
}

std::uint64_t RCComposition::fileSizeOfAssetsIncludingRelatedResources(bool includeRelated) const {
  platform::URL composed = composedAVURL();
  std::uint64_t total = regularFileSize(composed.path());
  std::set<std::string> counted;
  for (const auto& entry : manifest_.fragments) {
    if (counted.insert(entry.file).second) {
      total += regularFileSize(bundleURL_.path() + "/" + entry.file);
    }
  }
  if (includeRelated) {
    // The composed waveform lives beside the composed file: "<name>.waveform".
    total += regularFileSize(composed.URLByReplacingPathExtension("waveform").path());
    total += regularFileSize(bundleURL_.path() + "/" + RCCompositionManifest::kFileName);
  }
  return total;
}

platform::Status RCComposition::saveMetadataToDefaultLocation() const {
  return RCWriteFileAtomically(bundleURL_.path(), RCCompositionManifest::kFileName,
                               manifest_.serialize());
}

void RCComposition::setSavedRecordingURIFromRecoveredRecordingURI(std::string uri) {
  manifest_.savedRecordingURI = std::move(uri);
}

void RCComposition::enumerateOrphanedFragmentsWithBlock(const FragmentVisitor& block) const {
  std::set<std::string, std::less<>> used;
  for (const auto& entry : manifest_.fragments) used.insert(entry.file);
  auto listed = RCListDirectory(
      bundleURL_.path(),
      {.noFollow = true, .filter = [&used](std::string_view name) {
         return !used.contains(name) &&
                RCCaptureFormat::isFileExtensionSupported(extensionOf(std::string(name)));
       }});
  if (!listed) return;
  std::vector<std::string> orphans;
  for (RCDirectoryEntry& entry : *listed) {
    if (entry.status.exists() && !entry.status.isDirectory())
      orphans.push_back(std::move(entry.name));
  }
  std::sort(orphans.begin(), orphans.end());
  bool stop = false;
  for (const std::string& name : orphans) {
    block(RCCompositionFragment(URLForFragmentFile(name)), stop);
    if (stop) break;
  }
}

std::string RCComposition::debugDescription() const {
  std::string fragments;
  for (const auto& entry : manifest_.fragments) {
    if (!fragments.empty()) fragments += "; ";
    fragments += fmt::format(
        "{} at {:.3f}+{:.3f} uses {:.3f}+{}{}", entry.file, entry.timeRangeInComposition.start,
        entry.timeRangeInComposition.duration, entry.contentStart,
        entry.contentDuration ? fmt::format("{:.3f}", *entry.contentDuration) : "open",
        entry.composed ? " composed" : "");
  }
  return fmt::format(
      "<RCComposition bundle={} composedAVURL={} composedDuration={:.3f} "
      "savedRecordingURI={} fragments=[{}]>",
      bundleURL_.lastPathComponent(), composedAVURL().absoluteString(), manifest_.composedDuration,
      manifest_.savedRecordingURI.empty() ? "(none)" : manifest_.savedRecordingURI, fragments);
}

}  // namespace quorvel
