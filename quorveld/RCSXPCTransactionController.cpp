// The root transaction.
//
// The table maps identifiers to transactions without owning them. Two traps
// shape the removal path:
//  - A transaction ends itself in its destructor. By then its weak_ptr in the
//    table already reads empty, so removal looks up the identifier alone and
//    never asks whether the transaction still exists.
//  - A controller block may hold the last reference to a transaction (for
//    instance while collecting activeTransactions()). If that reference dies
//    on the controller's queue, the destructor must not sync onto the queue it
//    is already on: the removal is queued behind the running block instead.
#define QV_LOG_TAG "RCSXPCTransaction"
#include "quorveld/RCSXPCTransactionController.h"

#include "platform/Log.h"
#include "platform/ProcessLifetime.h"
#include "quorveld/RCSXPCTransaction.h"

namespace quorvel {

RCSXPCTransactionController& RCSXPCTransactionController::sharedInstance() {
  static RCSXPCTransactionController* controller = new RCSXPCTransactionController();
  return *controller;
}

RCSXPCTransactionController::RCSXPCTransactionController()
    : _serialQueue("RCSXPCTransactionController") {
  platform::ProcessLifetime::instance().enableTransactions();
}

void RCSXPCTransactionController::addActiveTransaction(RCSXPCTransaction& transaction) {
  _serialQueue.sync([&] {
    QV_LOG(platform::kLogLevelDebug, "Activating XPC transaction: {}", transaction.description());
    _openTransactions.insertOrAssign(transaction._identifier(), transaction.weak_from_this());
    transaction._listed.store(true, std::memory_order_release);
    _onQueueUpdateInternalTransactionState();
  });
}

void RCSXPCTransactionController::removeActiveTransaction(const RCSXPCTransaction& transaction) {
  // A live transaction is never ended from the controller's own queue (only
  // a destructor can run there), so this can always wait for its turn.
  _serialQueue.sync([&] { _onQueueRemove(transaction._identifier(), &transaction, {}); });
}

void RCSXPCTransactionController::removeActiveTransactionWithIdentifier(
    const platform::UUID& identifier, const std::string& description) {
  if (_serialQueue.isCurrent()) {
    _serialQueue.async(
        [this, identifier, description] { _onQueueRemove(identifier, nullptr, description); });
    return;
  }
  _serialQueue.sync([&] { _onQueueRemove(identifier, nullptr, description); });
}

void RCSXPCTransactionController::_onQueueRemove(const platform::UUID& identifier,
                                                 const RCSXPCTransaction* transaction,
                                                 std::string_view description) {
  QV_DCHECK_ON_QUEUE(_serialQueue);
  if (!_openTransactions.erase(identifier)) return;
  QV_LOG(platform::kLogLevelDebug, "Deactivating XPC transaction: {}",
         transaction ? transaction->description() : std::string(description));
  if (transaction) transaction->_listed.store(false, std::memory_order_release);
  _onQueueUpdateInternalTransactionState();
}

bool RCSXPCTransactionController::isTransactionActive(const RCSXPCTransaction& transaction) {
  bool active = false;
  _serialQueue.sync([&] { active = _openTransactions.contains(transaction._identifier()); });
  return active;
}

std::vector<std::shared_ptr<RCSXPCTransaction>> RCSXPCTransactionController::activeTransactions() {
  std::vector<std::shared_ptr<RCSXPCTransaction>> transactions;
  _serialQueue.sync([&] {
    _openTransactions.forEach([&](const platform::UUID&, const auto& weak) {
      if (auto transaction = weak.lock()) transactions.push_back(std::move(transaction));
    });
  });
  return transactions;
}

void RCSXPCTransactionController::_onQueueUpdateInternalTransactionState() {
  QV_DCHECK_ON_QUEUE(_serialQueue);
  if (_inTransaction && _openTransactions.empty()) {
    platform::ProcessLifetime::instance().endTransaction();
    _inTransaction = false;
    QV_LOG(platform::kLogLevelDebug, "No XPC transactions remain. Ending root XPC transaction.");
  } else if (!_inTransaction && !_openTransactions.empty()) {
    platform::ProcessLifetime::instance().beginTransaction();
    _inTransaction = true;
    QV_LOG(platform::kLogLevelDebug, "Root XPC transaction began.");
  }
}

}  // namespace quorvel
