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
// The bare files the run will examine are probed before the pass, in one
// probeMany call (with the daemon's worker, a few requests for the whole
// directory instead of one per file): those whose listed size no in-use file
// and no other orphan has, which the duplicate test therefore keeps. The
// pass uses such a result only when the file is still as listed; a file of a
// shared size, or one that changed meanwhile, is examined on its own when
// the pass reaches it, as every file once was. So a duplicate is never
// probed, and the decisions and their order are those of a file-by-file run.
//
// Deleting is the last resort and only follows a positive finding: a file
// whose digest or audio could not be read is left where it is, with a line
// saying why; only a file that the media engine read and found without
// playable audio, or without a positive duration, is deleted as unplayable.
// And only once settled (RCRemoveSettledFile): a file someone is still
// copying in, or that changed since it was listed, waits for the next run.
// Each thing the run keeps for its safety gets one line saying why. A write
// that fails (the disk may be full) stops the run before anything more is
// removed.
#include "Models/RCSavedRecordingsModel+RCSOrphanHandling.h"

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
#include <tuple>
#include <unordered_map>

#include "Models/RCPathOrder.h"
#include "Quorvel/composition/RCCaptureFormat.h"
#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/files/RCDirectoryListing.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCFileConfinement.h"
#include "Quorvel/files/RCFileCreationDate.h"
#include "Quorvel/files/RCFileVersion.h"
#include "Quorvel/files/RCSettledFileRemoval.h"
#include "Quorvel/locale/RCLocalizedRecordingDate.h"
#include "Quorvel/locale/RCPreferredLanguages.h"
#include "Quorvel/media/RCAudioAsset.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "platform/Log.h"

namespace quorvel {

namespace {

constexpr int kTitleDateAndTime = kRCRecordingDateOptionDate | kRCRecordingDateOptionTime;  // 3
constexpr int kTitleDate = kRCRecordingDateOptionDate;                                      // 2

#define ORPHAN_LOG(...) QV_LOG(platform::kLogLevelError, "[Orphan-Handling] " __VA_ARGS__)

struct Identity {
  dev_t device = 0;
  ino_t inode = 0;
  friend bool operator<(const Identity& a, const Identity& b) {
    return std::tie(a.device, a.inode) < std::tie(b.device, b.inode);
  }
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

struct RCSOrphanHandling::Entry : RCFileStatus {
  // In the in-use set when the directory was listed (the set only grows).
  bool inUse = false;
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

  // The standardized path of `url`, in the directory's own spelling when
  // its parent is the directory reached another way.
  std::string canonicalPath(const platform::URL& url) { return canonicalPath(url.path()); }
  std::string canonicalPath(std::string_view file) {
    std::string path = RCURLSet::standardizedPath(file);
    const std::size_t slash = path.rfind('/');
    const std::string_view parent =
        std::string_view(path).substr(0, std::max<std::size_t>(slash, 1));
    if (parent == directory_) return path;
    auto [found, inserted] = resolvedParents_.try_emplace(std::string(parent));
    if (inserted) {
      char* resolved = ::realpath(found->first.c_str(), nullptr);
      found->second = resolved && resolved == resolvedDirectory_;
      std::free(resolved);
    }
    if (found->second) return directory_ + path.substr(slash);
    elsewhere_.push_back(path);
    return path;
  }
  // The paths canonicalPath() found outside the directory.
  const std::vector<std::string>& elsewhere() const { return elsewhere_; }

  // Lists the directory: one lstat per entry, and whether `inUse` holds it.
  // A directory that cannot be listed gives no entries.
  std::vector<platform::URL> list(const RCURLSet& inUse) {
    std::vector<platform::URL> urls;
    auto listed = RCListDirectory(directory_);
    if (!listed) {
      ORPHAN_LOG("ERROR: cannot list {}: {}", directory_,
                 std::strerror(int(listed.error().code())));
      return urls;
    }
    urls.reserve(listed->size());
    for (RCDirectoryEntry& item : *listed) {
      std::string path = directory_ + "/" + item.name;
      Entry entry{item.status};
      entry.inUse = entry.exists() && inUse.containsPath(path);
      entries_.emplace(std::move(item.name), entry);
      urls.push_back(platform::URL::fileURLWithPath(path));
    }
    return urls;
  }

