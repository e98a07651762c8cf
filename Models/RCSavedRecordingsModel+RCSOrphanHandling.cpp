// The orphan recovery run.
//
// The run lists the directory once, with an lstat of every entry, and works
// from that listing: the composition pass over the bundles, then the bare
// asset pass over the audio files, both growing one in-use set. Every URL
// that goes into the set is first brought to the directory's own spelling
// (its parent resolved through symbolic links and compared with the resolved
// directory), so a database that names a file through /var/home while the
// run lists /home still protects it; and an orphan that is the very same file
// (device and inode) as an in-use one is in use, whatever it is called.
//
// The duplicate test compares sizes before digests. In-use files are sized
// from the listing (or an lstat when they lie elsewhere) into an index by
// size, once per pass, and a file is digested only when another one of its
// size is in play: the orphan when some in-use file has its size, an in-use
// file when an orphan has its size; each digest at most once per pass. So a
// large directory costs one lstat per entry and an MD5 of the few files
// whose sizes collide.
//
// Deleting is the last resort and only follows a positive finding: a file
// whose digest or audio could not be read is left where it is, with a line
// saying why; only a file that the media engine read and found without
// playable audio, or without a positive duration, is deleted as unplayable.
#include "Models/RCSavedRecordingsModel+RCSOrphanHandling.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <map>
#include <semaphore>
#include <set>
#include <unordered_map>

#include "Models/RCPathOrder.h"
#include "Quorvel/composition/RCCaptureFormat.h"
#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCFileConfinement.h"
#include "Quorvel/files/RCFileCreationDate.h"
#include "Quorvel/locale/RCLocalizedRecordingDate.h"
#include "Quorvel/locale/RCPreferredLanguages.h"
#include "Quorvel/media/RCAudioAsset.h"
#include "platform/Log.h"

namespace quorvel {

namespace {

constexpr int kTitleDateAndTime = kRCRecordingDateOptionDate | kRCRecordingDateOptionTime;  // 3
constexpr int kTitleDate = kRCRecordingDateOptionDate;                                      // 2

#define ORPHAN_LOG(...) QV_LOG(platform::kLogLevelError, "[Orphan-Handling] " __VA_ARGS__)

struct Identity {
  dev_t device = 0;
  ino_t inode = 0;
  friend auto operator<=>(const Identity&, const Identity&) = default;
};

double secondsSince(const struct timespec& time) {
  return platform::Date::now().timeIntervalSince1970() - double(time.tv_sec) -
         double(time.tv_nsec) / 1e9;
}

// The title item a file's titles give: the only one, or for several the
// first of the first preferred language that has any.
std::optional<RCMetadataItem> chooseTitleItem(const std::vector<RCMetadataItem>& items) {
  if (items.size() == 1) return items.front();
  if (items.empty()) return std::nullopt;
  for (const std::string& language : RCPreferredLanguages()) {
    auto matching = RCMetadataItemsWithLocale(items, language);
    if (!matching.empty()) return matching.front();
  }
  return std::nullopt;
}

}  // namespace

struct RCSOrphanHandling::Entry {
  struct stat info {};
  bool exists = false;
};

// The run's file access. Sizes and identities of in-use files come from the
// listing for files of the directory (an lstat otherwise), so a member named
// in every capture format costs nothing for the formats that are not there.
class RCSOrphanHandling::FileManager {
 public:
  explicit FileManager(std::string directory) : directory_(std::move(directory)) {
    char* resolved = ::realpath(directory_.c_str(), nullptr);
    if (resolved) {
      resolvedDirectory_ = resolved;
      std::free(resolved);
    }
  }

  const std::string& directory() const { return directory_; }
  bool directoryResolved() const { return !resolvedDirectory_.empty(); }

  // `url` standardized, and in the directory's own spelling when its parent
  // is the directory reached another way.
  platform::URL canonicalURL(const platform::URL& url) {
    platform::URL standardized = url.URLByStandardizingPath();
    platform::URL parent = standardized.URLByDeletingLastPathComponent();
    if (parent.path() == directory_ || resolvedDirectory_.empty()) return standardized;
    auto [found, inserted] = resolvedParents_.try_emplace(parent.path());
    if (inserted) {
      char* resolved = ::realpath(parent.path().c_str(), nullptr);
      found->second = resolved && resolved == resolvedDirectory_;
      std::free(resolved);
    }
    if (!found->second) return standardized;
    return platform::URL::fileURLWithPath(directory_ + "/" + standardized.lastPathComponent());
  }

