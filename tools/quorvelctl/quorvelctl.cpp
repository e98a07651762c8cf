// quorvelctl: talks to quorveld from the command line. One subcommand per
// request of the service, `watch` for the exporting-set signal, and the
// recording management an app does itself (`new`, `list`, `info`, `waveform`).
//
//   quorvelctl capture URL                 prints the token
//   quorvelctl capture URL -- COMMAND...   holds the session while COMMAND
//                                          runs, ends it whatever COMMAND's
//                                          outcome, exits with its status
//   quorvelctl end NAME TYPE URL ID        hands a token back
//
// Every error is a message on stderr and a non-zero exit status: 1 for an
// error the daemon answered, 2 for bad usage, 3 when the daemon could not be
// reached, COMMAND's status when COMMAND ran.
#include <fmt/format.h>
#include <sys/wait.h>
#include <unistd.h>
#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <future>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Quorvel/files/RCRecordingsDirectory.h"
#include "Quorvel/service/RCSSavedRecordingAccessToken.h"
#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"
#include "Quorvel/service/SavedRecordingServiceClient.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
#include "platform/Subprocess.h"
#include "tools/quorvelctl/Holders.h"
#include "tools/quorvelctl/Recordings.h"
#include "tools/quorvelctl/WaveformPicture.h"

namespace {

using quorvel::RCSSavedRecordingAccessToken;
using quorvel::SavedRecordingServiceClient;

constexpr int kExitDaemonError = 1;
constexpr int kExitUsage = 2;
constexpr int kExitUnreachable = 3;

struct Globals {
  std::string busAddress;
  std::string recordingsDirectory;
  bool json = false;
};

nlohmann::json tokenJSON(const RCSSavedRecordingAccessToken& token) {
  auto [name, type, url, identifier] = token.toTuple();
  return {{"accessName", name},
          {"accessType", type},
          {"compositionAVURL", url},
          {"identifier", identifier}};
}

nlohmann::json errorJSON(const platform::Error& error) {
  return {{"domain", error.domain()},
          {"code", error.code()},
          {"description", error.localizedDescription()}};
}

int reportError(const Globals& globals, const platform::Error& error) {
  if (globals.json) {
    std::printf("%s\n", nlohmann::json{{"error", errorJSON(error)}}.dump().c_str());
  }
  if (error.domain() == quorvel::RCSSavedRecordingServiceErrorDomain) {
    // The service's own refusals (301, 302, ...) by the name scripts match on.
    std::fprintf(stderr, "quorvelctl: %s (%ld): %s\n",
                 quorvel::RCSDBusErrorFromError(error).name.c_str(), error.code(),
                 error.description().c_str());
  } else {
    std::fprintf(stderr, "quorvelctl: %s\n", error.description().c_str());
  }
  return kExitDaemonError;
}

std::optional<platform::URL> parseURL(const std::string& text) {
  if (!text.empty() && text.front() != '/' && text.find("://") == std::string::npos) {
    return platform::URL::fileURLWithPath(text);  // a relative path
  }
  return platform::URL::fromFileURLStringOrPath(text);
}

// Runs `command` and returns its exit status (128 + signal when killed).
int runCommand(const std::vector<std::string>& command) {
  auto child = platform::Subprocess::spawn(
      {.arguments = command, .searchPath = true, .closeFrom = std::nullopt});
  if (!child) {
    std::fprintf(stderr, "quorvelctl: cannot run %s: %s\n", command.front().c_str(),
                 std::strerror(int(child.error().code())));
    return 127;
  }
  // While COMMAND runs it owns the terminal's interrupts; we only wait.
  std::signal(SIGINT, SIG_IGN);
  std::signal(SIGQUIT, SIG_IGN);
  return platform::Subprocess::exitCode(child->wait());
}

// Hands the token back. The call expects no reply, so a round trip behind
// it on the same connection makes sure it left before the process exits.
void endSession(SavedRecordingServiceClient& client, const RCSSavedRecordingAccessToken& token) {
  client.endAccessSessionWithToken(token);
  (void)client.fetchExportingCompositionAVURLs();
}

// Runs a prepare request; an export may take minutes (it finalizes first), so
// on a terminal it shows how long it has waited.
template <class Request>
auto waitShowingElapsedTime(bool show, Request request) {
  auto pending = std::async(std::launch::async, std::move(request));
  if (!show) return pending.get();
  const auto start = std::chrono::steady_clock::now();
  while (pending.wait_for(std::chrono::milliseconds(200)) != std::future_status::ready) {
    std::chrono::duration<double> waited = std::chrono::steady_clock::now() - start;
    std::fprintf(stderr, "\rwaiting for the export: %.1f s", waited.count());
  }
  std::fprintf(stderr, "\r\033[K");
  return pending.get();
}

void printURLs(const Globals& globals, const std::vector<platform::URL>& urls) {
  if (globals.json) {
    nlohmann::json list = nlohmann::json::array();
    for (const auto& url : urls) list.push_back(url.absoluteString());
    std::printf("%s\n", nlohmann::json{{"compositionAVURLs", list}}.dump().c_str());
  } else {
    for (const auto& url : urls) std::printf("%s\n", url.absoluteString().c_str());
  }
}

}  // namespace

