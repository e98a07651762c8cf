// RCSXPCTransaction: a named keep-alive. While any transaction is active the
// process holds its root transaction and is not ended for idleness.
//
// Owned by whoever keeps the work alive (the service's start-up, a queued
// request, an access session, a scheduled end) through std::shared_ptr; the
// controller refers to it without owning it. Destroying an active
// transaction ends it. Every member may be called from any thread.
#pragma once

#include <atomic>
#include <memory>
#include <string>
#include <vector>

#include "platform/Date.h"
#include "platform/UUID.h"

namespace quorvel {

class RCSXPCTransaction : public std::enable_shared_from_this<RCSXPCTransaction> {
 public:
  // A new, inactive transaction. There is no unnamed transaction: the
  // default constructor does not exist.
  static std::shared_ptr<RCSXPCTransaction> initWithName(std::string name);
  RCSXPCTransaction() = delete;
  ~RCSXPCTransaction();
  RCSXPCTransaction(const RCSXPCTransaction&) = delete;
  RCSXPCTransaction& operator=(const RCSXPCTransaction&) = delete;

  // Makes the transaction active (again); beginning an active one is harmless.
  void beginTransaction();
  // Makes it inactive; a no-op when it is not active.
  void endTransaction();
  // Ends the transaction on the main queue at `date` (at the next turn of
  // the main queue when the date has passed). Cannot be cancelled; keeps the
  // transaction alive until then, and ends it even if it was begun again.
  void endTransactionOnDate(const platform::Date& date);

  bool isActive() const;
  // Every transaction the controller still refers to.
  static std::vector<std::shared_ptr<RCSXPCTransaction>> activeTransactions();

  const std::string& name() const { return _name; }
  const platform::UUID& _identifier() const { return _uuid; }
  // <RCSXPCTransaction 0x…, name = "…">
  std::string description() const;

 private:
  explicit RCSXPCTransaction(std::string name);

  friend class RCSXPCTransactionController;

  platform::UUID _uuid;
  std::string _name;
  // Whether the controller's list of active transactions holds this one.
  // Written only on the controller's queue; read by the destructor, which
  // skips the controller altogether for a transaction that was already ended.
  mutable std::atomic<bool> _listed{false};
  // The links of that list, which runs through the transactions themselves:
  // the controller's bookkeeping, not the transaction's state. Controller
  // queue only.
  mutable RCSXPCTransaction* _previousActive = nullptr;
  mutable RCSXPCTransaction* _nextActive = nullptr;
};

}  // namespace quorvel
