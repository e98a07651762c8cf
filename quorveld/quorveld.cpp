// quorveld: the saved-recordings daemon's entry point. Parses its options,
// builds the service, starts it and runs the main run loop until the process
// has been idle long enough (or forever with --idle-exit-after 0).
#include <fmt/format.h>
#include <CLI/CLI.hpp>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <filesystem>
#include <string>

#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/media/RCMediaWorkerClient.h"
#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "platform/Log.h"
#include "platform/MainQueue.h"
#include "platform/ProcessLifetime.h"
#include "platform/SignalSource.h"
#include "platform/dbus/BusListener.h"
#include "quorveld/IdleExit.h"
#include "quorveld/ProcessInfo.h"
#include "quorveld/SavedRecordingService.h"

namespace {

struct Options {
  std::string busAddress;
  std::string recordingsDirectory;
  double idleExitAfter = 30;
  bool verbose = false;
  bool info = false;
  bool version = false;
};

}  // namespace

int main(int argc, char** argv) {
  // Before any thread starts, so every thread inherits the mask and the
  // debug signal reaches only the service's signal source.
  platform::SignalSource::blockInThisThread(SIGUSR1);

  Options options;
  CLI::App app{"quorveld: the saved-recordings daemon", "quorveld"};
  app.add_option("--bus-address", options.busAddress,
                 "D-Bus address to serve on (default: the session bus)");
  app.add_option("--recordings-dir", options.recordingsDirectory,
                 "saved-recordings directory (default: $QUORVEL_RECORDINGS_DIR, else "
                 "${XDG_DATA_HOME:-~/.local/share}/quorvel/Recordings)");
  app.add_option("--idle-exit-after", options.idleExitAfter,
                 "seconds without open work before exiting; 0 = never")
      ->check(CLI::Validator(
          [](std::string& value) -> std::string {
            try {
              if (std::stod(value) >= 0) return {};
            } catch (const std::exception&) {
            }
            return "must be a number of seconds, 0 or more";
          },
          "SECONDS"))
      ->capture_default_str();
  app.add_flag("--verbose", options.verbose, "log tracing (level 7) too");
  app.add_flag("--info", options.info, "print the embedded process information and exit");
  app.add_flag("--version", options.version, "print the version and exit");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    return app.exit(error) == 0 ? 0 : 2;  // --help, or a usage error
  }

  const quorvel::ProcessInfo& info = quorvel::embeddedProcessInfo();
  if (options.info) {
    std::fputs(quorvel::processInfoJSON(info).c_str(), stdout);
    return 0;
  }
  if (options.version) {
    std::printf("quorveld %s\n", QUORVEL_VERSION);
    return 0;
  }
  quorvel::applyProcessEnvironment(info);

  platform::setLogIdentifier("quorveld");
  platform::logInitialize();
  if (options.verbose) platform::setLogThreshold(platform::kLogLevelDebug);
  QV_LOG(platform::kLogLevelDebug, "Starting xpc service");
  // Audio files are parsed only in quorvel-media worker processes.
  quorvel::RCMediaEngine::setCurrent(std::make_shared<quorvel::RCMediaWorkerClient>());

  if (!options.recordingsDirectory.empty()) {
    quorvel::RCSavedRecordingsModel::setSavedRecordingsDirectory(options.recordingsDirectory);
  }
  std::error_code error;
  std::string directory = quorvel::RCSavedRecordingsModel::savedRecordingsDirectory();
  std::filesystem::create_directories(directory, error);
  if (error) {
    std::fprintf(stderr, "quorveld: cannot create the recordings directory %s: %s\n",
                 directory.c_str(), error.message().c_str());
    return 1;
  }

  auto service = quorvel::SavedRecordingService::sharedInstance();
  platform::ProcessLifetime& lifetime = platform::ProcessLifetime::instance();
  lifetime.setIdleExitAfter(std::chrono::duration_cast<platform::Duration>(
      std::chrono::duration<double>(options.idleExitAfter)));
  quorvel::IdleExit::install(service, lifetime);

  service->setListenerFactory(
      [address = options.busAddress](const std::string& serviceName,
                                     platform::InterfaceDescription interface) {
        return std::make_shared<platform::BusListener>(
            platform::BusListenerOptions{.busAddress = address,
                                         .serviceName = serviceName,
                                         .objectPath = quorvel::RCSSavedRecordingServiceObjectPath},
            std::move(interface));
      });
  if (auto started = service->start(); !started) {
    std::fprintf(stderr, "quorveld: cannot serve %s on %s: %s\n",
                 quorvel::RCSSavedRecordingServiceMachServiceName,
                 options.busAddress.empty() ? "the session bus" : options.busAddress.c_str(),
                 started.error().localizedDescription().c_str());
    return 1;
  }

  platform::mainQueue().run();

  QV_LOG(platform::kLogLevelDebug, "Exiting xpc service");
  return 0;
}