int main(int argc, char** argv) {
  quorvel::RCUseInProcessMediaEngine();  // recording management reads audio here
  Globals globals;
  CLI::App app{"quorvelctl: talk to the quorveld saved-recordings daemon", "quorvelctl"};
  app.require_subcommand(1);
  app.fallthrough();  // --json and --bus-address may also follow the subcommand
  app.add_option("--bus-address", globals.busAddress,
                 "D-Bus address of the daemon's bus (default: the session bus)");
  app.add_flag("--json", globals.json, "print results as JSON");
  app.add_option("--recordings-dir", globals.recordingsDirectory,
                 "the recordings directory for new, list and info (default: as quorveld's)");

  struct Prepare {
    const char* name;
    const char* help;
    std::string url;
    bool cacheWaveform = false;
    std::vector<std::string> command;
    std::string waitText;    // --wait's value: "forever", or seconds
    double waitSeconds = 0;  // with --wait: how long; negative for no limit
    CLI::App* sub = nullptr;
    CLI::Option* wait = nullptr;
  };
  std::vector<Prepare> prepares = {
      {"capture", "get exclusive access to record into a recording"},
      {"preview", "get shared access to play a recording"},
      {"export", "get shared access to a finalized recording"},
      {"trim", "get exclusive access to edit a recording"},
  };
  for (auto& prepare : prepares) {
    prepare.sub = app.add_subcommand(prepare.name, prepare.help);
    prepare.sub->add_option("url", prepare.url, "the recording's composed audio file (path or URL)")
        ->required();
    if (std::string_view(prepare.name) == "export") {
      prepare.sub->add_flag("--cache-waveform", prepare.cacheWaveform,
                            "also compute and keep the waveform");
    }
    prepare.wait = prepare.sub->add_flag(
        "--wait{forever}", prepare.waitText,
        "when another session holds the recording, wait until it is free (--wait=SECONDS: "
        "at most that long), as flock -w does");
    prepare.sub->add_option("command", prepare.command,
                            "after --: run this while holding access, then end the session");
  }

  std::vector<std::string> tokenFields;
  auto* end = app.add_subcommand("end", "hand a token back (ends its session)");
  end->add_option("token", tokenFields, "NAME TYPE URL ID, as printed by a prepare subcommand")
      ->expected(4)
      ->required();

  std::string cleanupURL;
  auto* disableCleanup =
      app.add_subcommand("disable-cleanup", "hold off deleting a recording's unused fragments");
  disableCleanup->add_option("url", cleanupURL, "the recording")->required();
  auto* enableCleanup =
      app.add_subcommand("enable-cleanup", "release a hold placed with disable-cleanup");
  enableCleanup->add_option("url", cleanupURL, "the recording")->required();
  auto* disableOrphans =
      app.add_subcommand("disable-orphan-handling", "switch the orphan recovery run off");
  auto* enableOrphans =
      app.add_subcommand("enable-orphan-handling", "switch the orphan recovery run on (runs it)");
  auto* fetch =
      app.add_subcommand("fetch-exporting", "list the recordings whose export is being prepared");
  auto* watch = app.add_subcommand(
      "watch", "print the exporting set each time it changes, until interrupted");
  std::string sessionsURL;
  auto* sessions = app.add_subcommand(
      "sessions", "list who holds which recording: open, closing and waiting sessions");
  sessions->add_option("url", sessionsURL, "only this recording's");

  std::string title;
  std::vector<std::string> files;
  auto* make = app.add_subcommand("new", "make a recording from audio files (no daemon needed)");
  make->add_option("title", title, "the recording's title")->required();
  make->add_option("files", files, "its audio, in order")->required();
  auto* list = app.add_subcommand("list", "list the recordings in the database");
  std::string infoURL;
  auto* info = app.add_subcommand("info", "show a recording's fragments and composed state");
  info->add_option("url", infoURL, "the recording's composed audio file")->required();
  std::string waveformURL;
  std::string pngPath;
  quorvelctl::WaveformPictureSize pictureSize;
  auto* waveform =
      app.add_subcommand("waveform", "draw a recording's waveform file as a PNG picture");
  waveform->add_option("url", waveformURL, "the recording's composed audio file")->required();
  waveform->add_option("--png", pngPath, "the picture to write")->required();
  waveform->add_option("--width", pictureSize.width, "picture width in pixels")
      ->check(CLI::Range(1, 16384))
      ->capture_default_str();
  waveform->add_option("--height", pictureSize.height, "picture height in pixels")
      ->check(CLI::Range(1, 4096))
      ->capture_default_str();

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    int code = app.exit(e);
    return code == 0 ? 0 : kExitUsage;
  }

  if (!globals.recordingsDirectory.empty()) {
    quorvel::RCSetSavedRecordingsDirectory(globals.recordingsDirectory);
  }
  if (*make) return quorvelctl::newRecording(title, files, globals.json);
  if (*list) return quorvelctl::listRecordings(globals.json);
  if (*info) return quorvelctl::showRecording(infoURL, globals.json);
  if (*waveform) return quorvelctl::drawWaveform(waveformURL, pngPath, pictureSize);

  // --wait alone waits as long as it takes; --wait=SECONDS at most that long.
  for (auto& prepare : prepares) {
    if (!*prepare.sub || prepare.wait->count() == 0) continue;
    if (prepare.waitText == "forever") {
      prepare.waitSeconds = -1;
      continue;
    }
    char* end = nullptr;
    prepare.waitSeconds = std::strtod(prepare.waitText.c_str(), &end);
    if (end == prepare.waitText.c_str() || *end != '\0' || !(prepare.waitSeconds >= 0)) {
      std::fprintf(stderr, "quorvelctl: --wait takes a number of seconds: %s\n",
                   prepare.waitText.c_str());
      return kExitUsage;
    }
  }
  const bool waits = std::ranges::any_of(
      prepares, [](const Prepare& prepare) { return *prepare.sub && prepare.wait->count() > 0; });
  auto connected =
      SavedRecordingServiceClient::connect(globals.busAddress, {.watchAccessSessions = waits});
  if (!connected) {
    std::fprintf(stderr, "quorvelctl: %s\n", connected.error().localizedDescription().c_str());
    return kExitUnreachable;
  }
  SavedRecordingServiceClient& client = **connected;

  for (auto& prepare : prepares) {
    if (!*prepare.sub) continue;
    auto url = parseURL(prepare.url);
    if (!url) {
      std::fprintf(stderr, "quorvelctl: not a file path or file URL: %s\n", prepare.url.c_str());
      return kExitUsage;
    }
    std::string_view kind = prepare.name;
    auto ask = [&] {
      return kind == "capture"   ? client.prepareToCapture(*url)
             : kind == "preview" ? client.prepareToPreview(*url)
             : kind == "export"
                 ? waitShowingElapsedTime(
                       isatty(STDERR_FILENO) && !globals.json,
                       [&] { return client.prepareToExport(*url, prepare.cacheWaveform); })
                 : client.prepareToTrim(*url);
    };
    auto token = waits ? quorvelctl::waitForAccess(client, *url, prepare.waitSeconds, ask) : ask();
    if (!token && quorvelctl::isConflict(token.error())) {
      // Say who holds it, as the lock tools do.
      const std::string holders = quorvelctl::describeHolders(client, *url);
      if (waits) {
        std::fprintf(stderr, "quorvelctl: gave up after %g s waiting for %s%s%s\n",
                     prepare.waitSeconds, url->lastPathComponent().c_str(),
                     holders.empty() ? "" : ": ", holders.c_str());
        return kExitDaemonError;
      }
      if (!holders.empty()) std::fprintf(stderr, "quorvelctl: %s\n", holders.c_str());
    }
    if (!token) return reportError(globals, token.error());
    if (!prepare.command.empty()) {
      int status = runCommand(prepare.command);
      endSession(client, *token);
      return status;
    }
    if (globals.json) {
      std::printf("%s\n", nlohmann::json{{"token", tokenJSON(*token)}}.dump().c_str());
    } else {
      auto [name, type, urlString, identifier] = token->toTuple();
      std::printf("%s %d %s %s\n", name.c_str(), type, urlString.c_str(), identifier.c_str());
    }
    return 0;
  }

  if (*end) {
    int type = 0;
    try {
      type = std::stoi(tokenFields[1]);
    } catch (const std::exception&) {
      std::fprintf(stderr, "quorvelctl: the token's TYPE must be a number: %s\n",
                   tokenFields[1].c_str());
      return kExitUsage;
    }
    auto token = RCSSavedRecordingAccessToken::fromTuple(
        {tokenFields[0], type, tokenFields[2], tokenFields[3]});
    if (!token) {
      std::fprintf(stderr, "quorvelctl: not a token: %s %s %s %s\n", tokenFields[0].c_str(),
                   tokenFields[1].c_str(), tokenFields[2].c_str(), tokenFields[3].c_str());
      return kExitUsage;
    }
    endSession(client, *token);
    return 0;
  }

  if (*disableCleanup || *enableCleanup) {
    auto url = parseURL(cleanupURL);
    if (!url) {
      std::fprintf(stderr, "quorvelctl: not a file path or file URL: %s\n", cleanupURL.c_str());
      return kExitUsage;
    }
    if (*enableCleanup) {
      client.enableOrphanedFragmentCleanupForCompositionAVURL(*url);
      return 0;
    }
    auto done = client.disableOrphanedFragmentCleanup(*url);
    return done ? 0 : reportError(globals, done.error());
  }

  if (*disableOrphans || *enableOrphans) {
    auto done = *disableOrphans ? client.disableOrphanHandling() : client.enableOrphanHandling();
    return done ? 0 : reportError(globals, done.error());
  }

  if (*sessions) {
    std::optional<platform::URL> url;
    if (!sessionsURL.empty()) {
      url = parseURL(sessionsURL);
      if (!url) {
        std::fprintf(stderr, "quorvelctl: not a file path or file URL: %s\n", sessionsURL.c_str());
        return kExitUsage;
      }
    }
    return quorvelctl::listSessions(client, url, globals.json);
  }

  if (*fetch) {
    auto urls = client.fetchExportingCompositionAVURLs();
    if (!urls) return reportError(globals, urls.error());
    printURLs(globals, *urls);
    return 0;
  }

  if (*watch) {
    // The signal arrives on the client's bus thread, which must not wait
    // for a reply itself: the main thread asks for the set.
    std::mutex mutex;
    std::condition_variable changed;
    int pending = 0;
    client.setExportingCompositionAVURLsChangedHandler([&] {
      std::lock_guard lock(mutex);
      ++pending;
      changed.notify_one();
    });
    for (;;) {  // until interrupted
      {
        std::unique_lock lock(mutex);
        changed.wait(lock, [&] { return pending > 0; });
        pending = 0;
      }
      auto urls = client.fetchExportingCompositionAVURLs();
      if (!urls) return reportError(globals, urls.error());
      if (!globals.json) std::printf("exporting set changed: %zu recording(s)\n", urls->size());
      printURLs(globals, *urls);
      std::fflush(stdout);
    }
  }
  return 0;
}
