// How fast the daemon answers other clients while it composes.
//
// Runs the real build/bin/quorveld on a private bus. Times 50 rounds of
// three requests from a fresh client: Peer.Ping, PrepareToPreview followed by
// EndAccessSession of a recording the daemon has never read (two fragments,
// made just before the round), and FetchExportingCompositionAVURLs. Once
// with the daemon idle, once while two long exports re-encode (two
// recordings of two WAV fragments each, exported at once with their
// waveforms). Targets, under load: the worst round of each request at most
// 50 ms, and its median at most 3 x its idle median.
//
// Usage: responsiveness_bench [fragment-minutes]   (default 15)
#include <sdbus-c++/sdbus-c++.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/files/RCRecordingsDirectory.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
#include "bench/BenchDaemon.h"
#include "bench/BenchTiming.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/TestBus.h"

namespace fs = std::filesystem;

namespace {

constexpr const char* kService = "org.quorvel.SavedRecordingService";
constexpr const char* kPath = "/org/quorvel/SavedRecordingService";
constexpr const char* kInterface = "org.quorvel.SavedRecordingService1";
constexpr int kRounds = 50;
using Token = sdbus::Struct<std::string, int32_t, std::string, std::string>;

[[noreturn]] void fail(const std::string& what) {
  std::fprintf(stderr, "%s\n", what.c_str());
  std::exit(1);
}

// A new recording made of the given WAV files; its composed path.
std::string makeRecording(quorvel::RCSavedRecordingsModel& model, const std::string& title,
                          const std::vector<std::string>& fragments) {
  auto editor = quorvel::RCCompositionEditor::createCompositionForNewRecording(model, title);
  if (!editor) fail("cannot make " + title + ": " + editor.error().description());
  for (const std::string& fragment : fragments) {
    auto added = editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(fragment));
    if (!added) fail("cannot add a fragment: " + added.error().description());
  }
  return editor->composedAVURL().path();
}

struct Latencies {
  std::vector<double> ping, preview, fetch;  // milliseconds
};

double median(std::vector<double> values) {
  std::sort(values.begin(), values.end());
  return values[values.size() / 2];
}
double worst(const std::vector<double>& values) {
  return *std::max_element(values.begin(), values.end());
}

double millisecondsOf(const std::function<void()>& work) {
  return quorvel::bench::seconds(work) * 1e3;
}

// The three requests, `kRounds` times, from a client of its own; `unseen`
// holds one recording per round that the daemon has not read.
Latencies measure(const std::string& address, const std::vector<std::string>& unseen) {
  auto connection = sdbus::createSessionBusConnectionWithAddress(address);
  auto proxy = sdbus::createProxy(*connection, kService, kPath);
  Latencies latencies;
  for (int round = 0; round < kRounds; ++round) {
    latencies.ping.push_back(millisecondsOf([&] {
      auto call = proxy->createMethodCall("org.freedesktop.DBus.Peer", "Ping");
      proxy->callMethod(call);
    }));
    latencies.preview.push_back(millisecondsOf([&] {
      auto call = proxy->createMethodCall(kInterface, "PrepareToPreview");
      call << unseen[round];
      Token token;
      auto reply = proxy->callMethod(call);
      reply >> token;
      if (std::get<1>(token) != 1) fail("no preview token for " + unseen[round]);
      auto end = proxy->createMethodCall(kInterface, "EndAccessSession");
      end << token;
      end.dontExpectReply();
      proxy->callMethod(end);
    }));
    latencies.fetch.push_back(millisecondsOf([&] {
      auto call = proxy->createMethodCall(kInterface, "FetchExportingCompositionAVURLs");
      std::vector<std::string> urls;
      auto reply = proxy->callMethod(call);
      reply >> urls;
    }));
  }
  return latencies;
}

std::vector<std::string> exporting(sdbus::IProxy& proxy) {
  auto call = proxy.createMethodCall(kInterface, "FetchExportingCompositionAVURLs");
  std::vector<std::string> urls;
  auto reply = proxy.callMethod(call);
  reply >> urls;
  return urls;
}

}  // namespace

