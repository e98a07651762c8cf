// Exports through the daemon against the same work done in-process.
//
//   1. One recording of three 20-minute AAC fragments, exported with its
//      waveform through the bus (PrepareToExport, cacheWaveform) against
//      composing it with its waveform in-process (best of two each).
//      Target: at most 1.3 x.
//   2. Ten recordings of three 2-minute fragments: exported all at once (ten
//      clients) against one after another, with both media workers started
//      (best of two rounds each). Target: at most 0.6 x.
//
// Usage: export_bench
#include <sdbus-c++/sdbus-c++.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
#include "bench/BenchDaemon.h"
#include "bench/BenchTiming.h"
#include "tests/support/TestBus.h"

namespace fs = std::filesystem;

namespace {

using quorvel::bench::run;
using quorvel::bench::seconds;

constexpr const char* kService = "org.quorvel.SavedRecordingService";
constexpr const char* kPath = "/org/quorvel/SavedRecordingService";
constexpr const char* kInterface = "org.quorvel.SavedRecordingService1";

// AAC of `length` seconds (a tone over noise, so the encoder works as on
// speech), made once and kept in the cache.
std::string fragment(const fs::path& cache, int index, int length) {
  const fs::path path =
      cache / ("fragment" + std::to_string(index) + "-" + std::to_string(length) + ".m4a");
  if (!fs::exists(path)) {
    const fs::path temp = cache / ("making-" + path.filename().string());
    run("ffmpeg -v error -y -f lavfi -i 'sine=f=" + std::to_string(220 * (index + 1)) + ":d=" +
        std::to_string(length) + ":r=44100' -f lavfi -i 'anoisesrc=d=" + std::to_string(length) +
        ":r=44100:a=0.05:s=" + std::to_string(index + 1) +
        "' -filter_complex amix=inputs=2 -c:a aac -b:a 128k '" + temp.string() + "'");
    fs::rename(temp, path);
  }
  return path.string();
}

// A new recording of three fragments of `length` seconds; its composed URL.
std::string makeRecording(quorvel::RCSavedRecordingsModel& model, const fs::path& cache,
                          const std::string& title, int length) {
  auto editor = quorvel::RCCompositionEditor::createCompositionForNewRecording(model, title);
  if (!editor) {
    std::fprintf(stderr, "cannot make %s: %s\n", title.c_str(),
                 editor.error().description().c_str());
    std::exit(1);
  }
  for (int i = 0; i < 3; ++i) {
    auto added = editor->appendFragmentFromAudioFile(
        platform::URL::fileURLWithPath(fragment(cache, i, length)));
    if (!added) {
      std::fprintf(stderr, "cannot add a fragment: %s\n", added.error().description().c_str());
      std::exit(1);
    }
  }
  return editor->composedAVURL().path();
}

void exportThroughTheBus(const std::string& address, const std::string& path) {
  auto connection = sdbus::createSessionBusConnectionWithAddress(address);
  auto proxy = sdbus::createProxy(*connection, kService, kPath);
  auto call = proxy->createMethodCall(kInterface, "PrepareToExport");
  call << path << true;
  sdbus::Struct<std::string, int32_t, std::string, std::string> token;
  auto reply = proxy->callMethod(call, 3'600'000'000);  // an hour at most
  reply >> token;
  if (std::get<1>(token) == 0) {
    std::fprintf(stderr, "the export of %s was not finalized\n", path.c_str());
    std::exit(1);
  }
}

}  // namespace

int main() {
  quorvel::RCUseInProcessMediaEngine();  // this process makes the recordings, as an app does
  platform::testing::TestBus bus;
  const fs::path cache = fs::temp_directory_path() / "quorvel-bench-audio";
  fs::create_directories(cache);
  const fs::path recordings =
      fs::temp_directory_path() / ("quorvel-export-bench-" + std::to_string(getpid()));
  fs::remove_all(recordings);
  quorvel::RCSetSavedRecordingsDirectory(recordings.string());
  auto model =
      quorvel::RCSavedRecordingsModel::modelWithDirectory(quorvel::RCSavedRecordingsDirectory());
  if (!model) {
    std::fprintf(stderr, "cannot open the database: %s\n", model.error().description().c_str());
    return 1;
  }
  quorvel::bench::BenchDaemon daemon(bus.address(), recordings.string());
  if (!daemon.started()) return 1;

  // 1. One long recording.
  double inProcess = 1e9, throughBus = 1e9;
  for (int round = 0; round < 2; ++round) {
    std::string local = makeRecording(**model, cache, "Local " + std::to_string(round), 1200);
    inProcess = std::min(
        inProcess, seconds([&] {
          auto controller = quorvel::RCCompositionController::compositionControllerForComposedAVURL(
              platform::URL::fileURLWithPath(local));
          if (!controller->composeNow(false, true)) std::exit(1);
        }));
    std::string exported = makeRecording(**model, cache, "Bus " + std::to_string(round), 1200);
    throughBus =
        std::min(throughBus, seconds([&] { exportThroughTheBus(bus.address(), exported); }));
  }
  std::printf(
      "3 x 20 min with waveform: through the bus %.2f s, in-process %.2f s; ratio %.2f "
      "(target <= 1.3)\n",
      throughBus, inProcess, throughBus / inProcess);

  // 2. Ten recordings, at once and one after another, best of two rounds
  //    each. Both media workers are started first (by two exports at once),
  //    as on a daemon that has been working: otherwise the at-once round
  //    alone pays for starting the second one.
  auto exportAll = [&](const std::vector<std::string>& paths) {
    std::vector<std::thread> clients;
    for (const auto& path : paths) {
      clients.emplace_back([&, path] { exportThroughTheBus(bus.address(), path); });
    }
    for (auto& client : clients) client.join();
  };
  exportAll(
      {makeRecording(**model, cache, "Warm 0", 120), makeRecording(**model, cache, "Warm 1", 120)});
  double oneByOne = 1e9, atOnce = 1e9;
  for (int round = 0; round < 2; ++round) {
    std::vector<std::string> sequential, parallel;
    for (int i = 0; i < 10; ++i) {
      const std::string suffix = std::to_string(round) + "-" + std::to_string(i);
      sequential.push_back(makeRecording(**model, cache, "One " + suffix, 120));
      parallel.push_back(makeRecording(**model, cache, "All " + suffix, 120));
    }
    oneByOne = std::min(oneByOne, seconds([&] {
                          for (const auto& path : sequential)
                            exportThroughTheBus(bus.address(), path);
                        }));
    atOnce = std::min(atOnce, seconds([&] { exportAll(parallel); }));
  }
  std::printf(
      "10 recordings: at once %.2f s, one after another %.2f s; ratio %.2f "
      "(target <= 0.6)\n",
      atOnce, oneByOne, atOnce / oneByOne);
  fs::remove_all(recordings);
  return 0;
}
