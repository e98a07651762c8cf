// RCComposition: a recording's composition, read from its bundle
// "<name>.composition/" in the recordings directory: the composed audio file
// "<name>.<ext>" beside the bundle, its duration, the database record it
// belongs to, and the ordered fragments (manifest.json and the fragment audio
// files inside the bundle, see RCCompositionManifest.h).
//
// Loading is strict: a bundle outside the recordings directory, a manifest
// that does not parse, names another recording's audio file, or names a
// fragment that is a symbolic link or not a regular file does not load; the
// reason is logged and nothing is deleted or rewritten.
//
// Not synchronized: share a composition across threads only while nobody
// changes it. Controllers never change a composition they have handed out;
// they replace it.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "Quorvel/composition/RCCompositionFragment.h"
#include "Quorvel/composition/RCCompositionManifest.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

class RCComposition {
 public:
  static constexpr const char* kBundleExtension = "composition";

  // The composition stored in `bundleURL`, a bundle directly inside the
  // saved-recordings directory; nullptr when there is no such bundle, or
  // (with the reason logged at level 4) when it is there and cannot be
  // loaded. Reads the file system.
  static std::shared_ptr<RCComposition> compositionLoadedFromCompositionBundleURL(
      const platform::URL& bundleURL);
  // The same, reporting the reason instead of logging it.
  static platform::Result<std::shared_ptr<RCComposition>> load(const platform::URL& bundleURL);

  // "<dir>/<name>.<ext>" -> "<dir>/<name>.composition".
  static platform::URL compositionBundleURLForComposedAVURL(const platform::URL& composedAVURL);

  // A composition of `manifest` stored in `bundleURL` (not read from disk).
  RCComposition(platform::URL bundleURL, RCCompositionManifest manifest);

  const platform::URL& bundleURL() const { return bundleURL_; }
  // The composed audio file: the manifest's name beside the bundle.
  platform::URL composedAVURL() const;
  // Seconds.
  double composedDuration() const { return manifest_.composedDuration; }
  // The database record it belongs to ("quorvel://recording/<UUID>"); empty
  // when none.
  const std::string& savedRecordingURI() const { return manifest_.savedRecordingURI; }
  const RCCompositionManifest& manifest() const { return manifest_; }

  // Every fragment, in composition order.
  std::vector<RCCompositionFragment> fragments() const;
  // The fragments whose audio is not in the composed file yet (those marked
  // unreadable are left out of it, and are not among them).
  std::vector<RCCompositionFragment> decomposedFragments() const;
  // Whether it has fragments and every one is marked unreadable: none of
  // its audio can be composed, however up to date the composed file looks.
  bool allFragmentsUnreadable() const;
  // The file URL of the bundle entry `name`.
  platform::URL URLForFragmentFile(const std::string& name) const;

  // Bytes of the composed file and of the fragment files the manifest uses
  // (each counted once; missing files count 0). With `includeRelated`, also
  // the composed waveform file and the manifest. Reads the file system.
  std::uint64_t fileSizeOfAssetsIncludingRelatedResources(bool includeRelated) const;

  // Writes the manifest into the bundle, replacing the old one atomically.
  platform::Status saveMetadataToDefaultLocation() const;

  // Records which database record a recovered composition belongs to (saved
  // with the next saveMetadataToDefaultLocation).
  void setSavedRecordingURIFromRecoveredRecordingURI(std::string uri);

  // Calls `block` synchronously, in name order, for each file in the bundle
  // that has a capture format's extension and that the manifest does not use.
  // `stop` ends the walk. Reads the file system; deletes nothing itself.
  using FragmentVisitor = std::function<void(const RCCompositionFragment& fragment, bool& stop)>;
  void enumerateOrphanedFragmentsWithBlock(const FragmentVisitor& block) const;

  // One line for logs and the session dump.
  std::string debugDescription() const;

 private:
  RCCompositionFragment fragmentFor(const RCCompositionManifestFragment& entry) const;

  platform::URL bundleURL_;
  RCCompositionManifest manifest_;
};

}  // namespace quorvel
