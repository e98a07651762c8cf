// The idle daemon's footprint: time from exec to the service name owned on
// the bus, resident memory once start-up work is over, and the number of
// shared libraries it maps. Targets: at most 20 ms and 10 MB. Runs the real
// build/bin/quorveld on a private bus.
#include <sdbus-c++/sdbus-c++.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <filesystem>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "bench/BenchDaemon.h"
#include "tests/support/TestBus.h"

namespace {

using Clock = std::chrono::steady_clock;
constexpr const char* kService = "org.quorvel.SavedRecordingService";

}  // namespace

int main(int argc, char** argv) {
  int runs = argc > 1 ? std::atoi(argv[1]) : 10;
  platform::testing::TestBus bus;
  auto recordings = std::filesystem::temp_directory_path() / "quorvel-startup-bench";
  std::filesystem::create_directories(recordings);

  // Watch the name appear from a connection of our own.
  auto connection = sdbus::createSessionBusConnectionWithAddress(bus.address());
  std::mutex mutex;
  std::condition_variable owned;
  Clock::time_point ownedAt;
  bool isOwned = false;
  auto match = connection->addMatch(
      "type='signal',sender='org.freedesktop.DBus',member='NameOwnerChanged',arg0='" +
          std::string(kService) + "'",
      [&](sdbus::Message& message) {
        std::string name, oldOwner, newOwner;
        message >> name >> oldOwner >> newOwner;
        if (newOwner.empty()) return;
        std::lock_guard lock(mutex);
        ownedAt = Clock::now();
        isOwned = true;
        owned.notify_all();
      });
  connection->enterEventLoopAsync();

  std::vector<double> startMillis;
  std::vector<long> idleKilobytes;
  int libraries = 0;
  for (int run = 0; run < runs; ++run) {
    {
      std::lock_guard lock(mutex);
      isOwned = false;
    }
    auto started = Clock::now();
    quorvel::bench::BenchDaemon daemon(bus.address(), recordings.string());
    if (!daemon.started()) {
      std::fprintf(stderr, "cannot start %s\n", daemon.program().c_str());
      return 1;
    }
    {
      std::unique_lock lock(mutex);
      if (!owned.wait_for(lock, std::chrono::seconds(10), [&] { return isOwned; })) {
        std::fprintf(stderr, "quorveld never owned its name\n");
        return 1;
      }
      startMillis.push_back(std::chrono::duration<double, std::milli>(ownedAt - started).count());
    }
    // Past the start-up keep-alive periods: the daemon is idle.
    std::this_thread::sleep_for(std::chrono::milliseconds(2500));
    idleKilobytes.push_back(quorvel::bench::residentKilobytes(daemon.pid()));
    libraries = quorvel::bench::mappedLibraryCount(daemon.pid());
  }
  std::sort(startMillis.begin(), startMillis.end());
  std::sort(idleKilobytes.begin(), idleKilobytes.end());
  double medianStart = startMillis[startMillis.size() / 2];
  double medianMB = idleKilobytes[idleKilobytes.size() / 2] / 1024.0;
  std::printf(
      "exec to name owned: median %.1f ms (min %.1f, max %.1f) over %d runs; target <= 20 ms\n",
      medianStart, startMillis.front(), startMillis.back(), runs);
  std::printf("idle resident memory: median %.1f MB; target <= 10 MB\n", medianMB);
  std::printf("shared libraries mapped: %d\n", libraries);
  std::printf("ratios to targets: start-up %.2f, memory %.2f\n", medianStart / 20.0,
              medianMB / 10.0);
  std::filesystem::remove_all(recordings);
  return 0;
}
