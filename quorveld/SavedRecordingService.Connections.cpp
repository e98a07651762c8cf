// Client connections: accepting them, noticing their end, delivering their
// calls, and the one way from a connection's delivery thread onto the service
// serial queue.
#include <fmt/format.h>

#include <chrono>

#include "platform/Log.h"
#include "platform/MainQueue.h"
#include "quorveld/RCSAdditions.h"
#include "quorveld/RCSXPCTransaction.h"
#include "quorveld/SavedRecordingService.h"

namespace quorvel {

namespace {

constexpr auto kDispatchTransactionLinger = std::chrono::nanoseconds(1'000'000'000);

std::string describe(const std::shared_ptr<platform::Connection>& connection) {
  return connection ? connection->description() : std::string("(null)");
}

}  // namespace

bool SavedRecordingService::shouldAcceptNewConnection(
    platform::Listener&, std::shared_ptr<platform::Connection> newConnection) {
  // The listener publishes the service interface with the service behind
  // every method, so the exported object and interfaces need no setting
  // per connection; every call of this peer reaches its method's handler
  // in SavedRecordingServiceBusEdge.
  rcs_setValid(*newConnection, true);

  std::weak_ptr<platform::Connection> weakConnection = newConnection;
  std::weak_ptr<SavedRecordingService> weakService = weak_from_this();
  auto ended = [weakConnection, weakService](const char* format) {
    auto connection = weakConnection.lock();
    QV_LOG(platform::kLogLevelError, fmt::runtime(format), describe(connection));
    auto service = weakService.lock();
    if (service && connection) service->_handleXPCDisconnect(connection);
  };
  newConnection->setInvalidationHandler([ended] { ended("Connection invalidated: {}"); });
  newConnection->setInterruptionHandler([ended] { ended("Connection interrupted: {}"); });

  QV_LOG(platform::kLogLevelNotice, "Listener accepted new connection {}",
         newConnection->description());
  newConnection->resume();
  return true;
}

void SavedRecordingService::listenerDidLoseBus(platform::Listener&) {
  QV_LOG(platform::kLogLevelError, "Lost the connection to the bus");
}

void SavedRecordingService::_performOnServiceQueue(WorkBlock block, WorkLength length) {
  auto transaction = RCSXPCTransaction::initWithName("Dispatch to service queue");
  transaction->beginTransaction();
  auto task = [block = std::move(block), transaction]() mutable {
    block();
    // Owns the transaction until the end runs, one second after the block.
    platform::mainQueue().after(kDispatchTransactionLinger,
                                [transaction] { transaction->endTransaction(); });
  };
  if (length == WorkLength::Short) {
    _serviceSerialQueue.async(std::move(task));
  } else {
    _serviceSerialQueue.asyncOnWorker(std::move(task));
  }
}

}  // namespace quorvel
