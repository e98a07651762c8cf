#include "platform/dbus/Connection.h"

#include <fmt/format.h>

#include <deque>
#include <utility>

#include "platform/dbus/IncomingCall.h"

namespace platform {
namespace {

// The connection whose call this thread is delivering.
thread_local Connection* tCurrentConnection = nullptr;

class CurrentConnectionScope {
 public:
  explicit CurrentConnectionScope(Connection* connection) : previous_(tCurrentConnection) {
    tCurrentConnection = connection;
  }
  ~CurrentConnectionScope() { tCurrentConnection = previous_; }
  CurrentConnectionScope(const CurrentConnectionScope&) = delete;
  CurrentConnectionScope& operator=(const CurrentConnectionScope&) = delete;

 private:
  Connection* previous_;
};

}  // namespace

struct Connection::Pending {
  std::deque<std::pair<IncomingCall, MethodHandler>> calls;
};

Connection::Connection(std::string uniqueName)
    : uniqueName_(std::move(uniqueName)), pending_(std::make_unique<Pending>()) {}

Connection::~Connection() = default;

std::shared_ptr<Connection> Connection::createForListener(std::string uniqueName) {
  return std::shared_ptr<Connection>(new Connection(std::move(uniqueName)));
}

std::string Connection::description() const { return fmt::format("<connection {}>", uniqueName_); }

void Connection::setUserInfo(const std::string& key, std::any value) {
  std::lock_guard lock(mutex_);
  if (!value.has_value()) {
    if (userInfo_) userInfo_->erase(key);
    return;
  }
  if (!userInfo_) userInfo_ = std::make_unique<std::map<std::string, std::any>>();
  (*userInfo_)[key] = std::move(value);
}

std::any Connection::userInfo(const std::string& key) const {
  std::lock_guard lock(mutex_);
  if (!userInfo_) return {};
  auto it = userInfo_->find(key);
  return it == userInfo_->end() ? std::any() : it->second;
}

bool Connection::hasUserInfoDictionary() const {
  std::lock_guard lock(mutex_);
  return userInfo_ != nullptr;
}

void Connection::setInvalidationHandler(Handler handler) {
  std::lock_guard lock(mutex_);
  if (!hasEnded()) invalidationHandler_ = std::move(handler);
}

void Connection::setInterruptionHandler(Handler handler) {
  std::lock_guard lock(mutex_);
  if (!hasEnded()) interruptionHandler_ = std::move(handler);
}

void Connection::resume() {
  // The queued calls are delivered one at a time without holding
  // deliveryMutex_: a handler that answers at once takes the bus library's
  // lock, which the delivery thread holds while it waits for deliveryMutex_
  // to hand over the next call. Calls that arrive meanwhile join the queue
  // (draining_), so they still come in order and one at a time.
  {
    std::lock_guard lock(deliveryMutex_);
    if (resumed_.exchange(true)) return;
    draining_ = true;
  }
  for (;;) {
    std::pair<IncomingCall, MethodHandler> next;
    {
      std::lock_guard lock(deliveryMutex_);
      if (pending_->calls.empty()) {
        draining_ = false;
        return;
      }
      next = std::move(pending_->calls.front());
      pending_->calls.pop_front();
    }
    deliver(std::move(next.first), next.second);
  }
}

bool Connection::isResumed() const { return resumed_.load(std::memory_order_acquire); }

std::optional<PeerCredentials> Connection::credentials() const {
  std::lock_guard lock(mutex_);
  return credentials_;
}

void Connection::setCredentials(PeerCredentials credentials) {
  std::lock_guard lock(mutex_);
  credentials_ = std::move(credentials);
}

std::shared_ptr<Connection> Connection::current() {
  return tCurrentConnection ? tCurrentConnection->shared_from_this() : nullptr;
}

void Connection::deliverOrQueue(IncomingCall call, MethodHandler handler) {
  std::lock_guard lock(deliveryMutex_);
  if (hasEnded()) return;  // the call answers its caller as dropped
  if (!resumed_ || draining_) {
    pending_->calls.emplace_back(std::move(call), std::move(handler));
    return;
  }
  deliver(std::move(call), handler);
}

void Connection::deliver(IncomingCall call, const MethodHandler& handler) {
  CurrentConnectionScope scope(this);
  handler(std::move(call));
}

void Connection::end(End how) {
  if (ended_.exchange(true)) return;
  Handler handler;
  {
    std::lock_guard lock(mutex_);
    if (how == End::Invalidated) handler = std::move(invalidationHandler_);
    if (how == End::Interrupted) handler = std::move(interruptionHandler_);
    invalidationHandler_ = nullptr;
    interruptionHandler_ = nullptr;
  }
  {
    std::deque<std::pair<IncomingCall, MethodHandler>> dropped;
    std::lock_guard lock(deliveryMutex_);
    dropped.swap(pending_->calls);
  }
  if (handler) handler();
}

}  // namespace platform