  // Lists the directory: one lstat per entry. A directory that cannot be
  // listed gives no entries.
  std::vector<platform::URL> list() {
    std::vector<platform::URL> urls;
    DIR* stream = ::opendir(directory_.c_str());
    if (!stream) {
      ORPHAN_LOG("ERROR: cannot list {}: {}", directory_, std::strerror(errno));
      return urls;
    }
    const int fd = ::dirfd(stream);
    while (const dirent* item = ::readdir(stream)) {
      std::string_view name = item->d_name;
      if (name == "." || name == "..") continue;
      Entry entry;
      entry.exists = ::fstatat(fd, item->d_name, &entry.info, AT_SYMLINK_NOFOLLOW) == 0;
      entries_.emplace(std::string(name), entry);
      urls.push_back(platform::URL::fileURLWithPath(directory_ + "/" + std::string(name)));
    }
    ::closedir(stream);
    return urls;
  }

  // What the listing saw of `url`, or a fresh lstat for a file elsewhere.
  Entry entryFor(const platform::URL& url) {
    if (url.URLByDeletingLastPathComponent().path() == directory_) {
      auto found = entries_.find(url.lastPathComponent());
      return found == entries_.end() ? Entry{} : found->second;
    }
    return lstatNow(url);
  }

  static Entry lstatNow(const platform::URL& url) {
    Entry entry;
    entry.exists = ::lstat(url.path().c_str(), &entry.info) == 0;
    return entry;
  }

  // Removes `url` (a file or a whole bundle), never outside the directory.
  bool remove(const platform::URL& url) {
    auto removed = RCRemoveItemConfinedToDirectory(url, directory_);
    if (!removed && removed.error().code() != ENOENT) {
      QV_LOG(platform::kLogLevelError, "[Orphan-Handling] could not remove '{}': {}",
             url.lastPathComponent(), removed.error());
    }
    return bool(removed);
  }

