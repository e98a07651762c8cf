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
//   SavedRecordingService.Invocation.cpp   turning bus calls into requests
//
// Threads: the request methods and the listener-delegate methods run on the
// listener's delivery thread (the bus thread); they only check arguments and
// hand work to _performOnServiceQueue(). Every _onQueue… / _onServiceQueue…
// member must be called on the service serial queue, and every field below
// is touched only there, except _compositionAVURLsBeingExported (inside
// _serialQueue) and the queues and listener themselves.
#pragma once

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
#include "platform/SerialQueue.h"
#include "platform/SignalSource.h"
#include "platform/URL.h"
#include "platform/dbus/Listener.h"
#include "quorveld/AssetAccessSessionController.h"

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
  // Delivery of one call: decode it and invoke the request it names.
  void connectionHandleInvocation(const std::shared_ptr<platform::Connection>& connection,
                                  platform::IncomingCall invocation);

  // The ten requests (delivery thread). An empty handler is a call that
  // expects no reply; an empty URL or token is a missing one.
  void prepareToCaptureToCompositionAVURL(std::optional<platform::URL> compositionAVURL,
                                          AccessRequestHandler accessRequestHandler);
  void prepareToPreviewCompositionAVURL(std::optional<platform::URL> compositionAVURL,
                                        AccessRequestHandler accessRequestHandler);
  void prepareToExportCompositionAVURL(std::optional<platform::URL> compositionAVURL,
                                       bool cacheWaveform,
                                       AccessRequestHandler accessRequestHandler);
  void prepareToTrimCompositionAVURL(std::optional<platform::URL> compositionAVURL,
                                     AccessRequestHandler accessRequestHandler);
  void endAccessSessionWithToken(std::optional<RCSSavedRecordingAccessToken> accessToken);
  void disableOrphanedFragmentCleanupForCompositionAVURL(
      std::optional<platform::URL> compositionAVURL, CompletionHandler completionBlock);
  void enableOrphanedFragmentCleanupForCompositionAVURL(
      std::optional<platform::URL> compositionAVURL);
  void disableOrphanHandlingWithCompletionBlock(CompletionHandler completionBlock);
  void enableOrphanHandlingWithCompletionBlock(CompletionHandler completionBlock);
  void fetchExportingCompositionAVURLs(URLSetHandler reply);

  // Runs `block` later on the service serial queue, under the keep-alive
  // "Dispatch to service queue" that ends one second after the block ran.
  // Returns at once. Any thread.
  void _performOnServiceQueue(WorkBlock block);
  // The connection has ended: on the service serial queue, mark it invalid
  // and release what the daemon held for it. Returns at once. Any thread.
  void _handleXPCDisconnect(const std::shared_ptr<platform::Connection>& connection);
  // One orphan-handling pass. Must be called on the service serial queue.
  void _onQueuePerformOrphanHandlingIfEnabled();

  // The debug signal: dump the open sessions on the main queue.
  void _handleDebugSignal();

  platform::SerialQueue& serviceSerialQueue() { return _serviceSerialQueue; }
  platform::SerialQueue& instanceSerialQueue() { return _serialQueue; }
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
  void _logMissingParameter(const char* parameter, const char* selector);
  // A prepare request's arrival line and required-parameter checks. True
  // when the request may go on; otherwise it was answered or dropped.
  bool _checkPrepareRequest(const char* selector, const char* kind,
                            const std::optional<platform::URL>& url, AccessRequestHandler& handler);
  // The service interface with each method routed to
  // connectionHandleInvocation().
  platform::InterfaceDescription _exportedInterface();

  // In declaration order, as the service's state is documented.
  platform::SerialQueue _serialQueue;
  platform::SerialQueue _serviceSerialQueue;
  bool _isOrphanHandlingEnabled = true;
  std::shared_ptr<platform::Listener> _xpcListener;
  std::vector<platform::URL> _compositionAVURLsToFinalize;
  std::unordered_map<platform::URL, std::move_only_function<void(bool cancelled)>>
      _compositionAVURLsDeferredAccessRequestBlocksByAVURL;
  // Counted set: recording -> number of holds.
  std::unordered_map<platform::URL, std::size_t> _disabledOrphanedFragmentCleanupByCompositionAVURL;
  std::unique_ptr<AssetAccessSessionController> _assetSesionController;
  std::unique_ptr<platform::SignalSource> _signalDispatchSource;
  std::unordered_set<platform::URL> _compositionAVURLsBeingExported;

  ListenerFactory _listenerFactory;
};

}  // namespace quorvel