  // Whether the directory finds its entries under other letter cases too:
  // one listed name, its letters' case swapped, leads to the same file.
  bool foldsCase() {
    if (foldsCase_) return *foldsCase_;
    foldsCase_ = false;
    for (const auto& [name, entry] : entries_) {
      std::string swapped = name;
      for (char& c : swapped) {
        if (c >= 'a' && c <= 'z') {
          c = char(c - 'a' + 'A');
        } else if (c >= 'A' && c <= 'Z') {
          c = char(c - 'A' + 'a');
        }
      }
      if (swapped == name || !entry.exists()) continue;
      Entry other = lstatNow(directory_ + "/" + swapped);
      foldsCase_ = other.exists() && other.info.st_dev == entry.info.st_dev &&
                   other.info.st_ino == entry.info.st_ino;
      break;
    }
    return *foldsCase_;
  }

  // What the listing saw of `path`, or a fresh lstat for a file elsewhere.
  Entry entryFor(std::string_view path) const {
    const std::size_t slash = path.rfind('/');
    if (path.substr(0, slash) == directory_) {
      auto found = entries_.find(std::string(path.substr(slash + 1)));
      return found == entries_.end() ? Entry{} : found->second;
    }
    return lstatNow(std::string(path));
  }
  const std::unordered_map<std::string, Entry>& entries() const { return entries_; }

