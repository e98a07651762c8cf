// The orphan recovery run over a large directory, against what it cannot do
// without: listing the directory, reading every entry's size and running
// md5sum over exactly the files whose sizes collide, measured in the same run
// on the same directory.
//
// The directory holds N database recordings (N = the first argument, 20000
// by default), 300 of them the same size as another one; 50 orphans
// identical to a recording; 5 orphans of a recording's size but other bytes
// (not audio: probed, then deleted); and 5 playable orphans. The reference
// digests every file whose size another file shares, the run only orphans
// and the in-use files of their sizes. The run probes audio in process (the daemon hands the
// same probes to its media worker) and its log lines go to a counting sink.
// Prints the files each side digested and the ratio (run / reference); the
// target is at most 1.2.
#include <dirent.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>

#include <filesystem>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "Models/RCSavedRecordingsModel+RCSOrphanHandling.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
#include "bench/BenchTiming.h"
#include "platform/Log.h"
#include "tests/support/AudioFixtures.h"

namespace fs = std::filesystem;
using namespace quorvel;

namespace {

constexpr int kCollisions = 300;  // recordings sized as another recording
constexpr int kLookalikes = 5;
constexpr int kDuplicates = 50;
constexpr int kPlayable = 5;

void writeBytes(const fs::path& path, std::size_t size, std::uint64_t stamp) {
  static const std::string noise = [] {
    std::mt19937_64 random(42);
    std::string bytes(1 << 20, '\0');
    for (char& c : bytes) c = char(random());
    return bytes;
  }();
  std::string bytes = noise.substr(0, size);
  for (int i = 0; i < 8 && std::size_t(i) < size; ++i)
    bytes[std::size_t(i)] = char(stamp >> (8 * i));
  FILE* file = std::fopen(path.c_str(), "wb");
  std::fwrite(bytes.data(), 1, bytes.size(), file);
  std::fclose(file);
}

// Recordings have odd sizes, so the even-sized WAV orphans collide with none;
// every 64th of the first kCollisions * 64 takes the size of the one before.
std::size_t recordingSize(int i) {
  if (i % 64 == 1 && i < kCollisions * 64) --i;
  return 4097 + 16 * std::size_t(i);
}

std::shared_ptr<RCSavedRecordingsModel> seed(const fs::path& dir, int count) {
  fs::remove_all(dir);
  fs::create_directories(dir);
  RCSavedRecordingsModel::setSavedRecordingsDirectory(dir.string());
  auto model = *RCSavedRecordingsModel::modelWithDirectory(dir.string());
  model->performWithSavingDisabled([&] {
    for (int i = 0; i < count; ++i) {
      fs::path file = dir / fmt::format("Recording {}.m4a", i);
      writeBytes(file, recordingSize(i), std::uint64_t(i));
      model->insertRecordingWithAudioFile(file.string(), 1, platform::Date::now());
    }
  });
  (void)model->saveIfNecessary();
  return model;
}

// Orphans of one round, named by the round: the playable ones an earlier
// round recovered are recordings now.
void addOrphans(const fs::path& dir, int count, int round) {
  for (int k = 0; k < kLookalikes; ++k) {
    int target = (k * 61 + 7 + round) % count;
    writeBytes(dir / fmt::format("Lookalike {}-{}.m4a", round, k), recordingSize(target),
               std::uint64_t(count + k));
  }
  for (int k = 0; k < kDuplicates; ++k) {
    int target = (k * 97 + 13 + round) % count;
    fs::copy_file(dir / fmt::format("Recording {}.m4a", target),
                  dir / fmt::format("Duplicate {}-{}.m4a", round, k));
  }
  for (int k = 0; k < kPlayable; ++k) {
    (void)testing::writeTone((dir / fmt::format("Found {}-{}.wav", round, k)).string(),
                             0.5 + 0.01 * (k + kPlayable * round), "wav");
  }
}

// What the run cannot avoid: the listing, every size, md5sum of the files
// whose sizes collide. Returns how many files md5sum read.
std::size_t reference(const fs::path& dir) {
  std::map<off_t, std::vector<std::string>> bySize;
  DIR* stream = ::opendir(dir.c_str());
  while (const dirent* entry = ::readdir(stream)) {
    struct stat info {};
    if (entry->d_name[0] == '.' ||
        ::fstatat(::dirfd(stream), entry->d_name, &info, AT_SYMLINK_NOFOLLOW) != 0 ||
        !S_ISREG(info.st_mode)) {
      continue;
    }
    bySize[info.st_size].push_back(entry->d_name);
  }
  ::closedir(stream);
  std::string command = "cd '" + dir.string() + "' && md5sum";
  std::size_t files = 0;
  for (const auto& [size, names] : bySize) {
    if (names.size() < 2) continue;
    for (const std::string& name : names) command += " '" + name + "'";
    files += names.size();
  }
  bench::run(command + " >/dev/null");
  return files;
}

}  // namespace

int main(int argc, char** argv) {
  const int count = argc > 1 ? std::atoi(argv[1]) : 20000;
  const int rounds = argc > 2 ? std::atoi(argv[2]) : 3;
  RCUseInProcessMediaEngine();
  std::size_t logLines = 0;
  platform::setConsoleLogging(false);
  platform::setLogSinkForTesting([&](int, std::string_view) { ++logLines; });
  const fs::path dir = fs::temp_directory_path() / fmt::format("quorvel-orphan-bench-{}", getpid());

  double bestRun = 1e9;
  double bestReference = 1e9;
  std::size_t referenceFiles = 0;
  RCSOrphanHandling::Statistics statistics;
  auto model = seed(dir, count);
  for (int round = 0; round < rounds; ++round) {
    addOrphans(dir, count, round);
    bestReference =
        std::min(bestReference, bench::seconds([&] { referenceFiles = reference(dir); }));
    RCSOrphanHandling handling(*model);
    bestRun =
        std::min(bestRun, bench::seconds([&] {
                   handling.performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs({});
                 }));
    statistics = handling.statistics();
  }
  fs::remove_all(dir);
  RCSavedRecordingsModel::setSavedRecordingsDirectory(std::nullopt);

  fmt::print(
      "directory: {} entries ({} recordings, {} sized as another, {} duplicates, {} "
      "lookalikes, {} playable orphans)\n",
      statistics.listedEntries, count, kCollisions, kDuplicates, kLookalikes, kPlayable);
  fmt::print(
      "run:       {:.3f} s  digested {} files, probed {}, inserted {}, deleted {}, "
      "{} log lines\n",
      bestRun, statistics.filesDigested, statistics.assetsProbed, statistics.recordingsInserted,
      statistics.itemsDeleted, logLines / rounds);
  fmt::print("reference: {:.3f} s  listing, every size, md5sum of {} size-colliding files\n",
             bestReference, referenceFiles);
  fmt::print("ratio (run / reference): {:.3f} (target <= 1.2)\n", bestRun / bestReference);
  return 0;
}
