// The root transaction.
//
// The list of active transactions runs through the transactions, which the
// controller never owns. Two traps shape the removal path:
//  - A transaction ends itself in its destructor. Its links are still valid
//    there, so it is taken out of the list like any other, by address.
//  - A controller block may hold the last reference to a transaction (for
//    instance while collecting activeTransactions()). If that reference dies
//    on the controller's queue, the destructor must not sync onto the queue it
//    is already on: it is that queue's running block, and unlinks at once.
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
    // Beginning an active transaction logs again and leaves it where it is.
    if (transaction._listed.load(std::memory_order_relaxed)) return;
    transaction._previousActive = _openTransactions.last;
    transaction._nextActive = nullptr;
    (_openTransactions.last ? _openTransactions.last->_nextActive : _openTransactions.first) =
        &transaction;
    _openTransactions.last = &transaction;
    transaction._listed.store(true, std::memory_order_release);
    _onQueueUpdateInternalTransactionState();
  });
}

void RCSXPCTransactionController::removeActiveTransaction(const RCSXPCTransaction& transaction) {
  // Only a destructor can end a transaction from the controller's own queue
  // (see above); it is that queue's running block and cannot wait for a turn.
  if (_serialQueue.isCurrent()) return _onQueueRemove(transaction);
  _serialQueue.sync([&] { _onQueueRemove(transaction); });
}

void RCSXPCTransactionController::_onQueueRemove(const RCSXPCTransaction& transaction) {
  QV_DCHECK_ON_QUEUE(_serialQueue);
  if (!transaction._listed.load(std::memory_order_relaxed)) return;
  (transaction._previousActive ? transaction._previousActive->_nextActive
                               : _openTransactions.first) = transaction._nextActive;
  (transaction._nextActive ? transaction._nextActive->_previousActive : _openTransactions.last) =
      transaction._previousActive;
  QV_LOG(platform::kLogLevelDebug, "Deactivating XPC transaction: {}", transaction.description());
  transaction._previousActive = transaction._nextActive = nullptr;
  transaction._listed.store(false, std::memory_order_release);
  _onQueueUpdateInternalTransactionState();
}

bool RCSXPCTransactionController::isTransactionActive(const RCSXPCTransaction& transaction) {
  bool active = false;
  _serialQueue.sync([&] { active = transaction._listed.load(std::memory_order_relaxed); });
  return active;
}

std::vector<std::shared_ptr<RCSXPCTransaction>> RCSXPCTransactionController::activeTransactions() {
  std::vector<std::shared_ptr<RCSXPCTransaction>> transactions;
  _serialQueue.sync([&] {
    for (RCSXPCTransaction* transaction = _openTransactions.first; transaction;
         transaction = transaction->_nextActive) {
      // Empty for one whose destructor waits for this block to end it.
      if (auto strong = transaction->weak_from_this().lock()) {
        transactions.push_back(std::move(strong));
      }
    }
  });
  return transactions;
}

void RCSXPCTransactionController::_onQueueUpdateInternalTransactionState() {
  QV_DCHECK_ON_QUEUE(_serialQueue);
  const bool empty = _openTransactions.first == nullptr;
  if (_inTransaction && empty) {
    platform::ProcessLifetime::instance().endTransaction();
    _inTransaction = false;
    QV_LOG(platform::kLogLevelDebug, "No XPC transactions remain. Ending root XPC transaction.");
  } else if (!_inTransaction && !empty) {
    platform::ProcessLifetime::instance().beginTransaction();
    _inTransaction = true;
    QV_LOG(platform::kLogLevelDebug, "Root XPC transaction began.");
  }
}

}  // namespace quorvel
