// RCSXPCTransactionController: folds the named keep-alive transactions into
// the process's one root transaction. The root is begun when the first
// transaction becomes active and ended when the last one ends.
//
// A process-wide singleton, created by the first sharedInstance() call and
// never destroyed. Every member may be called from any thread: each runs its
// whole body synchronously on the controller's private serial queue
// ("RCSXPCTransactionController"), except isInTransaction(), which reads the
// flag without it.
#pragma once

#include <atomic>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/SerialQueue.h"
#include "platform/UUID.h"
#include "platform/UUIDTable.h"

namespace quorvel {

class RCSXPCTransaction;

class RCSXPCTransactionController {
 public:
  static RCSXPCTransactionController& sharedInstance();

  void addActiveTransaction(RCSXPCTransaction& transaction);
  void removeActiveTransaction(const RCSXPCTransaction& transaction);
  bool isTransactionActive(const RCSXPCTransaction& transaction);
  // A new array each time; the array owns its elements.
  std::vector<std::shared_ptr<RCSXPCTransaction>> activeTransactions();
  bool isInTransaction() const { return _inTransaction.load(std::memory_order_relaxed); }

 private:
  friend class RCSXPCTransaction;
  RCSXPCTransactionController();

  // Removal by identifier: a transaction being destroyed can no longer be
  // referred to, but its entry must still go.
  void removeActiveTransactionWithIdentifier(const platform::UUID& identifier,
                                             const std::string& description);
  // Controller queue only (checked in debug builds): the bodies of removal
  // and of every change to the table, which begin or end the root.
  // `transaction`, when it is still alive, is told it left the table and
  // describes itself in the log line; else `description` does.
  void _onQueueRemove(const platform::UUID& identifier, const RCSXPCTransaction* transaction,
                      std::string_view description);
  void _onQueueUpdateInternalTransactionState();

  // Any thread.
  platform::SerialQueue _serialQueue;

  // Controller queue only:
  // Identifier -> transaction, never owning it. A busy daemon keeps tens of
  // thousands here (every queued request's keep-alive lives a second after
  // its work), so the table is a flat one.
  platform::UUIDTable<std::weak_ptr<RCSXPCTransaction>> _openTransactions;

  // Written on the controller queue, read from any thread.
  std::atomic<bool> _inTransaction{false};
};

}  // namespace quorvel
