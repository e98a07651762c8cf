// Connection: one client peer of a Listener, named by the peer's unique bus
// name (":1.42"). The listener creates it for the peer's first call, asks its
// delegate whether to accept it, keeps it in a table by unique name and hands
// the same object with every later call from that peer. When the peer
// vanishes the listener removes it from the table and the connection is
// invalidated; when the listener loses the bus every connection is
// invalidated too, since a unique name never comes back once its bus is gone.
// The listeners never interrupt a connection (interruption would promise a
// connection that can resume); the interruption handler stays for owners that
// set both. An end happens at most once per connection and runs the matching
// handler once.
//
// Ownership: shared (std::shared_ptr). The listener's table, access sessions
// and queued requests hold it; its handlers should hold it (and anything
// else) only through weak references. Both handlers are dropped once the
// connection has ended.
//
// Threads: every member may be called from any thread. Calls are delivered
// one at a time per connection, on the listener's delivery thread (the bus
// thread), or on the thread that calls resume() for calls that arrived while
// the connection was suspended. The handlers run on the listener's delivery
// thread. The user-info dictionary is guarded by a lock, but its owner is
// expected to store into it from one queue only.
#pragma once

#include <any>
#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

namespace platform {

class IncomingCall;
class Listener;

// What the bus says of a peer: its process, user and command. Empty fields
// (pid 0, uid kUnknownUser, no command) when it could not be read.
struct PeerCredentials {
  static constexpr std::uint32_t kUnknownUser = 0xFFFFFFFF;
  std::uint32_t pid = 0;
  std::uint32_t uid = kUnknownUser;
  std::string command;
  friend bool operator==(const PeerCredentials&, const PeerCredentials&) = default;
};

class Connection : public std::enable_shared_from_this<Connection> {
 public:
  using Handler = std::function<void()>;
  using MethodHandler = std::function<void(IncomingCall)>;

  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // The peer's unique bus name, e.g. ":1.42".
  const std::string& uniqueName() const { return uniqueName_; }
  // "<connection :1.42>", for logs.
  std::string description() const;

  // The validity flag: false until set. Informational only.
  bool isValid() const { return valid_.load(std::memory_order_acquire); }
  void setValid(bool valid) { valid_.store(valid, std::memory_order_release); }

  // Values attached to the connection. Storing a value creates the
  // dictionary on first use; storing an empty std::any removes the key (and
  // keeps the dictionary); removing from a connection without a dictionary
  // does nothing and creates none.
  void setUserInfo(const std::string& key, std::any value);
  // The value stored under `key`, or an empty std::any.
  std::any userInfo(const std::string& key) const;
  // Whether the dictionary exists (it may be empty).
  bool hasUserInfoDictionary() const;

  // Handlers for the two ways a connection ends. Each runs at most once, on
  // the listener's delivery thread; setting one after the end has no effect.
  void setInvalidationHandler(Handler handler);
  void setInterruptionHandler(Handler handler);

  // Starts delivering calls. Calls that arrive before are kept in order and
  // delivered by resume() on the calling thread, with current() set; once
  // resumed, calls are delivered as they arrive. Idempotent.
  void resume();
  bool isResumed() const;
  // Whether the connection has been invalidated or interrupted.
  bool hasEnded() const { return ended_.load(std::memory_order_acquire); }

  // The peer's credentials once a listener has asked the bus for them (a
  // unique name's process never changes, so they are asked once).
  std::optional<PeerCredentials> credentials() const;
  void setCredentials(PeerCredentials credentials);

  // The connection whose call is being delivered on the calling thread, or
  // nullptr outside a delivery.
  static std::shared_ptr<Connection> current();

  // For listeners only: a new connection for peer `uniqueName`.
  static std::shared_ptr<Connection> createForListener(std::string uniqueName);

 private:
  friend class Listener;
  enum class End { Invalidated, Interrupted, Dropped };
  struct Pending;

  explicit Connection(std::string uniqueName);

  // Delivers `call` to `handler` now, or queues it while suspended.
  void deliverOrQueue(IncomingCall call, MethodHandler handler);
  void deliver(IncomingCall call, const MethodHandler& handler);
  // Ends the connection once: runs the handler of `how` (none for
  // Dropped), drops both handlers and any queued calls (which answer their
  // callers with errors).
  void end(End how);

  const std::string uniqueName_;
  std::atomic<bool> valid_{false};
  std::atomic<bool> ended_{false};
  std::atomic<int> accepted_{-1};  // -1 undecided, 0 refused, 1 accepted

  mutable std::mutex mutex_;  // guards the fields below
  std::unique_ptr<std::map<std::string, std::any>> userInfo_;
  std::optional<PeerCredentials> credentials_;
  Handler invalidationHandler_;
  Handler interruptionHandler_;

  // Held while delivering; recursive so that a handler may call resume().
  std::recursive_mutex deliveryMutex_;
  std::atomic<bool> resumed_{false};  // changed under deliveryMutex_
  bool draining_ = false;             // resume() is delivering the queue; guarded by deliveryMutex_
  std::unique_ptr<Pending> pending_;  // guarded by deliveryMutex_
};

}  // namespace platform
