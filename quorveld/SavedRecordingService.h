// SavedRecordingService: the daemon's one service object. It is the
// listener's delegate and every client connection's exported object, holds
// all service state, and runs every request on its service serial queue.
//
// A process-wide singleton made by the first sharedInstance() call and kept
// until the process ends. Its code is split by concern:
//   SavedRecordingService.cpp              creation, start-up, debug signal
//   SavedRecordingService.Connections.cpp  accepting connections, their end,
//                                          delivery, _performOnServiceQueue
//   SavedRecordingService.Interface.cpp    the ten requests' entry checks
// and SavedRecordingServiceBusEdge turns bus calls into those requests.
//   SavedRecordingService.Sessions.cpp     access requests, deferral, the
//                                          close procedure, disconnection
//   SavedRecordingService.OrphanHandling.cpp  fragment cleanup and its holds,
//                                          the orphan-handling switch
//   SavedRecordingService.Holders.cpp      who holds a recording: the
//                                          listings and their change signal
//
// Threads: the request methods and the listener-delegate methods run on the
// listener's delivery thread (the bus thread); they only check arguments and
// hand work to _performOnServiceQueue(). Every _onQueue… / _onServiceQueue…
// member must be called on the service serial queue, and every field below
// is touched only there, except _compositionAVURLsBeingExported (inside
// _serialQueue) and the queues and listener themselves.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <stdexcept>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "Quorvel/service/RCSSavedRecordingAccessToken.h"
#include "platform/Error.h"
#include "platform/OperationQueue.h"
#include "platform/SerialQueue.h"
#include "platform/SignalSource.h"
#include "platform/URL.h"
#include "platform/dbus/Listener.h"
#include "quorveld/AssetAccessSessionController.h"
#include "quorveld/AssetExportController.h"
#include "quorveld/RCSAdditions.h"

