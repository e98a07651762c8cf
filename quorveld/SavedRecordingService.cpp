// The service object: creation, start-up and the debug signal.
//
// Start-up timeline with no client: at 0 s the root transaction begins (the
// first keep-alive creates the transaction controller) and the listener is
// live; at about 1 s the first orphan-handling pass runs on the service serial
// queue, and its keep-alive ends when it finishes; the pass's dispatch
// transaction ends 1 s after that; the start-up keep-alive ends at 2 s. The
// root transaction, and with it the process's reason to stay, ends with the
// last of these.
#include "quorveld/SavedRecordingService.h"
#include "quorveld/SavedRecordingService.BusEdge.h"

#include <fmt/format.h>

#include <chrono>
#include <csignal>
#include <mutex>

#include "Models/RCSavedRecordingsModel+RCSOrphanHandling.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "platform/GlobalQueue.h"
#include "platform/Log.h"
#include "platform/MainQueue.h"
#include "platform/NotificationCenter.h"
#include "platform/dbus/BusListener.h"
#include "quorveld/RCSXPCTransaction.h"

namespace quorvel {

namespace {
constexpr auto kOneSecond = std::chrono::nanoseconds(1'000'000'000);
}  // namespace

SavedRecordingService::SavedRecordingService(PassKey)
    : _serialQueue(fmt::format("{}.SavedRecordingService.InstanceSerialQueue",
                               RCSSavedRecordingServiceBundleIdentifier)),
      _serviceSerialQueue(fmt::format("{}.SavedRecordingService.OperationSerialQueue",
                                      RCSSavedRecordingServiceBundleIdentifier)),
      _listenerFactory(
          [](const std::string& serviceName, platform::InterfaceDescription interface) {
            return std::make_shared<platform::BusListener>(
                platform::BusListenerOptions{.busAddress = {},
                                             .serviceName = serviceName,
                                             .objectPath = RCSSavedRecordingServiceObjectPath},
                std::move(interface));
          }) {}

std::shared_ptr<SavedRecordingService> SavedRecordingService::_makeService(bool watchDebugSignal) {
  auto service = std::make_shared<SavedRecordingService>(PassKey{});
  service->_init(watchDebugSignal);
  return service;
}

std::shared_ptr<SavedRecordingService> SavedRecordingService::sharedInstance() {
  static std::shared_ptr<SavedRecordingService>* shared =
      new std::shared_ptr<SavedRecordingService>(_makeService(true));
  return *shared;
}

std::shared_ptr<SavedRecordingService> SavedRecordingService::init() {
  throw GenericException("-init is invalid. Use +sharedInstance instead.");
}

std::shared_ptr<SavedRecordingService> SavedRecordingService::makeForTesting() {
  return _makeService(true);
}

std::shared_ptr<SavedRecordingService> SavedRecordingService::makeForTesting(
    TestingOptions options) {
  return _makeService(options.watchDebugSignal);
}

void SavedRecordingService::_init(bool watchDebugSignal) {
  // The queues were made by the constructor, the instance queue first.
  _assetSesionController = std::make_unique<AssetAccessSessionController>();
  _assetExportController = std::make_shared<AssetExportController>();
  _fragmentCleanupOperationQueue = std::make_unique<platform::OperationQueue>();
  _fragmentCleanupOperationQueue->setMaxConcurrentOperationCount(2);
  _isOrphanHandlingEnabled = true;
  if (watchDebugSignal) _setupSignalHandler();
}

SavedRecordingService::~SavedRecordingService() {
  _tearDownSignalHandler();
  if (_xpcListener) {
    _xpcListener->stop();
    _xpcListener->setDelegate(nullptr);
    _xpcListener.reset();
  }
}

std::string SavedRecordingService::description() const {
  return fmt::format("<SavedRecordingService {}>", static_cast<const void*>(this));
}

void SavedRecordingService::setListenerFactory(ListenerFactory factory) {
  _listenerFactory = std::move(factory);
}

platform::Status SavedRecordingService::start() {
  auto startupKeepAlive =
      RCSXPCTransaction::initWithName("Keep-alive for SavedRecordingService initialization");
  startupKeepAlive->beginTransaction();
  startupKeepAlive->endTransactionOnDate(platform::Date::dateWithTimeIntervalSinceNow(2.0));

  // Launch events are signals on the bus; the exported interface subscribes
  // to them (see SavedRecordingServiceBusEdge) and they reach
  // _handleLaunchEvent on the main queue.

  auto orphanKeepAlive = RCSXPCTransaction::initWithName("Keep-alive for orphan handling");
  orphanKeepAlive->beginTransaction();
  platform::mainQueue().after(kOneSecond, [self = shared_from_this(), orphanKeepAlive] {
    self->_performOnServiceQueue(
        [self, orphanKeepAlive] {
          self->_onQueuePerformOrphanHandlingIfEnabled();
          orphanKeepAlive->endTransaction();
        },
        WorkLength::MayBlock);
  });

  if (_xpcListener) return {};
  _xpcListener = _listenerFactory(RCSSavedRecordingServiceMachServiceName,
                                  SavedRecordingServiceBusEdge::interfaceFor(weak_from_this()));
  _xpcListener->setDelegate(this);
  QV_LOG(platform::kLogLevelNotice, "Starting service '{}'",
         RCSSavedRecordingServiceMachServiceName);
  auto resumed = _xpcListener->resume();
  if (!resumed) {
    // A listener that failed to start never starts later: drop it so the
    // next start() tries with a new one.
    _xpcListener->setDelegate(nullptr);
    _xpcListener.reset();
  }
  return resumed;
}

void SavedRecordingService::_handleLaunchEvent(const std::optional<std::string>& name) {
  if (!name) {
    QV_LOG(platform::kLogLevelError, "Ignoring a launch event without a name");
    return;
  }
  QV_LOG(platform::kLogLevelDebug, "Posting launch event '{}'", *name);
  platform::NotificationCenter::defaultCenter().postNotificationName(*name);
}

void SavedRecordingService::_setupSignalHandler() {
  // SIGUSR1 is blocked in every thread (main() blocks it before any thread
  // starts), so it no longer ends the process and only this source sees it.
  _signalDispatchSource = std::make_unique<platform::SignalSource>(
      SIGUSR1,
      [weak = weak_from_this()] {
        if (auto service = weak.lock()) service->_handleDebugSignal();
      },
      platform::globalQueue());
}

void SavedRecordingService::_tearDownSignalHandler() {
  if (_signalDispatchSource) _signalDispatchSource->cancel();
}

void SavedRecordingService::_handleDebugSignal() {
  platform::mainQueue().async(
      [self = shared_from_this()] { self->_assetSesionController->dumpState(); });
}

void SavedRecordingService::_onQueuePerformOrphanHandlingIfEnabled() {
  QV_DCHECK_ON_QUEUE(_serviceSerialQueue);
  if (!_isOrphanHandlingEnabled) {
    QV_LOG(
        platform::kLogLevelNotice,
        "[Orphan-Recovery] Skipping orphan handling because it is temporarily disabled for sync");
    return;
  }
  auto model = RCSavedRecordingsModel::sharedModelForQueue(_serviceSerialQueue);
  if (!model) {
    QV_LOG(platform::kLogLevelError,
           "[Orphan-Recovery] Skipping orphan handling: the recordings database cannot be used: {}",
           model.error());
    return;
  }
  RCSOrphanHandling(**model).performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs(
      _onQueue_composedAVURLsWithActiveSessionsOrScheduledWork());
}

}  // namespace quorvel
