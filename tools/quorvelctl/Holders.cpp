#include "tools/quorvelctl/Holders.h"

#include <fmt/chrono.h>
#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <ctime>
#include <memory>
#include <mutex>
#include <vector>

#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"

namespace quorvelctl {
namespace {

using Holder = quorvel::SavedRecordingServiceClient::AccessHolder;

// Whether `text` (a composition AVURL from the daemon) names `url`.
bool names(const std::string& text, const platform::URL& url) {
  auto other = platform::URL::fileURLFromString(text);
  return other && other->URLByStandardizingPath() == url.URLByStandardizingPath();
}

std::string localTime(std::chrono::system_clock::time_point time, const char* format) {
  const std::time_t seconds = std::chrono::system_clock::to_time_t(time);
  std::tm local{};
  ::localtime_r(&seconds, &local);
  char text[64];
  return std::string(text, std::strftime(text, sizeof text, format, &local));
}

std::string who(const Holder& holder) {
  if (holder.busName.empty()) return "quorveld";  // the daemon's own finalization
  return holder.command.empty() ? holder.busName : holder.command;
}

// Sessions, then waiting requests; only those of `url` when given.
platform::Result<std::vector<Holder>> holdersOf(quorvel::SavedRecordingServiceClient& client,
                                                const std::optional<platform::URL>& url) {
  auto sessions = client.listAccessSessions();
  if (!sessions) return platform::fail(sessions.error());
  auto waiting = client.listDeferredRequests();
  if (!waiting) return platform::fail(waiting.error());
  sessions->insert(sessions->end(), waiting->begin(), waiting->end());
  if (url) {
    std::erase_if(*sessions,
                  [&](const Holder& holder) { return !names(holder.compositionAVURL, *url); });
  }
  return std::move(*sessions);
}

std::string recordingName(const std::string& compositionAVURL) {
  auto url = platform::URL::fileURLFromString(compositionAVURL);
  return url ? url->lastPathComponent() : compositionAVURL;
}

}  // namespace

bool isConflict(const platform::Error& error) {
  return error.domain() == quorvel::RCSSavedRecordingServiceErrorDomain &&
         error.code() == quorvel::RCSSavedRecordingServiceErrorConflictingSession;
}

int listSessions(quorvel::SavedRecordingServiceClient& client,
                 const std::optional<platform::URL>& url, bool json) {
  auto holders = holdersOf(client, url);
  if (!holders) {
    std::fprintf(stderr, "quorvelctl: %s\n", holders.error().description().c_str());
    return 1;
  }
  if (json) {
    nlohmann::json list = nlohmann::json::array();
    for (const Holder& holder : *holders) {
      list.push_back(
          {{"command", holder.command},
           {"pid", holder.pid},
           {"uid", holder.uid},
           {"busName", holder.busName},
           {"kind", holder.accessName},
           {"accessType", holder.accessType},
           {"recording", holder.compositionAVURL},
           {"since", fmt::format("{:%FT%T}Z",
                                 fmt::gmtime(std::chrono::system_clock::to_time_t(holder.since)))},
           {"state", holder.state}});
    }
    std::printf("%s\n", nlohmann::json{{"sessions", list}}.dump().c_str());
    return 0;
  }
  std::vector<std::vector<std::string>> rows = {
      {"COMMAND", "PID", "KIND", "RECORDING", "SINCE", "STATE"}};
  for (const Holder& holder : *holders) {
    rows.push_back({who(holder), holder.pid ? std::to_string(holder.pid) : "-", holder.accessName,
                    recordingName(holder.compositionAVURL),
                    localTime(holder.since, "%Y-%m-%d %H:%M:%S"), holder.state});
  }
  std::vector<std::size_t> widths(rows.front().size(), 0);
  for (const auto& row : rows)
    for (std::size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], row[i].size());
  for (const auto& row : rows) {
    std::string line;
    for (std::size_t i = 0; i < row.size(); ++i) {
      line += i + 1 < row.size() ? fmt::format("{:<{}}  ", row[i], widths[i]) : row[i];
    }
    std::printf("%s\n", line.c_str());
  }
  std::printf("\n%zu session(s) listed.\n", holders->size());
  return 0;
}

std::string describeHolders(quorvel::SavedRecordingServiceClient& client,
                            const platform::URL& url) {
  auto holders = holdersOf(client, url);
  if (!holders) return {};
  std::string text;
  for (const Holder& holder : *holders) {
    if (holder.state == "waiting") continue;
    if (!text.empty()) text += "; ";
    text += fmt::format("held by {}", who(holder));
    if (holder.pid) text += fmt::format(" (pid {})", holder.pid);
    text += fmt::format(" for {} since {}", holder.accessName, localTime(holder.since, "%H:%M:%S"));
    if (holder.state == "closing") text += ", closing";
  }
  return text;
}

platform::Result<quorvel::RCSSavedRecordingAccessToken> waitForAccess(
    quorvel::SavedRecordingServiceClient& client, const platform::URL& url, double seconds,
    const std::function<platform::Result<quorvel::RCSSavedRecordingAccessToken>()>& request) {
  // Shared with the handler, which may still be running on the client's bus
  // thread when this returns.
  struct Changes {
    std::mutex mutex;
    std::condition_variable changed;
    std::uint64_t count = 0;
  };
  auto changes = std::make_shared<Changes>();
  client.setAccessSessionsChangedHandler([changes, url](const std::string& changedURL) {
    if (!names(changedURL, url)) return;
    std::lock_guard lock(changes->mutex);
    ++changes->count;
    changes->changed.notify_one();
  });
  const auto deadline = seconds < 0 ? std::chrono::steady_clock::time_point::max()
                                    : std::chrono::steady_clock::now() +
                                          std::chrono::duration_cast<std::chrono::nanoseconds>(
                                              std::chrono::duration<double>(seconds));
  for (;;) {
    std::uint64_t seen;
    {
      std::lock_guard lock(changes->mutex);
      seen = changes->count;
    }
    auto token = request();
    if (token || !isConflict(token.error())) return token;
    std::unique_lock lock(changes->mutex);
    if (!changes->changed.wait_until(lock, deadline, [&] { return changes->count != seen; })) {
      return token;
    }
  }
}

}  // namespace quorvelctl