namespace quorvel {

// What the service raises for misuse inside the process.
class GenericException : public std::logic_error {
 public:
  using std::logic_error::logic_error;
};

class SavedRecordingService final : public platform::ListenerDelegate,
                                    public std::enable_shared_from_this<SavedRecordingService> {
 public:
  using AccessRequestHandler = std::move_only_function<void(
      std::optional<RCSSavedRecordingAccessToken>, std::optional<platform::Error>)>;
  using CompletionHandler = std::move_only_function<void(std::optional<platform::Error>)>;
  using URLSetHandler = std::move_only_function<void(std::set<platform::URL>)>;
  using WorkBlock = std::move_only_function<void()>;
  using AccessSessionHandler = std::move_only_function<void(std::shared_ptr<AssetAccessSession>,
                                                            std::optional<platform::Error>)>;
  // A recording's one waiting access request: called with true when a newer
  // request superseded it, with false to re-issue it. `connection` is the
  // client it answers (none for the daemon's own requests), so a client that
  // goes away takes its waiting request with it.
  struct DeferredAccessRequest {
    std::shared_ptr<platform::Connection> connection;
    std::move_only_function<void(bool cancelled)> run;
    // What it asks for, and since when (for listings).
    std::string name;
    bool exclusive = false;
    std::chrono::system_clock::time_point since = std::chrono::system_clock::now();
  };
  // One session or waiting request as the listings show it.
  struct AccessListing {
    std::string accessName;
    bool exclusive = false;
    platform::URL compositionAVURL;
    const char* state = "";  // "open", "closing"; empty for a waiting request
    std::chrono::system_clock::time_point since;
    std::shared_ptr<platform::Connection> connection;  // none for the daemon's own
  };
  using AccessListingHandler = std::move_only_function<void(std::vector<AccessListing>)>;
  // Makes the listener on the service name for start(): a BusListener in
  // quorveld, a LocalListener in tests.
  using ListenerFactory = std::function<std::shared_ptr<platform::Listener>(
      const std::string& serviceName, platform::InterfaceDescription interface)>;

  // The service, made on first call (exactly once, even under concurrent
  // first calls).
  static std::shared_ptr<SavedRecordingService> sharedInstance();
  // There is no other way to make the service: raises GenericException
  // "-init is invalid. Use +sharedInstance instead." and yields nothing.
  [[noreturn]] static std::shared_ptr<SavedRecordingService> init();
  // Tests: a service of its own, not the singleton. The platform allows one
  // SIGUSR1 source at a time, so tests that do not test the debug signal
  // make their services without one.
  struct TestingOptions {
    bool watchDebugSignal = true;
  };
  static std::shared_ptr<SavedRecordingService> makeForTesting();
  static std::shared_ptr<SavedRecordingService> makeForTesting(TestingOptions options);
  ~SavedRecordingService() override;

  // Where start() gets its listener (by default a BusListener on the
  // session bus). Set before start().
  void setListenerFactory(ListenerFactory factory);
  // Start-up: the two keep-alive periods, the launch-event handler, the
  // first orphan-handling pass one second later, and the listener on the
  // service name. Returns the listener's failure to start (bus unreachable,
  // name taken) and drops that listener, so a later start() makes a new one;
  // the keep-alive periods run either way. Call on the main thread.
  platform::Status start();

  // The launch event stream: posts `name` on the default notification
  // center. An event without a name is logged and ignored. Main queue.
  void _handleLaunchEvent(const std::optional<std::string>& name);

  // ListenerDelegate (delivery thread).
  bool shouldAcceptNewConnection(platform::Listener& listener,
                                 std::shared_ptr<platform::Connection> newConnection) override;
  void listenerDidLoseBus(platform::Listener& listener) override;

  // The ten requests (delivery thread). An empty handler is a call that
  // expects no reply; an empty URL or token is a missing one. Those that
  // need the calling connection take it explicitly, by default the one
  // whose call is being delivered on this thread.
  void prepareToCaptureToCompositionAVURL(
      std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler,
      std::shared_ptr<platform::Connection> xpcConnection = rcs_currentConnection());
  void prepareToPreviewCompositionAVURL(
      std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler,
      std::shared_ptr<platform::Connection> xpcConnection = rcs_currentConnection());
  void prepareToExportCompositionAVURL(
      std::optional<platform::URL> compositionAVURL, bool cacheWaveform,
      AccessRequestHandler accessRequestHandler,
      std::shared_ptr<platform::Connection> xpcConnection = rcs_currentConnection());
  void prepareToTrimCompositionAVURL(
      std::optional<platform::URL> compositionAVURL, AccessRequestHandler accessRequestHandler,
      std::shared_ptr<platform::Connection> xpcConnection = rcs_currentConnection());
  void endAccessSessionWithToken(
      std::optional<RCSSavedRecordingAccessToken> accessToken,
      std::shared_ptr<platform::Connection> xpcConnection = rcs_currentConnection());
  void disableOrphanedFragmentCleanupForCompositionAVURL(
      std::optional<platform::URL> compositionAVURL, CompletionHandler completionBlock,
      std::shared_ptr<platform::Connection> xpcConnection = rcs_currentConnection());
  void enableOrphanedFragmentCleanupForCompositionAVURL(
      std::optional<platform::URL> compositionAVURL,
      std::shared_ptr<platform::Connection> xpcConnection = rcs_currentConnection());
  void disableOrphanHandlingWithCompletionBlock(CompletionHandler completionBlock);
  void enableOrphanHandlingWithCompletionBlock(CompletionHandler completionBlock);
  void fetchExportingCompositionAVURLs(URLSetHandler reply);

  // Runs `block` later on the service serial queue, under the keep-alive
  // "Dispatch to service queue" that ends one second after the block ran.
  // Returns at once. Any thread.
  //
  // A block marked Short may run on the bus thread right after the call
  // that queued it, while the queue is idle, which spares a request two
  // thread switches; the bus reads no message meanwhile, so Short is only
  // for blocks that cannot block: no media job, no fsync, no wait for
  // another queue's work (entering the registry's, the transaction
  // controller's or the instance queue, whose blocks are all tiny, is fine).
  // Everything else (the orphan recovery run, handing a finalization to the
  // export controller) runs on the service queue's own thread.
  enum class WorkLength { MayBlock, Short };
  void _performOnServiceQueue(WorkBlock block, WorkLength length = WorkLength::MayBlock);
  // The connection has ended: on the service serial queue, mark it invalid
  // and release what the daemon held for it. Returns at once. Any thread.
  void _handleXPCDisconnect(const std::shared_ptr<platform::Connection>& connection);
  // One orphan-handling pass, or the line saying it is switched off. Must be
  // called on the service serial queue.
  void _onQueuePerformOrphanHandlingIfEnabled();

  // Access sessions. Every member below must be called on the service
  // serial queue.
  //
  // The open step: asks the registry for a session; a granted one first has
  // its recording's orphaned fragments cleaned, then reaches `handler`. A
  // refusal answers error 301 at once, unless some session (of any
  // recording) is closing: then the request waits as the recording's
  // deferred access request, superseding (error 302) any earlier one. A
  // connection already marked invalid is never granted anything; its
  // handler is dropped unanswered.
  void _onServiceQueueOpenAccessSessionNamed(const std::string& name,
                                             const platform::URL& compositionAVURL, bool exclusive,
                                             std::shared_ptr<platform::Connection> xpcConnection,
                                             AccessSessionHandler accessSessionHandler);
  // Whether the recording has an open exclusive session / any open session
  // other than `ignoredAccessSession` (closing sessions count).
  bool _onServiceQueueHasActiveExclusiveSessionForCompositionAVURL(
      const platform::URL& compositionAVURL,
      const std::shared_ptr<AssetAccessSession>& ignoredAccessSession);
  bool _onServiceQueueHasActiveSessionsForCompositionAVURL(
      const platform::URL& compositionAVURL,
      const std::shared_ptr<AssetAccessSession>& ignoredAccessSession);
  // The close procedure: marks the session closing, cleans its recording's
  // orphaned fragments, then removes it from the registry and starts the
  // recording's deferred work. A null session does nothing.
  void _onQueueCloseAccessSession(const std::shared_ptr<AssetAccessSession>& session,
                                  bool normalTermination);
  // The final step's start of the recording's deferred work. True when the
  // recording's finalization was started or still waits for a later close.
  bool _onServiceQueueAttemptToRunningDeferredWorkAfterClosingSession(
      const std::shared_ptr<AssetAccessSession>& session);
  // The recordings the orphan recovery run must leave alone: held off by a
  // client, waiting behind a deferred request or finalization, or with an
  // open session. May name a recording more than once.
  std::vector<platform::URL> _onQueue_composedAVURLsWithActiveSessionsOrScheduledWork();

  // Fragment cleanup and its holds. Any thread: each hands its work to the
  // service serial queue. The cleanup's completion, when given, runs there
  // exactly once.
  void _attemptOrphanedFragmentsCleanupForCompositionAVURL(
      const platform::URL& compositionAVURL,
      std::shared_ptr<AssetAccessSession> ignoredAccessSession, WorkBlock completionBlock);
  void _addDisabledOrphanCleanupForCompositionAVURL(
      std::optional<platform::URL> compositionAVURL,
      std::shared_ptr<platform::Connection> xpcConnection, CompletionHandler completionBlock);
  void _removeDisabledOrphanCleanupForCompositionAVURL(
      std::optional<platform::URL> compositionAVURL,
      std::shared_ptr<platform::Connection> xpcConnection);
  void _removeDisabledOrphanCleanupAVURLsForConnection(
      const std::shared_ptr<platform::Connection>& xpcConnection);

  // Finalization. Any thread: each hands its decision to the service serial
  // queue.
  //
  // Finalizes the recording through the export controller unless another
  // session than `ignoredAccessSession` holds it exclusively (then
  // `completionBlock` gets false at once, on the service serial queue).
  // Otherwise the recording is in the exporting set while there is work to
  // do, the change is posted twice, and `completionBlock` (may be empty)
  // gets the outcome on the main queue.
  using FinalizationCompletionBlock = std::move_only_function<void(bool success)>;
  void _attemptFinalizationOfCompositionAVURL(
      const platform::URL& compositionAVURL, bool cacheWaveform,
      std::shared_ptr<AssetAccessSession> ignoredAccessSession,
      FinalizationCompletionBlock completionBlock);
  // Finalizes the recording, with its waveform, under a shared "finalize"
  // session of the daemon's own; when that session is refused the recording
  // waits in _compositionAVURLsToFinalize for a later close.
  void _attemptToRunDeferredFinalizationOfCompositionAVURL(
      std::optional<platform::URL> compositionAVURL);
  // Emits ExportingCompositionAVURLsChanged on the bus. Any thread.
  void _postExportingCompositionAVURLsChanged();

  // Who holds recordings, beside the contract. Any thread: each takes a
  // snapshot on the service serial queue and hands it to `reply` there.
  // Every open and closing session, in the registry's order:
  void listAccessSessions(AccessListingHandler reply);
  // Each recording's waiting request:
  void listDeferredRequests(AccessListingHandler reply);
  // Notes that the recording's sessions or its waiting request changed:
  // AccessSessionsChanged goes out for it a few milliseconds later (on the
  // main queue's clock), once however often it changed meanwhile. Must be
  // called on the service serial queue.
  void _onQueueNoteAccessSessionsChanged(const platform::URL& compositionAVURL);

  // Tests: the service's waiting state. Must be called on the service
  // serial queue.
  std::size_t closingSessionCountForTesting() const { return _closingSessions.size(); }
  std::size_t deferredAccessRequestCountForTesting() const {
    return _compositionAVURLsDeferredAccessRequestBlocksByAVURL.size();
  }
  const std::vector<platform::URL>& compositionAVURLsToFinalizeForTesting() const {
    return _compositionAVURLsToFinalize;
  }
  AssetExportController& assetExportController() { return *_assetExportController; }
  // Waits for the fragment cleanups' reading and deleting under way. Any
  // thread but the service serial queue.
  void waitUntilFragmentCleanupsAreFinishedForTesting() {
    _fragmentCleanupOperationQueue->waitUntilAllOperationsAreFinished();
  }
  // How many connections hold the recording's fragment cleanup off.
  std::size_t orphanedFragmentCleanupHoldCount(const platform::URL& url) const;

  // The debug signal: dump the open sessions on the main queue.
  void _handleDebugSignal();

  platform::SerialQueue& serviceSerialQueue() { return _serviceSerialQueue; }
  AssetAccessSessionController& assetSessionController() { return *_assetSesionController; }
  std::shared_ptr<platform::Listener> listener() const { return _xpcListener; }
  std::string description() const;

 private:
  struct PassKey {};

 public:
  explicit SavedRecordingService(PassKey);

 private:
  static std::shared_ptr<SavedRecordingService> _makeService(bool watchDebugSignal);
  void _init(bool watchDebugSignal);
  void _setupSignalHandler();
  void _tearDownSignalHandler();
  void _logMissingParameter(
      const char* parameter, const char* selector,
      const std::shared_ptr<platform::Connection>& xpcConnection = rcs_currentConnection());
  // A prepare request's arrival line and required-parameter checks. True
  // when the request may go on; otherwise it was answered or dropped.
  bool _checkPrepareRequest(const char* selector, const char* kind,
                            const std::optional<platform::URL>& url, AccessRequestHandler& handler,
                            const std::shared_ptr<platform::Connection>& xpcConnection);
  // The capture, preview and trimming requests: entry checks here, the open
  // step on the service serial queue with the calling connection.
  void _prepareAccessSession(const char* selector, const char* kind, const char* sessionName,
                             bool exclusive, std::optional<platform::URL> compositionAVURL,
                             AccessRequestHandler accessRequestHandler,
                             std::shared_ptr<platform::Connection> xpcConnection);

  void _onServiceQueueRunDeferredAccessRequest(const std::string& name,
                                               const platform::URL& compositionAVURL,
                                               bool exclusive,
                                               std::shared_ptr<platform::Connection> xpcConnection,
                                               AccessSessionHandler accessSessionHandler,
                                               bool cancelled);
  // The close's final step; answers as the deferred-work step above.
  bool _onQueueFinishClosingAccessSession(const std::shared_ptr<AssetAccessSession>& session);
  // True (and logged) when `xpcConnection` is a client's that has ended.
  bool _onServiceQueueConnectionHasEnded(
      const std::string& name, const platform::URL& compositionAVURL,
      const std::shared_ptr<platform::Connection>& xpcConnection);
  // After a capture or trimming session closed normally: a recording left
  // with fragments not yet composed gets a deferred finalization.
  void _onQueueScheduleFinalizationAfterEditing(const std::shared_ptr<AssetAccessSession>& session);
  // The fragment cleanup's decision, on the service serial queue; the
  // reading and deleting, when there is any, run on
  // _fragmentCleanupOperationQueue, and `completion` comes back here.
  void _onQueueCleanUpOrphanedFragments(const platform::URL& compositionAVURL,
                                        std::shared_ptr<AssetAccessSession> ignored,
                                        WorkBlock completion);
  void _onQueueFinishFragmentCleanup(const std::string& bundle, WorkBlock completion);
  // What waits for the running fragment cleanup of `bundle` (a standardized
  // composed path), to run in order when it ends; nullptr when none runs.
  std::vector<WorkBlock>* _onQueueWorkWaitingForFragmentCleanup(const std::string& bundle);
  // The work that waited for a session of the recording to close: its
  // deferred access request, else its waiting finalization. True when it
  // started the waiting finalization.
  bool _onServiceQueueRunDeferredWorkForCompositionAVURL(const platform::URL& compositionAVURL);

  // In declaration order, as the service's state is documented.
  // Made by the constructor, then only used:
  platform::SerialQueue _serialQueue;
  platform::SerialQueue _serviceSerialQueue;
  // Service serial queue only:
  bool _isOrphanHandlingEnabled = true;
  // Main thread (start, teardown):
  std::shared_ptr<platform::Listener> _xpcListener;
  // Service serial queue only:
  std::vector<std::shared_ptr<AssetAccessSession>> _closingSessions;
  std::vector<platform::URL> _compositionAVURLsToFinalize;
  std::unordered_map<platform::URL, DeferredAccessRequest>
      _compositionAVURLsDeferredAccessRequestBlocksByAVURL;
  // Recordings whose AccessSessionsChanged is due at the end of this turn.
  std::unordered_set<platform::URL> _accessSessionsChangedCompositionAVURLs;
  // Counted set: recording -> number of connections holding its cleanup off.
  std::unordered_map<platform::URL, std::size_t> _disabledOrphanedFragmentCleanupByCompositionAVURL;
  // A fragment cleanup that reads or deletes, by its recording's bundle
  // path: cleanups of one recording run one at a time, and what waits for
  // the running one goes on in order when it ends.
  struct FragmentCleanup {
    platform::URL compositionAVURL;
    std::vector<WorkBlock> waiting;
  };
  std::unordered_map<std::string, FragmentCleanup> _fragmentCleanupsInProgress;
  // Made by _init; its open and close on the service serial queue only:
  std::unique_ptr<AssetAccessSessionController> _assetSesionController;
  std::unique_ptr<platform::SignalSource> _signalDispatchSource;
  std::shared_ptr<AssetExportController> _assetExportController;
  // The cleanups' reading and deleting; at most two at once.
  std::unique_ptr<platform::OperationQueue> _fragmentCleanupOperationQueue;
  // Inside _serialQueue only:
  std::unordered_set<platform::URL> _compositionAVURLsBeingExported;

  ListenerFactory _listenerFactory;
};

}  // namespace quorvel
