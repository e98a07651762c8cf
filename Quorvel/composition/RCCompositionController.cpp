// Repair and composing of one composition.
//
// The manifest is the record of what the recording is made of; the fragment
// files may lag behind it (a capture writes its fragment's entry before its
// first audio byte) or have lost files (deleted by hand, a crash between a
// manifest write and a removal). Repair reconciles the two without ever
// giving up audio that is still on disk: only entries whose files are gone
// or empty are dropped.
//
// A fragment whose file the media engine read and found unusable (a capture
// cut off before its header, bytes damaged after the recording) keeps its
// entry, marked unreadable: it is left out of the composed audio, its file
// stays, and the recording can still be exported. Only such a verdict marks
// a fragment; a failure to look (I/O, memory, a media worker that died or
// timed out) says nothing about the file, so the repair leaves the entry as
// it is and a compose fails. The repair clears the mark once the file reads
// again, and the next finalization composes it again. A probe reads only a
// file's header, so damage inside the audio shows only when composing
// decodes it: the compose names the fragment it failed on, which is then
// marked, and the rest is composed without it.
//
// When every remaining fragment was composed but some composed fragment's
// file is gone, the composed file is the only complete copy of the audio:
// the manifest then drops its fragments and the composed file stands for the
// whole recording (its duration read from it).
//
// Composing writes the composed file first (the composer replaces it
// atomically), then the manifest that says the fragments are composed. A
// crash in between leaves fragments marked decomposed beside an up-to-date
// composed file, which the next finalization simply composes again.
//
// The composing itself runs in the process's media engine: in the daemon, a
// worker process that may be killed mid-job. Its temporary output (a hidden
// ".<name>.<random>.tmp" beside the composed file and beside the waveform)
// would then stay behind, so every compose first removes such leftovers of
// its own destinations. Only one compose of a composition runs at a time, so
// no temporary file of a running job can be taken for a leftover.
#include "Quorvel/composition/RCCompositionController.h"

#include <sys/stat.h>
#include <time.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <optional>
#include <set>
#include <tuple>
#include <unordered_map>

#include "Quorvel/composition/RCCaptureFormat.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCDirectoryListing.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCFileConfinement.h"
#include "Quorvel/files/RCFileStatus.h"
#include "Quorvel/files/RCFileVersion.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "Quorvel/media/RCAudioAsset.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "platform/GlobalQueue.h"
#include "platform/Log.h"

namespace quorvel {
namespace {

// Durations closer than this are the same duration.
constexpr double kDurationTolerance = 0.001;

enum class FileState { Missing, Empty, Present };

FileState fileState(const platform::URL& url) {
  // Only ENOENT means gone: a file that cannot be looked at now (EACCES,
  // EIO…) is kept, and reading its duration then reports it.
  const RCFileStatus status = RCFileStatus::atPath(url.path());
  if (status.error == ENOENT) return FileState::Missing;
  return status.isEmptyRegularFile() ? FileState::Empty : FileState::Present;
}

// What reading a fragment file's audio found.
struct FileReading {
  enum class Verdict {
    // The audio is there: `duration` seconds of it.
    Readable,
    // The media engine read the file and found no usable audio: not a media
    // file, invalid data, no audio stream, no duration, or (found by a
    // compose) audio that does not decode.
    Unreadable,
    // The file could not be looked at (I/O, memory, permissions, a media
    // worker that died or timed out); says nothing about the file.
    NotRead,
  };
  Verdict verdict = Verdict::NotRead;
  double duration = std::nan("");
  // NotRead: why.
  std::optional<platform::Error> error;

