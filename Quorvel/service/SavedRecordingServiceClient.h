// SavedRecordingServiceClient: an app's connection to quorveld. The ten
// requests of the service as asynchronous calls with callbacks, and as
// blocking helpers that wait for the answer. Errors come back as error values
// with the domain and code the daemon gave them.
//
// Owned by the app. The asynchronous calls may be made from any thread; their
// callbacks, and the exporting-set handler, run on the client's own bus
// thread. The blocking helpers may be called from any thread but that one
// (calling them from a callback would wait forever). Prepare requests carry
// no call timeout: the daemon may defer them or finalize first.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Quorvel/service/RCSSavedRecordingAccessToken.h"
#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

class SavedRecordingServiceClient {
 public:
  using AccessRequestHandler = std::move_only_function<void(
      std::optional<RCSSavedRecordingAccessToken>, std::optional<platform::Error>)>;
  using CompletionHandler = std::move_only_function<void(std::optional<platform::Error>)>;
  using URLSetHandler = std::move_only_function<void(platform::Result<std::vector<platform::URL>>)>;

  struct Options {
    // Receive AccessSessionsChanged (see setAccessSessionsChangedHandler).
    // Off by default: the bus then sends this client none of those signals.
    bool watchAccessSessions = false;
  };
  // Connects to the bus at `busAddress`, or to the session bus when it is empty.
  static platform::Result<std::unique_ptr<SavedRecordingServiceClient>> connect(
      const std::string& busAddress = {});
  static platform::Result<std::unique_ptr<SavedRecordingServiceClient>> connect(
      const std::string& busAddress, Options options);
  ~SavedRecordingServiceClient();
  SavedRecordingServiceClient(const SavedRecordingServiceClient&) = delete;
  SavedRecordingServiceClient& operator=(const SavedRecordingServiceClient&) = delete;

  // The ten requests. A null handler sends the call without expecting a reply.
  void prepareToCaptureToCompositionAVURL(const platform::URL& url, AccessRequestHandler handler);
  void prepareToPreviewCompositionAVURL(const platform::URL& url, AccessRequestHandler handler);
  void prepareToExportCompositionAVURL(const platform::URL& url, bool cacheWaveform,
                                       AccessRequestHandler handler);
  void prepareToTrimCompositionAVURL(const platform::URL& url, AccessRequestHandler handler);
  void endAccessSessionWithToken(const RCSSavedRecordingAccessToken& token);
  void disableOrphanedFragmentCleanupForCompositionAVURL(const platform::URL& url,
                                                         CompletionHandler handler);
  void enableOrphanedFragmentCleanupForCompositionAVURL(const platform::URL& url);
  void disableOrphanHandlingWithCompletionBlock(CompletionHandler handler);
  void enableOrphanHandlingWithCompletionBlock(CompletionHandler handler);
  void fetchExportingCompositionAVURLs(URLSetHandler handler);

  // Blocking helpers.
  platform::Result<RCSSavedRecordingAccessToken> prepareToCapture(const platform::URL& url);
  platform::Result<RCSSavedRecordingAccessToken> prepareToPreview(const platform::URL& url);
  platform::Result<RCSSavedRecordingAccessToken> prepareToExport(const platform::URL& url,
                                                                 bool cacheWaveform);
  platform::Result<RCSSavedRecordingAccessToken> prepareToTrim(const platform::URL& url);
  platform::Status disableOrphanedFragmentCleanup(const platform::URL& url);
  platform::Status disableOrphanHandling();
  platform::Status enableOrphanHandling();
  platform::Result<std::vector<platform::URL>> fetchExportingCompositionAVURLs();

  // Called on the client's bus thread each time the daemon says the set of
  // recordings being exported may have changed. Replaces any earlier handler.
  void setExportingCompositionAVURLsChangedHandler(std::function<void()> handler);

  // Who holds a recording: the daemon's Sessions interface, beside the ten
  // requests. A holder is what the bus says of the peer; the daemon's own
  // sessions have none (empty bus name and command, pid 0).
  struct AccessHolder {
    std::string accessName;  // "capture", "preview", "export", "trimming", "finalize"
    std::int32_t accessType = 0;
    std::string compositionAVURL;
    std::string state;  // "open", "closing", or "waiting" for a deferred request
    std::chrono::system_clock::time_point since;
    std::string busName;
    std::uint32_t pid = 0;
    std::uint32_t uid = 0xFFFFFFFF;  // unknown
    std::string command;
  };
  // Every open and closing session; each recording's waiting request.
  platform::Result<std::vector<AccessHolder>> listAccessSessions();
  platform::Result<std::vector<AccessHolder>> listDeferredRequests();
  // Called on the client's bus thread with the composition AVURL whose
  // sessions or waiting request changed. Needs Options::watchAccessSessions.
  void setAccessSessionsChangedHandler(std::function<void(const std::string&)> handler);

  struct Impl;

 private:
  explicit SavedRecordingServiceClient(std::unique_ptr<Impl> impl);
  std::unique_ptr<Impl> impl_;
};

}  // namespace quorvel