 private:
  std::string directory_;
  std::string resolvedDirectory_;
  std::unordered_map<std::string, bool> resolvedParents_;
  std::unordered_map<std::string, Entry> entries_;
};

// ---- title and date ----

bool RCSApplyAssetMetadataToRecording(RCSavedRecording& recording) {
  std::optional<platform::URL> url = recording.url();
  if (!url) return false;
  std::shared_ptr<RCAudioAsset> asset = RCAudioAsset::assetWithURL(*url);
  if (!asset) return false;
  std::optional<platform::Date> fileCreationDate = RCFileCreationDate(url->path());
  if (!fileCreationDate) return false;

  // The completion writes the two chosen items and then signals; the caller
  // reads them only after the wait, so the semaphore orders the two.
  struct Chosen {
    std::optional<RCMetadataItem> titleItem;
    std::optional<platform::Date> dateItem;
    std::binary_semaphore loaded{0};
  };
  auto chosen = std::make_shared<Chosen>();
  asset->loadCommonMetadataAsync([chosen](platform::Result<RCCommonMetadata> metadata) {
    if (metadata) {
      chosen->titleItem = chooseTitleItem(metadata->titleItems);
      if (!chosen->titleItem) chosen->dateItem = metadata->creationDate;
    }
    chosen->loaded.release();
  });
  chosen->loaded.acquire();

  std::string title = chosen->titleItem ? chosen->titleItem->stringValue : std::string();
  platform::Date date = *fileCreationDate;
  if (title.empty() && chosen->dateItem) {
    date = *chosen->dateItem;
    title = RCLocalizedRecordingDateWithOptions(date, kTitleDateAndTime);
  }
  if (title.empty()) title = RCLocalizedRecordingDateWithOptions(date, kTitleDate);
  recording.setCustomLabel(std::move(title));
  recording.setDate(date);
  return true;
}

// ---- the run ----

RCSOrphanHandling::RCSOrphanHandling(RCSavedRecordingsModel& model) : model_(model) {}
RCSOrphanHandling::~RCSOrphanHandling() = default;

std::optional<RCMD5Digest> RCSOrphanHandling::_MD5DataForPath(const std::string& path) {
  auto digest = RCMD5DigestOfFile(path);
  if (!digest) {
    ORPHAN_LOG("ERROR: -MD5DataForPath was unable load data for {}", path);
    return std::nullopt;
  }
  return *digest;
}

void RCSOrphanHandling::performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs(
    const std::vector<platform::URL>& externallyInUseComposedAVURLs) {
  ORPHAN_LOG(
      "performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs: checking for orphaned "
      "recordings.");
  statistics_ = {};
  FileManager fileManager(model_.directory());
  auto inUse = std::make_unique<RCURLSet>();
  for (const platform::URL& url : externallyInUseComposedAVURLs)
    inUse->addURL(fileManager.canonicalURL(url));

  // Without the database's recordings every file would look orphaned: a
  // database that cannot be read ends the run here.
  const auto& extensions = RCCaptureFormat::fileExtensionsSupported();
  auto walked = model_.enumerateExistingRecordingsWithBlock([&](const auto& recording, bool&) {
    std::optional<platform::URL> url = recording->url();
    if (!url) return;
    platform::URL canonical = fileManager.canonicalURL(*url);
    inUse->addURL(canonical);
    for (const std::string& extension : extensions)
      inUse->addURL(canonical.URLByReplacingPathExtension(extension));
  });
  if (!walked || !fileManager.directoryResolved()) {
    ORPHAN_LOG("ERROR: leaving the recordings directory alone: {}",
               walked ? "it cannot be resolved"
                      : "the recordings database cannot be read: " +
                            walked.error().localizedDescription());
  } else {
    std::vector<platform::URL> listing = fileManager.list();
    statistics_.listedEntries = listing.size();
    _performOrphanRecoveryAndCleanupOfCompositionsWithInUseComposedAVURLs(*inUse, fileManager,
                                                                          listing);
    _performOrphanRecoveryAndCleanupOfBareAssetsWithInUseComposedAVURLs(*inUse, fileManager,
                                                                        listing);
    removeStaleTemporaryFiles(fileManager, listing);
  }
  ORPHAN_LOG("performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs: done.");
}

bool RCSOrphanHandling::databaseNames(const platform::URL& composedAVURL,
                                      const std::string& recordingURI) {
  auto byURL = model_.recordingWithURL(composedAVURL);
  if (!byURL || *byURL) return true;  // a failed lookup counts as named
  if (recordingURI.empty()) return false;
  auto byURI = model_.recordingWithURIRepresentation(recordingURI);
  return !byURI || *byURI;
}

void RCSOrphanHandling::_performOrphanRecoveryAndCleanupOfCompositionsWithInUseComposedAVURLs(
    RCURLSet& inUse, FileManager& fileManager,
    const std::vector<platform::URL>& URLsInSavedRecordingsDirectory) {
  for (const platform::URL& bundleURL : URLsInSavedRecordingsDirectory) {
    if (bundleURL.pathExtension() != RCComposition::kBundleExtension) continue;
    const std::string name = bundleURL.lastPathComponent();
    auto loaded = RCComposition::load(bundleURL);
    if (!loaded) {
      ORPHAN_LOG("Leaving composition ({}) alone: it cannot be loaded: {}", name,
                 loaded.error().localizedDescription());
      continue;
    }
    std::shared_ptr<RCComposition> composition = *loaded;
    const platform::URL composedAVURL = composition->composedAVURL();
    if (inUse.containsURL(composedAVURL)) continue;

    if (composition->fileSizeOfAssetsIncludingRelatedResources(false) == 0) {
      // An app makes a bundle before it inserts the recording and asks for
      // its capture session: a young bundle waits for the next run, and the
      // database is asked again right before the removal.
      Entry entry = fileManager.entryFor(bundleURL);
      if (secondsSince(entry.info.st_mtim) < kMinimumBundleAge ||
          databaseNames(composedAVURL, composition->savedRecordingURI())) {
        continue;
      }
      ORPHAN_LOG("Found orphaned composition ({}) with no assets, deleting it.", name);
      if (fileManager.remove(bundleURL)) ++statistics_.itemsDeleted;
      continue;
    }
    if (databaseNames(composedAVURL, composition->savedRecordingURI())) {
      inUse.addURL(composedAVURL);
      continue;
    }
    ORPHAN_LOG(
        "Found orphaned composition ({}) with assets, recover it by inserting it into the "
        "database.",
        name);
    recoverComposition(inUse, fileManager, composition);
  }
}

void RCSOrphanHandling::recoverComposition(RCURLSet& inUse, FileManager& fileManager,
                                           const std::shared_ptr<RCComposition>& composition) {
  const platform::URL composedAVURL = composition->composedAVURL();
  auto controller = RCCompositionController::initWithComposition(composition);
  controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
  std::shared_ptr<RCComposition> repaired = controller->composition();

  model_.performWithSavingDisabled([&] {
    auto recording = model_.insertRecordingWithAudioFile(
        repaired->composedAVURL().path(), repaired->composedDuration(), platform::Date::now());
    if (!RCSApplyAssetMetadataToRecording(*recording)) {
      platform::URL bundle = RCComposition::compositionBundleURLForComposedAVURL(composedAVURL);
      if (auto created = RCFileCreationDate(bundle.path())) {
        recording->setCustomLabel(RCLocalizedRecordingDateWithOptions(*created, kTitleDateAndTime));
        recording->setDate(*created);
      }
    }
    repaired->setSavedRecordingURIFromRecoveredRecordingURI(recording->URIRepresentation());
  });
  if (auto saved = repaired->saveMetadataToDefaultLocation(); !saved) {
    ORPHAN_LOG("ERROR: cannot save the metadata of {}: {}",
               repaired->bundleURL().lastPathComponent(), saved.error());
  }
  if (auto saved = model_.saveIfNecessary(); !saved) {
    ORPHAN_LOG("ERROR: cannot save the recordings database: {}", saved.error());
  } else {
    ++statistics_.recordingsInserted;
  }
  inUse.addURL(fileManager.canonicalURL(composedAVURL));
}

void RCSOrphanHandling::_performOrphanRecoveryAndCleanupOfBareAssetsWithInUseComposedAVURLs(
    RCURLSet& inUse, FileManager& fileManager,
    const std::vector<platform::URL>& URLsInSavedRecordingsDirectory) {
  std::map<platform::URL, RCMD5Digest> digestCache;

  // In-use files by size (existing regular files only: a member that is not
  // there has size 0, which no candidate reaches the comparison with) and
  // by identity.
  std::unordered_multimap<std::uint64_t, platform::URL> inUseBySize;
  std::set<Identity> inUseIdentities;
  auto noteInUse = [&](const platform::URL& url, const struct stat& info) {
    inUseIdentities.insert(Identity{info.st_dev, info.st_ino});
    if (S_ISREG(info.st_mode) && info.st_size > 0) inUseBySize.emplace(info.st_size, url);
  };
  for (const platform::URL& member : inUse.URLs()) {
    Entry entry = fileManager.entryFor(member);
    if (entry.exists) noteInUse(member, entry.info);
  }

  std::vector<platform::URL> sorted = URLsInSavedRecordingsDirectory;
  std::sort(sorted.begin(), sorted.end(), [](const platform::URL& a, const platform::URL& b) {
    return RCPathOrderLess(a.path(), b.path());
  });

  auto digestOf = [&](const platform::URL& url) -> platform::Result<std::optional<RCMD5Digest>> {
    if (auto cached = digestCache.find(url); cached != digestCache.end()) return cached->second;
    ++statistics_.filesDigested;
    auto digest = RCMD5DigestOfFile(url.path());
    if (!digest) {
      ORPHAN_LOG("ERROR: -MD5DataForPath was unable load data for {}", url.path());
    } else if (*digest) {
      digestCache.emplace(url, **digest);
    }
    return digest;
  };
  auto remove = [&](const platform::URL& url) {
    if (fileManager.remove(url)) ++statistics_.itemsDeleted;
  };

  for (const platform::URL& url : sorted) {
    if (!RCCaptureFormat::isFileExtensionSupported(url.pathExtension()) || inUse.containsURL(url)) {
      continue;
    }
    Entry listed = fileManager.entryFor(url);
    // Only regular files: a link, a directory or a device is not a bare
    // recording, and the very same file as an in-use one is in use.
    if (!listed.exists || !S_ISREG(listed.info.st_mode) ||
        inUseIdentities.contains(Identity{listed.info.st_dev, listed.info.st_ino})) {
      continue;
    }
    const std::string name = url.lastPathComponent();
    ORPHAN_LOG("Found orphaned composed AVURL: '{}'", name);

    // The duplicate test, sizes first.
    Entry now = FileManager::lstatNow(url);
    if (!now.exists || !S_ISREG(now.info.st_mode)) {
      ORPHAN_LOG(
          "Orphaned composed AVURL: '{}' changed during the run; leaving it for the next "
          "one",
          name);
      continue;
    }
    const auto size = std::uint64_t(now.info.st_size);
    bool unique = size > 0;
    bool unreadable = false;
    std::optional<RCMD5Digest> digest;
    if (unique) {
      auto [first, last] = inUseBySize.equal_range(size);
      for (auto member = first; member != last && unique; ++member) {
        if (!digest) {
          auto own = digestOf(url);
          if (!own || !*own) {
            unreadable = true;
            break;
          }
          digest = **own;
        }
        auto theirs = digestOf(member->second);
        if (theirs && *theirs && **theirs == *digest) {
          ORPHAN_LOG("orphanPath = {} matches existing file = {}", name,
                     member->second.lastPathComponent());
          unique = false;
        }
      }
    }
    if (unreadable) {
      ORPHAN_LOG("Orphaned composed AVURL: '{}' cannot be read; leaving it", name);
      continue;
    }
    if (!unique) {
      ORPHAN_LOG(
          "Orphaned composed AVURL: '{}' already has a duplicate in database or unsynced "
          "assets manifest.  Deleting!",
          name);
      remove(url);
      continue;
    }
    inUse.addURL(url);
    noteInUse(url, now.info);
    ORPHAN_LOG(
        "Orphaned composed AVURL: '{}' does not have a duplicate in the database or "
        "unsynced assets manifest.  Attempting to insert into the database...",
        name);

    ++statistics_.assetsProbed;
    auto examined = RCAudioAsset::examineAssetWithURL(url);
    if (!examined) {
      ORPHAN_LOG("Orphaned composed AVURL: '{}' could not be examined ({}); leaving it", name,
                 examined.error());
      continue;
    }
    std::shared_ptr<RCAudioAsset> asset = *examined;
    if (!asset) {
      ORPHAN_LOG("Orphaned composed AVURL: '{}' unable to load AVURLAsset", name);
      ORPHAN_LOG(
          "Orphaned composed AVURL: '{}' unable to insert orphaned asset into database.  "
          "Deleting!",
          name);
      remove(url);
      continue;
    }
    const double duration = asset->duration();
    if (!(duration > 0)) {
      ORPHAN_LOG(
          "Orphaned composed AVURL: unable to insert '{}' into the database because it's "
          "duration is 0",
          name);
      ORPHAN_LOG(
          "Orphaned composed AVURL: '{}' unable to insert orphaned asset into database.  "
          "Deleting!",
          name);
      remove(url);
      continue;
    }
    ORPHAN_LOG(
        "Found orphaned AVURL ({}) without .composition, recover it by inserting it into the "
        "database.",
        name);
    model_.performWithSavingDisabled([&] {
      auto recording =
          model_.insertRecordingWithAudioFile(url.path(), duration, platform::Date::now());
      (void)RCSApplyAssetMetadataToRecording(*recording);
      ORPHAN_LOG("Orphaned composed AVURL: inserted '{}' into the database with title '{}'", name,
                 recording->customLabel());
    });
    if (auto saved = model_.saveIfNecessary(); !saved) {
      ORPHAN_LOG("ERROR: cannot save the recordings database: {}", saved.error());
    } else {
      ++statistics_.recordingsInserted;
    }
  }
}

void RCSOrphanHandling::removeStaleTemporaryFiles(
    FileManager& fileManager, const std::vector<platform::URL>& URLsInSavedRecordingsDirectory) {
  // A crash in the middle of an atomic replace leaves the new file under its
  // temporary name, beside the file it was to replace: directly in the
  // directory or in a bundle. Anything else of that name pattern, or younger
  // than an hour (a compose may still be writing it), stays.
  auto removeIfStale = [&](const platform::URL& url, const struct stat& info) {
    if (!S_ISREG(info.st_mode) || !RCIsAtomicReplaceTempName(url.lastPathComponent()) ||
        secondsSince(info.st_mtim) < kMinimumTempFileAge) {
      return;
    }
    ORPHAN_LOG("Removing '{}', left behind by an interrupted write.", url.path());
    if (fileManager.remove(url)) ++statistics_.itemsDeleted;
  };
  for (const platform::URL& url : URLsInSavedRecordingsDirectory) {
    Entry entry = fileManager.entryFor(url);
    if (!entry.exists) continue;
    if (!S_ISDIR(entry.info.st_mode)) {
      removeIfStale(url, entry.info);
      continue;
    }
    if (url.pathExtension() != RCComposition::kBundleExtension) continue;
    const int fd = ::open(url.path().c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    DIR* stream = fd < 0 ? nullptr : ::fdopendir(fd);
    if (!stream) {
      if (fd >= 0) ::close(fd);
      continue;
    }
    while (const dirent* item = ::readdir(stream)) {
      struct stat info {};
      if (item->d_name[0] != '.' ||
          ::fstatat(::dirfd(stream), item->d_name, &info, AT_SYMLINK_NOFOLLOW) != 0) {
        continue;
      }
      removeIfStale(url.URLByAppendingPathComponent(item->d_name), info);
    }
    ::closedir(stream);
  }
}

}  // namespace quorvel
