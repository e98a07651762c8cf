// The idle daemon's footprint: time from exec to the service name owned on
// the bus, and resident memory once start-up work is over. Targets: at most
// 100 ms and 15 MB. Runs the real build/bin/quorveld on a private bus.
#include <sdbus-c++/sdbus-c++.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "bench/MappedLibraries.h"
#include "tests/support/TestBus.h"

extern char** environ;

namespace {

using Clock = std::chrono::steady_clock;
constexpr const char* kService = "org.quorvel.SavedRecordingService";

long residentKilobytes(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.starts_with("VmRSS:")) return std::stol(line.substr(6));
  }
  return -1;
}

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

  std::string program = std::string(QUORVEL_BINARY_DIR) + "/bin/quorveld";
  std::vector<std::string> arguments{program,
                                     "--bus-address",
                                     bus.address(),
                                     "--recordings-dir",
                                     recordings.string(),
                                     "--idle-exit-after",
                                     "0"};
  std::vector<char*> args;
  for (auto& argument : arguments) args.push_back(argument.data());
  args.push_back(nullptr);
  std::vector<std::string> environment{"QUORVEL_LOG_CONSOLE=0", "QUORVEL_LOG_STDERR=1",
                                       "QUORVEL_LOG_LEVEL=4"};
  std::vector<char*> envp;
  for (auto& entry : environment) envp.push_back(entry.data());
  envp.push_back(nullptr);

  std::vector<double> startMillis;
  std::vector<long> idleKilobytes;
  int libraries = 0;
  for (int run = 0; run < runs; ++run) {
    {
      std::lock_guard lock(mutex);
      isOwned = false;
    }
    pid_t pid = -1;
    auto started = Clock::now();
    if (posix_spawn(&pid, program.c_str(), nullptr, nullptr, args.data(), envp.data()) != 0) {
      std::fprintf(stderr, "cannot start %s\n", program.c_str());
      return 1;
    }
    {
      std::unique_lock lock(mutex);
      if (!owned.wait_for(lock, std::chrono::seconds(10), [&] { return isOwned; })) {
        std::fprintf(stderr, "quorveld never owned its name\n");
        kill(pid, SIGKILL);
        return 1;
      }
      startMillis.push_back(std::chrono::duration<double, std::milli>(ownedAt - started).count());
    }
    // Past the start-up keep-alive periods: the daemon is idle.
    std::this_thread::sleep_for(std::chrono::milliseconds(2500));
    idleKilobytes.push_back(residentKilobytes(pid));
    libraries = quorvel::bench::mappedSharedLibraries(pid);
    kill(pid, SIGTERM);
    waitpid(pid, nullptr, 0);
  }
  std::sort(startMillis.begin(), startMillis.end());
  std::sort(idleKilobytes.begin(), idleKilobytes.end());
  double medianStart = startMillis[startMillis.size() / 2];
  double medianMB = idleKilobytes[idleKilobytes.size() / 2] / 1024.0;
  std::printf(
      "exec to name owned: median %.1f ms (min %.1f, max %.1f) over %d runs; target <= 100 ms\n",
      medianStart, startMillis.front(), startMillis.back(), runs);
  std::printf("idle resident memory: median %.1f MB; target <= 15 MB\n", medianMB);
  std::printf("shared libraries mapped by the idle daemon: %d\n", libraries);
  std::printf("ratios to targets: start-up %.2f, memory %.2f\n", medianStart / 100.0,
              medianMB / 15.0);
  std::filesystem::remove_all(recordings);
  return 0;
}