int main(int argc, char** argv) {
  const int minutes = argc > 1 ? std::max(1, std::atoi(argv[1])) : 15;
  quorvel::RCUseInProcessMediaEngine();  // this process makes the recordings, as an app does
  platform::testing::TestBus bus;
  const fs::path recordings =
      fs::temp_directory_path() / ("quorvel-responsiveness-bench-" + std::to_string(getpid()));
  fs::remove_all(recordings);
  quorvel::RCSetSavedRecordingsDirectory(recordings.string());
  auto model =
      quorvel::RCSavedRecordingsModel::modelWithDirectory(quorvel::RCSavedRecordingsDirectory());
  if (!model) fail("cannot open the database: " + model.error().description());

  const fs::path scratch = recordings / "scratch";
  fs::create_directories(scratch);
  const std::string shortTone = (scratch / "short.wav").string();
  const std::string longTone = (scratch / "long.wav").string();
  if (!quorvel::testing::writeTone(shortTone, 0.5, "wav") ||
      !quorvel::testing::writeTone(longTone, minutes * 60.0, "wav")) {
    fail("cannot write the tones");
  }
  std::vector<std::string> exports;
  for (const char* title : {"Long A", "Long B"}) {
    exports.push_back(makeRecording(**model, title, {longTone, longTone}));
  }
  auto unseen = [&](const std::string& phase) {
    std::vector<std::string> made;
    for (int i = 0; i < kRounds; ++i) {
      made.push_back(
          makeRecording(**model, phase + " " + std::to_string(i), {shortTone, shortTone}));
    }
    return made;
  };

  quorvel::bench::BenchDaemon daemon(bus.address(), recordings.string());
  if (!daemon.started()) fail("cannot start " + daemon.program());
  const Latencies idle = measure(bus.address(), unseen("Idle"));

  // Two long exports from clients of their own, then the same rounds.
  std::vector<std::thread> exporters;
  for (const std::string& path : exports) {
    exporters.emplace_back([&, path] {
      auto connection = sdbus::createSessionBusConnectionWithAddress(bus.address());
      auto proxy = sdbus::createProxy(*connection, kService, kPath);
      auto call = proxy->createMethodCall(kInterface, "PrepareToExport");
      call << path << true;
      Token token;
      auto reply = proxy->callMethod(call, 3'600'000'000);  // an hour at most
      reply >> token;
      if (std::get<1>(token) != 1) fail("the export of " + path + " was not finalized");
    });
  }
  const std::vector<std::string> underLoad = unseen("Busy");
  auto watcher = sdbus::createSessionBusConnectionWithAddress(bus.address());
  auto watch = sdbus::createProxy(*watcher, kService, kPath);
  while (exporting(*watch).size() < exports.size()) std::this_thread::yield();
  const Latencies busy = measure(bus.address(), underLoad);
  const bool stillComposing = exporting(*watch).size() == exports.size();
  for (auto& exporter : exporters) exporter.join();

  bool met = stillComposing;
  auto report = [&](const char* name, const std::vector<double>& quiet,
                    const std::vector<double>& loaded) {
    const double ratio = median(loaded) / median(quiet);
    const bool ok = worst(loaded) <= 50 && ratio <= 3;
    met = met && ok;
    std::printf(
        "%-30s idle median %6.2f ms | under load median %6.2f ms, worst %6.2f ms (target <= 50), "
        "median ratio %.2f (target <= 3)%s\n",
        name, median(quiet), median(loaded), worst(loaded), ratio, ok ? "" : "  MISSED");
  };
  std::printf("%d rounds each; two exports of 2 x %d min WAV re-encoding with waveforms\n", kRounds,
              minutes);
  report("Ping", idle.ping, busy.ping);
  report("PrepareToPreview + End (new)", idle.preview, busy.preview);
  report("FetchExportingCompositionAVURLs", idle.fetch, busy.fetch);
  if (!stillComposing) {
    std::printf("the exports ended before the rounds did: run with more fragment minutes\n");
  }
  std::printf("%s\n", met ? "targets met" : "targets missed");
  fs::remove_all(recordings);
  return met ? 0 : 1;
}