  static Entry lstatNow(const std::string& path) { return Entry{RCFileStatus::atPath(path)}; }
  // The file `path` names, through links.
  static Entry statNow(const std::string& path) {
    return Entry{RCFileStatus::atPathFollowing(path)};
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
  std::vector<std::string> elsewhere_;
  std::optional<bool> foldsCase_;
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
  asset->loadCommonMetadataAsync([chosen](platform::Result<RCCommonMetadata>&& metadata) {
    // A load that failed chooses nothing.
    RCCommonMetadata found = metadata ? std::move(*metadata) : RCCommonMetadata{};
    chosen->titleItem = chooseTitleItem(found.titleItems);
    if (!chosen->titleItem) chosen->dateItem = found.creationDate;
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

platform::Result<std::optional<RCMD5Digest>> RCSOrphanHandling::digestLoggingFailure(
    const std::string& path) {
  auto digest = RCMD5DigestOfFile(path);
  if (!digest) ORPHAN_LOG("ERROR: -MD5DataForPath was unable load data for {}", path);
  return digest;
}

std::optional<RCMD5Digest> RCSOrphanHandling::_MD5DataForPath(const std::string& path) {
  auto digest = digestLoggingFailure(path);
  return digest ? *digest : std::nullopt;
}

void RCSOrphanHandling::performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs(
    const std::vector<platform::URL>& externallyInUseComposedAVURLs) {
  ORPHAN_LOG(
      "performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs: checking for orphaned "
      "recordings.");
  statistics_ = {};
  stopped_ = false;
  FileManager fileManager(model_.directory());
  std::vector<platform::URL> handedIn;
  handedIn.reserve(externallyInUseComposedAVURLs.size());
  for (const platform::URL& url : externallyInUseComposedAVURLs)
    handedIn.push_back(platform::URL::fileURLWithPath(fileManager.canonicalPath(url)));
  std::unique_ptr<RCURLSet> inUse = RCURLSet::setWithURLs(handedIn);

  // Without the database's recordings every file would look orphaned: a
  // database that cannot be read ends the run here.
  const auto& extensions = RCCaptureFormat::fileExtensionsSupported();
  auto walked = model_.enumerateRecordingFilePathsWithBlock([&](const std::string& file) {
    std::string path = fileManager.canonicalPath(file);
    inUse->addPath(path);
    // The same name in every capture format.
    const std::size_t slash = path.rfind('/');
    const std::size_t dot = path.rfind('.');
    std::string stem = dot == std::string::npos || dot < slash ? path : path.substr(0, dot);
    for (const std::string& extension : extensions) inUse->addPath(stem + "." + extension);
  });
  // The walk above counts recordings inserted but not saved yet, such as
  // those of an earlier run whose save failed (a full disk): unsaved, they
  // would keep their files from being recovered for good. So they are saved
  // now, or the run touches nothing.
  platform::Status saved = walked ? model_.saveIfNecessary() : platform::Status();
  if (!walked || !saved || !fileManager.directoryResolved()) {
    ORPHAN_LOG(
        "ERROR: leaving the recordings directory alone: {}",
        !walked ? "the recordings database cannot be read: " + walked.error().localizedDescription()
        : !saved
            ? "the recordings database cannot be saved: " + saved.error().localizedDescription()
            : std::string("it cannot be resolved"));
  } else {
    std::vector<platform::URL> listing = fileManager.list(*inUse);
    statistics_.listedEntries = listing.size();
    _performOrphanRecoveryAndCleanupOfCompositionsWithInUseComposedAVURLs(*inUse, fileManager,
                                                                          listing);
    _performOrphanRecoveryAndCleanupOfBareAssetsWithInUseComposedAVURLs(*inUse, fileManager,
                                                                        listing);
    if (!stopped_) removeStaleTemporaryFiles(fileManager);
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
    if (stopped_) return;
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
      Entry entry = fileManager.entryFor(bundleURL.path());
      if (secondsSince(entry.info.st_mtim) < kMinimumBundleAge) {
        ORPHAN_LOG("Leaving composition ({}) alone: it holds no audio yet but is new", name);
        continue;
      }
      if (databaseNames(composedAVURL, composition->savedRecordingURI())) {
        ORPHAN_LOG("Leaving composition ({}) alone: the database names its recording", name);
        continue;
      }
      ORPHAN_LOG("Found orphaned composition ({}) with no assets, deleting it.", name);
      if (fileManager.remove(bundleURL)) ++statistics_.itemsDeleted;
      continue;
    }
    if (databaseNames(composedAVURL, composition->savedRecordingURI())) {
      ORPHAN_LOG("Leaving composition ({}) alone: the database names its recording", name);
      inUse.addPath(fileManager.canonicalPath(composedAVURL));
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
  inUse.addPath(fileManager.canonicalPath(composedAVURL));
  if (auto saved = repaired->saveMetadataToDefaultLocation(); !saved) {
    stop("cannot save the metadata of " + repaired->bundleURL().lastPathComponent() + ": " +
         saved.error().description());
  }
  if (auto saved = model_.saveIfNecessary(); !saved) {
    stop("cannot save the recordings database: " + saved.error().description());
  } else {
    ++statistics_.recordingsInserted;
  }
}

void RCSOrphanHandling::_performOrphanRecoveryAndCleanupOfBareAssetsWithInUseComposedAVURLs(
    RCURLSet& inUse, FileManager& fileManager,
    const std::vector<platform::URL>& URLsInSavedRecordingsDirectory) {
  if (stopped_) return;
  std::unordered_map<std::string, RCMD5Digest> digestCache;

  // In-use files by size (existing regular files only: a member that is not
  // there has size 0, which no candidate reaches the comparison with) and by
  // identity, from every member of the set as it stands now, the composed
  // files the composition pass recovered included. A member the listing
  // holds under its very name is known from the listing, unless it is a
  // link; any other is looked at with stat, which follows links and finds
  // the file a case-folding file system lists under another spelling (on
  // any other, a name the listing does not hold is not there, and tens of
  // thousands of members named in formats they were never saved in cost
  // nothing).
  std::unordered_multimap<std::uint64_t, std::string> inUseBySize;
  std::set<Identity> inUseIdentities;
  auto noteInUse = [&](const std::string& path, const RCFileStatus& status) {
    inUseIdentities.insert(Identity{status.info.st_dev, status.info.st_ino});
    if (status.isRegularFile() && !status.isEmptyRegularFile())
      inUseBySize.emplace(status.info.st_size, path);
  };
  auto noteMember = [&](const std::string& path, Entry entry) {
    if (!entry.exists() || entry.isSymbolicLink()) entry = FileManager::statNow(path);
    if (entry.exists()) noteInUse(path, entry);
  };
  const std::string prefix = fileManager.directory() + "/";
  for (const auto& [name, entry] : fileManager.entries()) {
    if (!entry.exists()) continue;
    std::string path = prefix + name;
    if (entry.inUse || inUse.containsPath(path)) noteMember(path, entry);
  }
  for (const std::string& path : fileManager.elsewhere()) noteMember(path, Entry{});
  if (fileManager.foldsCase()) {
    for (const std::string& path : inUse.paths()) {
      if (!fileManager.entryFor(path).exists()) noteMember(path, Entry{});
    }
  }
  auto forgetInUse = [&](const std::string& path) {
    std::erase_if(inUseBySize, [&](const auto& member) { return member.second == path; });
    digestCache.erase(path);
  };

  // Path order. Every entry lies in the directory, so the names decide.
  struct Keyed {
    std::size_t length;
    std::string name;
    const platform::URL* url;
  };
  std::vector<Keyed> keyed;
  keyed.reserve(URLsInSavedRecordingsDirectory.size());
  for (const platform::URL& url : URLsInSavedRecordingsDirectory) {
    std::string name = url.lastPathComponent();
    keyed.push_back(Keyed{RCUTF16Length(name), std::move(name), &url});
  }
  std::sort(keyed.begin(), keyed.end(), [](const Keyed& a, const Keyed& b) {
    if (a.length != b.length) return a.length < b.length;
    if (int order = RCNumericCompare(a.name, b.name); order != 0) return order < 0;
    return a.name < b.name;
  });

  auto digestOf = [&](const std::string& path) -> platform::Result<std::optional<RCMD5Digest>> {
    if (auto cached = digestCache.find(path); cached != digestCache.end()) return cached->second;
    ++statistics_.filesDigested;
    auto digest = digestLoggingFailure(path);
    if (digest && *digest) digestCache.emplace(path, **digest);
    return digest;
  };
  auto lastComponent = [](std::string_view path) { return path.substr(path.rfind('/') + 1); };

  // The listing's entry of a bare orphan the pass looks at; nullopt for
  // anything else. What has an audio name nobody uses but is no regular
  // file of its own stays, and `keptBecause` says why.
  auto orphanEntry = [&](const platform::URL& url,
                         const char** keptBecause = nullptr) -> std::optional<Entry> {
    Entry listed = fileManager.entryFor(url.path());
    if (listed.inUse || !listed.exists() ||
        !RCCaptureFormat::isFileExtensionSupported(url.pathExtension()) ||
        inUse.containsPath(url.path())) {
      return std::nullopt;
    }
    const char* why = nullptr;
    if (listed.isSymbolicLink()) {
      why = "it is a symbolic link";
    } else if (!listed.isRegularFile()) {
      why = "it is not a regular file";
    } else if (inUseIdentities.contains(Identity{listed.info.st_dev, listed.info.st_ino})) {
      why = "it is the same file as one in use";
    }
    if (why) {
      if (keptBecause) *keptBecause = why;
      return std::nullopt;
    }
    return listed;
  };

  // Deletes an orphan only when it is settled: still as listed, open in no
  // other process, and still unknown to the database.
  auto removeOrphan = [&](const platform::URL& url, const std::string& name, const Entry& listed) {
    auto removal =
        RCRemoveSettledFile(fileManager.directory(), name, RCFileVersion::of(listed.info),
                            kMinimumUnleasedFileAge, [&] { return !databaseNames(url, {}); });
    if (!removal) {
      ORPHAN_LOG("Orphaned composed AVURL: '{}' could not be removed: {}", name, removal.error());
      return false;
    }
    if (*removal == RCSettledRemoval::Removed) {
      ++statistics_.itemsDeleted;
      return true;
    }
    if (*removal != RCSettledRemoval::Missing) {
      ORPHAN_LOG("Orphaned composed AVURL: '{}' {}; leaving it for the next run", name,
                 RCSettledRemovalDescription(*removal));
    }
    return false;
  };

  // The orphans of a size of their own, probed at once (see the top).
  std::unordered_map<std::string, platform::Result<RCMediaProbe>> probed;
  {
    std::vector<std::pair<platform::URL, std::uint64_t>> orphans;
    std::unordered_map<std::uint64_t, std::size_t> orphansBySize;
    for (const Keyed& item : keyed) {
      std::optional<Entry> listed = orphanEntry(*item.url);
      if (!listed || listed->info.st_size <= 0) continue;
      orphans.emplace_back(*item.url, std::uint64_t(listed->info.st_size));
      ++orphansBySize[orphans.back().second];
    }
    std::vector<platform::URL> batch;
    for (const auto& [url, size] : orphans) {
      if (orphansBySize[size] == 1 && !inUseBySize.contains(size)) batch.push_back(url);
    }
    if (!batch.empty()) {
      auto probes = RCMediaEngine::current()->probeMany(batch);
      for (std::size_t i = 0; i < std::min(batch.size(), probes.size()); ++i) {
        probed.emplace(batch[i].path(), std::move(probes[i]));
      }
    }
  }

  for (const Keyed& item : keyed) {
    if (stopped_) return;
    const platform::URL& url = *item.url;
    const std::string& name = item.name;
    const char* keptBecause = nullptr;
    std::optional<Entry> orphan = orphanEntry(url, &keptBecause);
    if (!orphan) {
      if (keptBecause) ORPHAN_LOG("Leaving '{}' alone: {}", name, keptBecause);
      continue;
    }
    const Entry& listed = *orphan;
    ORPHAN_LOG("Found orphaned composed AVURL: '{}'", name);

    // The duplicate test, sizes first.
    Entry now = FileManager::lstatNow(url.path());
    if (!now.isRegularFile()) {
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
          auto own = digestOf(url.path());
          if (!own || !*own) {
            unreadable = true;
            break;
          }
          digest = **own;
        }
        auto theirs = digestOf(member->second);
        if (theirs && *theirs && **theirs == *digest) {
          ORPHAN_LOG("orphanPath = {} matches existing file = {}", name,
                     lastComponent(member->second));
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
      removeOrphan(url, name, listed);
      continue;
    }
    inUse.addPath(url.path());
    noteInUse(url.path(), now);
    ORPHAN_LOG(
        "Orphaned composed AVURL: '{}' does not have a duplicate in the database or "
        "unsynced assets manifest.  Attempting to insert into the database...",
        name);

    ++statistics_.assetsProbed;
    auto batched = probed.find(url.path());
    auto examined =
        batched != probed.end() && RCFileVersion::of(listed.info) == RCFileVersion::of(now.info)
            ? RCAudioAsset::examineAssetWithProbe(url, std::move(batched->second))
            : RCAudioAsset::examineAssetWithURL(url);
    if (!examined) {
      ORPHAN_LOG("Orphaned composed AVURL: '{}' could not be examined ({}); leaving it", name,
                 examined.error());
      continue;
    }
    std::shared_ptr<RCAudioAsset> asset = *examined;
    // Read, and found without playable audio or without length: deleted.
    // Its name stays in the in-use set, but an identical orphan later in the
    // pass finds no file to match and is judged on its own.
    auto deleteUnplayable = [&] {
      ORPHAN_LOG(
          "Orphaned composed AVURL: '{}' unable to insert orphaned asset into database.  "
          "Deleting!",
          name);
      if (removeOrphan(url, name, listed)) forgetInUse(url.path());
    };
    if (!asset) {
      ORPHAN_LOG("Orphaned composed AVURL: '{}' unable to load AVURLAsset", name);
      deleteUnplayable();
      continue;
    }
    const double duration = asset->duration();
    if (!(duration > 0)) {
      ORPHAN_LOG(
          "Orphaned composed AVURL: unable to insert '{}' into the database because it's "
          "duration is 0",
          name);
      deleteUnplayable();
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
      stop("cannot save the recordings database: " + saved.error().description());
    } else {
      ++statistics_.recordingsInserted;
    }
  }
}

void RCSOrphanHandling::stop(const std::string& why) {
  ORPHAN_LOG("ERROR: {}; stopping here, without removing anything more.", why);
  stopped_ = true;
}

void RCSOrphanHandling::removeStaleTemporaryFiles(FileManager& fileManager) {
  // A crash in the middle of an atomic replace leaves the new file under its
  // temporary name, beside the file it was to replace: directly in the
  // directory or in a bundle. Anything else of that name pattern, or younger
  // than an hour (a compose may still be writing it), stays.
  auto removeIfStale = [&](const platform::URL& url, std::string_view name,
                           const RCFileStatus& status) {
    if (!status.isRegularFile() || !RCIsAtomicReplaceTempName(name) ||
        secondsSince(status.info.st_mtim) < kMinimumTempFileAge) {
      return;
    }
    ORPHAN_LOG("Removing '{}', left behind by an interrupted write.", url.path());
    if (fileManager.remove(url)) ++statistics_.itemsDeleted;
  };
  const std::string prefix = fileManager.directory() + "/";
  for (const auto& [name, entry] : fileManager.entries()) {
    if (!entry.exists()) continue;
    if (!entry.isDirectory()) {
      if (name.front() == '.') {
        removeIfStale(platform::URL::fileURLWithPath(prefix + name), name, entry);
      }
      continue;
    }
    if (!name.ends_with(std::string(".") + RCComposition::kBundleExtension)) continue;
    const platform::URL bundle = platform::URL::fileURLWithPath(prefix + name);
    auto hidden = RCListDirectory(
        bundle.path(),
        {.noFollow = true, .filter = [](std::string_view member) { return member[0] == '.'; }});
    for (const RCDirectoryEntry& item : hidden ? *hidden : std::vector<RCDirectoryEntry>()) {
      removeIfStale(bundle.URLByAppendingPathComponent(item.name), item.name, item.status);
    }
  }
}

}  // namespace quorvel