  bool readable() const { return verdict == Verdict::Readable; }
  bool unreadable() const { return verdict == Verdict::Unreadable; }
  static FileReading of(const platform::URL& url, platform::Result<RCMediaProbe> probe) {
    auto asset = RCAudioAsset::examineAssetWithProbe(url, std::move(probe));
    if (!asset) return FileReading{Verdict::NotRead, std::nan(""), asset.error()};
    if (!*asset || !std::isfinite((*asset)->duration())) return FileReading{Verdict::Unreadable};
    return FileReading{Verdict::Readable, (*asset)->duration()};
  }
};

// Verdicts already reached, by file version. Every session that opens or
// closes on a recording repairs it, and reading a file is a media job (in
// the daemon, a round trip to its worker); a fragment file does not change
// once captured, and one that does gets a new size or mtime. A file a
// compose found undecodable is remembered as unreadable although a probe
// would pass it, so the repair does not take it back in until it changes.
class ReadingCache {
 public:
  std::optional<FileReading> find(const std::string& path, const RCFileVersion& version) {
    std::lock_guard lock(mutex_);
    auto entry = entries_.find(path);
    if (entry == entries_.end() || !(entry->second.first == version)) return std::nullopt;
    return entry->second.second;
  }
  // Only verdicts are kept: a failure to look may be passing.
  void insert(const std::string& path, const RCFileVersion& version, const FileReading& reading) {
    if (reading.verdict == FileReading::Verdict::NotRead) return;
    std::lock_guard lock(mutex_);
    if (entries_.size() >= kCapacity) entries_.clear();
    entries_[path] = {version, reading};
  }

 private:
  static constexpr std::size_t kCapacity = 4096;
  std::mutex mutex_;
  std::unordered_map<std::string, std::pair<RCFileVersion, FileReading>> entries_;
};

ReadingCache& readingCache() {
  static ReadingCache* cache = new ReadingCache();  // used until the process ends
  return *cache;
}

// The version of the regular file `url` names (following links).
std::optional<RCFileVersion> versionOf(const platform::URL& url) {
  const RCFileStatus status = RCFileStatus::atPathFollowing(url.path());
  if (!status.isRegularFile()) return std::nullopt;
  return RCFileVersion::of(status.info);
}

// What reading the file found before, when it has not changed since.
std::optional<FileReading> cachedReading(const platform::URL& url) {
  auto version = versionOf(url);
  return version ? readingCache().find(url.path(), *version) : std::nullopt;
}

// Remembers `reading` of the file as it was at `version` (taken before the
// file was read, so a change while it was read is not taken for the file
// that was read).
void rememberReading(const platform::URL& url, const std::optional<RCFileVersion>& version,
                     const FileReading& reading) {
  if (version) readingCache().insert(url.path(), *version, reading);
}

FileReading readFile(const platform::URL& url) {
  auto version = versionOf(url);
  if (version) {
    if (auto known = readingCache().find(url.path(), *version)) return *known;
  }
  FileReading reading = FileReading::of(url, RCMediaEngine::current()->probe(url));
  rememberReading(url, version, reading);
  return reading;
}

// The readings of the files not read before, by path, read in one batch so
// a recording of many fragments costs one round trip to the media worker.
std::unordered_map<std::string, FileReading> readFiles(const std::vector<platform::URL>& files) {
  std::vector<platform::URL> unknown;
  std::vector<std::optional<RCFileVersion>> versions;
  for (const platform::URL& url : files) {
    // Gone or empty files are dropped by the repair without being read.
    if (fileState(url) != FileState::Present) continue;
    auto version = versionOf(url);
    if (version && readingCache().find(url.path(), *version)) continue;
    unknown.push_back(url);
    versions.push_back(version);
  }
  std::unordered_map<std::string, FileReading> read;
  if (unknown.empty()) return read;
  auto probes = RCMediaEngine::current()->probeMany(unknown);
  for (std::size_t i = 0; i < unknown.size() && i < probes.size(); ++i) {
    FileReading reading = FileReading::of(unknown[i], std::move(probes[i]));
    rememberReading(unknown[i], versions[i], reading);
    read.emplace(unknown[i].path(), std::move(reading));
  }
  return read;
}

// Marks `entry` unreadable (left out of the composed audio, its file kept)
// and, with `report`, says so when it was not marked already.
void markUnreadable(RCCompositionManifestFragment& entry, const RCComposition& composition,
                    bool report = true) {
  if (entry.unreadable) return;
  entry.unreadable = true;
  entry.composed = false;
  if (!report) return;
  QV_LOG(platform::kLogLevelError,
         "WARNING: leaving fragment '{}' of {} out of the composed audio: it cannot be read",
         entry.file, composition.bundleURL().lastPathComponent());
}

// Bundles found with nothing to repair or clean up, by composed path, with
// what they were made of then: the bundle directory (a file added or removed
// changes it), the manifest (replaced whole on every save) and each
// fragment file. While none of them changed the bundle is still tidy, which
// a few stats tell, where loading it reads and parses the manifest and lists
// the directory; every session open and close asks.
class TidyBundles {
 public:
  struct File {
    std::string path;
    RCFileVersion version;
    friend bool operator==(const File&, const File&) = default;
  };

