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
  RCSXPCTransactionController();

  // Controller queue only (checked in debug builds): the body of removal,
  // and the change of the root after every change to the list.
  void _onQueueRemove(const RCSXPCTransaction& transaction);
  void _onQueueUpdateInternalTransactionState();

  // Any thread.
  platform::SerialQueue _serialQueue;

  // Controller queue only:
  // The active transactions, oldest first, linked through the transactions
  // themselves and never owned. A busy daemon keeps a hundred thousand here
  // (every queued request's keep-alive lives a second after its work), and
  // a link costs no allocation, no hashing and no growing table: adding and
  // removing touch only the transaction and its neighbours.
  struct OpenTransactions {
    RCSXPCTransaction* first = nullptr;
    RCSXPCTransaction* last = nullptr;
  } _openTransactions;

  // Written on the controller queue, read from any thread.
  std::atomic<bool> _inTransaction{false};
};

}  // namespace quorvel
