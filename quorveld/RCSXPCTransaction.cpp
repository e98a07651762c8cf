// Keep-alive transactions.
//
// A transaction is a name and a random identifier; whether it is active is
// the controller's business (its list). Destruction ends an active
// transaction (see RCSXPCTransactionController).
#include "quorveld/RCSXPCTransaction.h"

#include <fmt/format.h>

#include <chrono>
#include <cstdint>

#include "platform/MainQueue.h"
#include "quorveld/RCSXPCTransactionController.h"

namespace quorvel {

std::shared_ptr<RCSXPCTransaction> RCSXPCTransaction::initWithName(std::string name) {
  // One allocation for the transaction and its count: every queued request
  // makes one.
  struct Constructible : RCSXPCTransaction {
    explicit Constructible(std::string name) : RCSXPCTransaction(std::move(name)) {}
  };
  return std::make_shared<Constructible>(std::move(name));
}

RCSXPCTransaction::RCSXPCTransaction(std::string name)
    : _uuid(platform::UUID::random()), _name(std::move(name)) {}

RCSXPCTransaction::~RCSXPCTransaction() {
  // Nothing can begin a transaction that is being destroyed, so one that the
  // list no longer holds has nothing left to end.
  if (!_listed.load(std::memory_order_acquire)) return;
  RCSXPCTransactionController::sharedInstance().removeActiveTransaction(*this);
}

void RCSXPCTransaction::beginTransaction() {
  RCSXPCTransactionController::sharedInstance().addActiveTransaction(*this);
}

void RCSXPCTransaction::endTransaction() {
  RCSXPCTransactionController::sharedInstance().removeActiveTransaction(*this);
}

void RCSXPCTransaction::endTransactionOnDate(const platform::Date& date) {
  // Seconds to nanoseconds, truncated toward zero; a date in the past gives
  // a deadline that has passed, which runs at the next turn of the queue.
  auto nanoseconds = static_cast<std::int64_t>(date.timeIntervalSinceNow() * 1'000'000'000.0);
  platform::Duration delay{nanoseconds < 0 ? 0 : nanoseconds};
  platform::mainQueue().after(delay, [self = shared_from_this()] {
    RCSXPCTransactionController::sharedInstance().removeActiveTransaction(*self);
  });
}

bool RCSXPCTransaction::isActive() const {
  return RCSXPCTransactionController::sharedInstance().isTransactionActive(*this);
}

std::vector<std::shared_ptr<RCSXPCTransaction>> RCSXPCTransaction::activeTransactions() {
  return RCSXPCTransactionController::sharedInstance().activeTransactions();
}

std::string RCSXPCTransaction::description() const {
  return fmt::format("<RCSXPCTransaction {}, name = \"{}\">", static_cast<const void*>(this),
                     _name);
}

}  // namespace quorvel