  static std::optional<File> fileAt(std::string path) {
    auto version = RCFileVersion::atPath(path);
    if (!version) return std::nullopt;
    return File{std::move(path), *version};
  }

  bool contains(const std::string& composedPath) {
    std::vector<File> files;
    {
      std::lock_guard lock(mutex_);
      auto entry = entries_.find(composedPath);
      if (entry == entries_.end()) return false;
      files = entry->second;
    }
    for (const File& file : files) {
      if (fileAt(file.path) != file) return false;
    }
    return true;
  }
  // Remembers the bundle unless a file changed too recently to tell: file
  // times come from a coarse clock, so a change within the same tick as the
  // one seen would leave the time as it was.
  void insert(const std::string& composedPath, std::vector<File> files) {
    timespec now{};
    ::clock_gettime(CLOCK_REALTIME_COARSE, &now);
    const std::int64_t settled =
        std::int64_t{now.tv_sec} * 1'000'000'000 + now.tv_nsec - kSettleNanoseconds;
    for (const File& file : files) {
      if (file.version.modifiedNanoseconds >= settled) return;
    }
    std::lock_guard lock(mutex_);
    if (entries_.size() >= kCapacity) entries_.clear();
    entries_[composedPath] = std::move(files);
  }

 private:
  static constexpr std::size_t kCapacity = 1024;
  static constexpr std::int64_t kSettleNanoseconds = 100'000'000;
  std::mutex mutex_;
  std::unordered_map<std::string, std::vector<File>> entries_;
};

TidyBundles& tidyBundles() {
  static TidyBundles* bundles = new TidyBundles();  // used until the process ends
  return *bundles;
}

// Composing is serialized per bundle, by the bundle directory's identity
// (device and inode) rather than its URL, which has many spellings.
class BundleLocks {
 public:
  struct Key {
    dev_t device;
    ino_t inode;
    friend bool operator<(const Key& a, const Key& b) {
      return std::tie(a.device, a.inode) < std::tie(b.device, b.inode);
    }
  };
  // Held while one compose of the bundle runs; waited() tells whether
  // another compose of it ran first.
  class Lock {
   public:
    Lock(BundleLocks& table, Key key, bool waited) : table_(table), key_(key), waited_(waited) {}
    ~Lock() { table_.release(key_); }
    Lock(const Lock&) = delete;
    Lock& operator=(const Lock&) = delete;
    bool waited() const { return waited_; }

   private:
    BundleLocks& table_;
    Key key_;
    bool waited_;
  };

  std::unique_ptr<Lock> acquire(Key key) {
    std::unique_lock lock(mutex_);
    bool waited = false;
    while (busy_.contains(key)) {
      waited = true;
      released_.wait(lock);
    }
    busy_.insert(key);
    return std::make_unique<Lock>(*this, key, waited);
  }

 private:
  void release(Key key) {
    std::lock_guard lock(mutex_);
    busy_.erase(key);
    released_.notify_all();
  }

  std::mutex mutex_;
  std::condition_variable released_;
  std::set<Key> busy_;
};

platform::Result<std::unique_ptr<BundleLocks::Lock>> lockBundle(const platform::URL& bundle) {
  static BundleLocks* locks = new BundleLocks();  // used until the process ends
  struct stat info {};
  if (::stat(bundle.path().c_str(), &info) != 0) {
    return platform::fail(platform::posixError(errno, "the bundle"));
  }
  return locks->acquire({info.st_dev, info.st_ino});
}

// Removes temporary files an interrupted replacement of `destination` left.
void removeLeftoverTemporaryFiles(const platform::URL& destination) {
  const platform::URL directory = destination.URLByDeletingLastPathComponent();
  const std::string prefix = fmt::format(".{}.", destination.lastPathComponent());
  auto leftovers =
      RCListDirectory(directory.path(), {.filter = [&prefix](std::string_view name) {
                        return name.starts_with(prefix) && RCIsAtomicReplaceTempName(name);
                      }});
  for (const RCDirectoryEntry& leftover :
       leftovers ? *leftovers : std::vector<RCDirectoryEntry>()) {
    const std::string& name = leftover.name;
    platform::URL url = directory.URLByAppendingPathComponent(name);
    if (auto removed = RCRemoveItemInSavedRecordingsDirectory(url); removed) {
      QV_LOG(platform::kLogLevelNotice, "NOTE: removed {}, left by an interrupted compose", name);
    }
  }
}

// The database's duration of a recording follows its composed audio. The
// caller's model (if any) belongs to its own queue, so this writes through a
// connection of its own. Writes only when the duration differs, so a compose
// that was interrupted after saving its manifest has the database brought
// up to date by the next one, which finds nothing else to do.
platform::Status recordComposedDuration(const RCComposition& composition) {
  if (composition.savedRecordingURI().empty()) return {};
  auto model = RCSavedRecordingsModel::modelWithDirectory(RCSavedRecordingsDirectory());
  auto recording =
      model ? (*model)->recordingWithURIRepresentation(composition.savedRecordingURI())
            : platform::Result<std::shared_ptr<RCSavedRecording>>(platform::fail(model.error()));
  platform::Status status = recording ? platform::Status() : platform::fail(recording.error());
  if (recording && *recording &&
      std::abs((*recording)->duration() - composition.composedDuration()) > kDurationTolerance) {
    (*model)->performWithSavingDisabled(
        [&] { (*recording)->setDuration(composition.composedDuration()); });
    status = (*model)->saveIfNecessary();
  }
  if (!status) {
    QV_LOG(platform::kLogLevelError, "ERROR: cannot record the duration of {}: {}",
           composition.composedAVURL().lastPathComponent(), status.error());
  }
  return status;
}

// `read` gives what reading a file finds. With `report`, what the repair
// does is logged.
template <typename Read>
RCCompositionManifest repairedManifest(const RCComposition& composition, Read&& read,
                                       bool report = true) {
  RCCompositionManifest manifest = composition.manifest();
  std::vector<RCCompositionManifestFragment> kept;
  bool lostComposedAudio = false;
  for (RCCompositionManifestFragment entry : manifest.fragments) {
    platform::URL url = composition.URLForFragmentFile(entry.file);
    FileState state = fileState(url);
    if (state != FileState::Present) {
      if (report) {
        QV_LOG(platform::kLogLevelNotice, "NOTE: dropping fragment '{}' of {}: its file is {}",
               entry.file, composition.bundleURL().lastPathComponent(),
               state == FileState::Missing ? "gone" : "empty");
      }
      lostComposedAudio = lostComposedAudio || entry.composed;
      continue;
    }
    FileReading reading = read(url);
    if (reading.readable()) {
      if (entry.unreadable) {
        // Back in the composition: the next finalization composes it.
        entry.unreadable = false;
        entry.composed = false;
        if (report) {
          QV_LOG(platform::kLogLevelNotice, "NOTE: fragment '{}' of {} can be read again",
                 entry.file, composition.bundleURL().lastPathComponent());
        }
      }
      double available = std::max(0.0, reading.duration - entry.contentStart);
      if (!entry.contentDuration || *entry.contentDuration > available + kDurationTolerance) {
        entry.contentDuration = available;
        entry.composed = false;
      }
    } else if (reading.unreadable()) {
      // Kept, never dropped: the file may still be rescued, and dropping the
      // entry would make it an orphan for the cleanup to delete.
      markUnreadable(entry, composition, report);
    } else if (report) {
      QV_LOG(platform::kLogLevelError,
             "WARNING: cannot read fragment '{}' of {} now, leaving its entry as it is: {}",
             entry.file, composition.bundleURL().lastPathComponent(),
             reading.error ? reading.error->localizedDescription() : std::string("no reason"));
    }
    kept.push_back(std::move(entry));
  }
  // An unreadable fragment is never composed, so it keeps the composed file
  // from standing for the whole recording, and keeps its own entry.
  bool allComposed = true;
  for (const auto& entry : kept) allComposed = allComposed && entry.composed;
  if (lostComposedAudio && allComposed) kept.clear();
  bool hadFragments = !manifest.fragments.empty();
  manifest.fragments = std::move(kept);
  manifest.recomputeTimeRanges();
  if (manifest.fragments.empty() && hadFragments) {
    platform::URL composed = composition.composedAVURL();
    if (fileState(composed) == FileState::Missing) {
      manifest.composedDuration = 0;
    } else if (FileReading reading = read(composed); reading.readable()) {
      manifest.composedDuration = reading.duration;
    }
  }
  return manifest;
}

}  // namespace

RCCompositionController::RCCompositionController(std::shared_ptr<RCComposition> composition)
    : state_(std::make_shared<State>()) {
  state_->composition = std::move(composition);
}

std::shared_ptr<RCCompositionController>
RCCompositionController::compositionControllerForComposedAVURL(const platform::URL& composedAVURL) {
  std::string directory = RCSavedRecordingsDirectory();
  std::shared_ptr<RCComposition> composition;
  if (!RCIsURLDirectlyInsideDirectory(composedAVURL, directory)) {
    QV_LOG(platform::kLogLevelError,
           "ERROR: no composition for '{}': it is not directly inside the recordings directory",
           composedAVURL.path());
  } else if (!RCCaptureFormat::isFileExtensionSupported(composedAVURL.pathExtension())) {
    QV_LOG(platform::kLogLevelError,
           "ERROR: no composition for '{}': it does not have a capture format's extension",
           composedAVURL.lastPathComponent());
  } else {
    platform::URL standardized = composedAVURL.URLByStandardizingPath();
    composition = RCComposition::compositionLoadedFromCompositionBundleURL(
        RCComposition::compositionBundleURLForComposedAVURL(standardized));
    // The bundle is found by the name's stem: Walk.flac finds the bundle of
    // Walk.m4a, which is another recording's.
    if (composition && composition->composedAVURL().path() != standardized.path()) {
      QV_LOG(platform::kLogLevelError, "ERROR: no composition for '{}': its bundle belongs to '{}'",
             composedAVURL.lastPathComponent(), composition->composedAVURL().lastPathComponent());
      composition = nullptr;
    }
  }
  return std::make_shared<RCCompositionController>(std::move(composition));
}

std::shared_ptr<RCComposition> RCCompositionController::composition() const {
  std::lock_guard lock(state_->mutex);
  return state_->composition;
}

void RCCompositionController::rcs_repairDecomposedFragmentMetadataIfNecessary() {
  std::shared_ptr<RCComposition> current = composition();
  if (!current) return;
  std::vector<platform::URL> files;
  for (const auto& entry : current->manifest().fragments) {
    files.push_back(current->URLForFragmentFile(entry.file));
  }
  const auto read = readFiles(files);
  RCCompositionManifest repaired = repairedManifest(*current, [&](const platform::URL& url) {
    auto found = read.find(url.path());
    return found != read.end() ? found->second : readFile(url);
  });
  if (repaired == current->manifest()) return;
  auto replacement = std::make_shared<RCComposition>(current->bundleURL(), std::move(repaired));
  if (auto saved = replacement->saveMetadataToDefaultLocation(); !saved) {
    QV_LOG(platform::kLogLevelError, "ERROR: cannot save the repaired manifest of {}: {}",
           current->bundleURL().lastPathComponent(), saved.error().localizedDescription());
    return;
  }
  QV_LOG(platform::kLogLevelNotice, "NOTE: repaired the fragment metadata of {}",
         current->bundleURL().lastPathComponent());
  std::lock_guard lock(state_->mutex);
  if (state_->composition == current) state_->composition = std::move(replacement);
}

bool RCCompositionController::isKnownToHaveNothingToRepairOrCleanUp(
    const platform::URL& composedAVURL) {
  return tidyBundles().contains(composedAVURL.URLByStandardizingPath().path());
}

bool RCCompositionController::hasNothingToRepairOrCleanUp() const {
  std::shared_ptr<RCComposition> current = composition();
  if (!current) return false;
  // Taken before the files are read, so a change while they are read shows.
  std::vector<TidyBundles::File> files;
  for (const std::string& path :
       {current->bundleURL().path(),
        current->bundleURL().path() + "/" + RCCompositionManifest::kFileName}) {
    if (auto file = TidyBundles::fileAt(path)) files.push_back(std::move(*file));
  }
  for (const auto& entry : current->manifest().fragments) {
    if (auto file = TidyBundles::fileAt(current->URLForFragmentFile(entry.file).path())) {
      files.push_back(std::move(*file));
    }
  }
  bool known = true;
  RCCompositionManifest repaired = repairedManifest(
      *current,
      [&](const platform::URL& url) {
        std::optional<FileReading> reading = cachedReading(url);
        known = known && reading.has_value();
        return reading.value_or(FileReading{});
      },
      /*report=*/false);
  if (!known || repaired != current->manifest()) return false;
  bool orphans = false;
  current->enumerateOrphanedFragmentsWithBlock(
      [&](const RCCompositionFragment&, bool& stop) { orphans = stop = true; });
  if (orphans) return false;
  tidyBundles().insert(current->composedAVURL().path(), std::move(files));
  return true;
}

platform::Status RCCompositionController::composeNow(bool deleteFragments, bool composeWaveform) {
  std::shared_ptr<RCComposition> current = composition();
  if (!current) {
    return platform::fail(
        RCError(RCErrorCodeInvalidManifest, "there is no composition to compose"));
  }
  // With every fragment left out there is no audio at all: composing finds
  // out whether one reads again, or fails. Nothing to compose otherwise: a
  // compose interrupted between its manifest and the database left the old
  // duration there, brought up to date now (a failure is logged; the
  // composed audio the caller asked for is there).
  auto nothingToDo = [](const RCComposition& composition) {
    if (!composition.decomposedFragments().empty() || composition.allFragmentsUnreadable())
      return false;
    (void)recordComposedDuration(composition);
    return true;
  };
  if (nothingToDo(*current)) return {};

  // One bundle is composed by one job at a time, whatever URL spelling or
  // controller asked: two composes of the same files would each take the
  // other's temporary file for a leftover. The one that waited works from
  // the manifest as the first left it, usually with nothing left to do.
  auto bundleLock = lockBundle(current->bundleURL());
  if (!bundleLock) return platform::fail(bundleLock.error());
  if ((*bundleLock)->waited()) {
    auto onDisk = RCComposition::load(current->bundleURL());
    if (!onDisk) return platform::fail(onDisk.error());
    current = *onDisk;
    {
      std::lock_guard lock(state_->mutex);
      state_->composition = current;
    }
    if (nothingToDo(*current)) return {};
  }

  RCCompositionManifest manifest = current->manifest();
  for (RCCompositionManifestFragment& entry : manifest.fragments) {
    if (entry.contentDuration && !entry.unreadable) continue;
    // Open-ended (its length never recorded) or marked unreadable: what its
    // file holds now decides. Only the engine's verdict leaves it out; a
    // failure to look fails the compose and marks nothing.
    FileReading reading = readFile(current->URLForFragmentFile(entry.file));
    if (reading.verdict == FileReading::Verdict::NotRead) {
      return platform::fail(reading.error.value_or(
          RCError(RCErrorCodeUnreadableAudio, "fragment " + entry.file + " cannot be read now")));
    }
    if (reading.unreadable()) {
      markUnreadable(entry, *current);
      continue;
    }
    entry.unreadable = false;
    if (!entry.contentDuration)
      entry.contentDuration = std::max(0.0, reading.duration - entry.contentStart);
  }

  platform::URL destination = current->composedAVURL();
  std::optional<platform::URL> waveform;
  if (composeWaveform) waveform = RCWaveform::waveformURLForAVURL(destination);
  // A fragment whose audio turns out not to decode is named by the failed
  // compose; it is marked, and the rest composed again without it. Files
  // that read fine cost one compose, as before; each unreadable one that
  // only composing finds costs one failed attempt more.
  for (;;) {
    std::vector<RCComposerSegment> segments;
    std::vector<std::size_t> entryOfSegment;
    bool leftOut = false;
    for (std::size_t i = 0; i < manifest.fragments.size(); ++i) {
      const RCCompositionManifestFragment& entry = manifest.fragments[i];
      leftOut = leftOut || entry.unreadable;
      if (entry.unreadable || !entry.contentDuration || *entry.contentDuration <= 0) continue;
      segments.push_back(RCComposerSegment{current->URLForFragmentFile(entry.file),
                                           entry.contentStart, *entry.contentDuration});
      entryOfSegment.push_back(i);
    }
    if (segments.empty()) {
      return platform::fail(
          leftOut ? RCError(RCErrorCodeUnreadableAudio, "none of the fragments can be read")
                  : RCError(RCErrorCodeInvalidEdit, "the fragments hold no audio to compose"));
    }
    // Taken before composing: a file rewritten meanwhile is not the one the
    // compose judged.
    std::vector<std::optional<RCFileVersion>> versions;
    versions.reserve(segments.size());
    for (const RCComposerSegment& segment : segments) {
      versions.push_back(versionOf(segment.fragmentURL));
    }
    removeLeftoverTemporaryFiles(destination);
    if (waveform) removeLeftoverTemporaryFiles(*waveform);
    platform::Status composed =
        RCMediaEngine::current()->compose(segments, destination, waveform, {});
    if (composed) break;
    std::optional<std::size_t> failed = RCComposerFailedSegment(composed.error());
    if (!failed || *failed >= segments.size()) return composed;
    QV_LOG(platform::kLogLevelDebug, "Composing {} stopped at fragment '{}': {}",
           destination.lastPathComponent(), segments[*failed].fragmentURL.lastPathComponent(),
           composed.error());
    rememberReading(segments[*failed].fragmentURL, versions[*failed],
                    FileReading{FileReading::Verdict::Unreadable});
    markUnreadable(manifest.fragments[entryOfSegment[*failed]], *current);
  }

  // Composing takes long; an app may have changed the manifest meanwhile
  // (appended a fragment, say). Saving the one composed from would undo that
  // change, and the new fragment would then look orphaned and be deleted. So
  // the composed file stays (it holds what was composed), the manifest on
  // disk stays as it is, and the next finalization composes again.
  auto onDisk = RCComposition::load(current->bundleURL());
  if (!onDisk || (*onDisk)->manifest() != current->manifest()) {
    return platform::fail(RCError(RCErrorCodeInvalidManifest,
                                  "the manifest of " + current->bundleURL().lastPathComponent() +
                                      " changed while it was composed; it was left as it is"));
  }
  // A left-out fragment stays listed, with no time in the composition, so
  // nothing deletes its file.
  for (RCCompositionManifestFragment& entry : manifest.fragments) {
    entry.composed = !entry.unreadable;
  }
  manifest.recomputeTimeRanges();
  // The composed file stands for the fragments it holds only while no
  // fragment waits outside it: one that reads again is composed back in its
  // place, between the others, so they stay until then.
  const bool anyLeftOut = std::ranges::any_of(
      manifest.fragments,
      [](const RCCompositionManifestFragment& entry) { return entry.unreadable; });
  std::vector<platform::URL> toDelete;
  if (deleteFragments && !anyLeftOut) {
    for (const RCCompositionManifestFragment& entry : manifest.fragments) {
      toDelete.push_back(current->URLForFragmentFile(entry.file));
    }
    manifest.fragments.clear();
  }
  auto replacement = std::make_shared<RCComposition>(current->bundleURL(), std::move(manifest));
  if (auto saved = replacement->saveMetadataToDefaultLocation(); !saved) return saved;
  {
    std::lock_guard lock(state_->mutex);
    state_->composition = replacement;
  }
  // The composed audio and the manifest are in place; a database that did
  // not take the new duration fails the compose (the next one, with nothing
  // left to compose, records it), and the fragments' files, no longer
  // listed, are left to the fragment cleanup.
  if (auto recorded = recordComposedDuration(*replacement); !recorded) return recorded;
  for (const platform::URL& url : toDelete) {
    if (auto removed = RCRemoveItemInSavedRecordingsDirectory(url); !removed) {
      QV_LOG(platform::kLogLevelError, "WARNING: cannot delete composed fragment '{}': {}",
             url.lastPathComponent(), removed.error().localizedDescription());
    }
  }
  return {};
}

void RCCompositionController::rcs_composeToFinalDestinationAndDeleteDecomposedFragments(
    bool deleteFragments, bool composeWaveform, bool canGenerateWaveformByProcessingAVURL,
    CompletionBlock completionBlock) {
  (void)canGenerateWaveformByProcessingAVURL;
  auto controller = std::make_shared<RCCompositionController>(*this);
  platform::globalQueue().async([controller, deleteFragments, composeWaveform,
                                 completion = std::move(completionBlock)]() mutable {
    platform::Status status = controller->composeNow(deleteFragments, composeWaveform);
    if (!status) {
      std::shared_ptr<RCComposition> current = controller->composition();
      QV_LOG(platform::kLogLevelError, "ERROR: composing {} failed: {}",
             current ? current->composedAVURL().lastPathComponent() : std::string("(none)"),
             status.error().description());
    }
    if (completion) completion(status.has_value());
  });
}

}  // namespace quorvel
