// Listener: the service side of the bus. It publishes one object with one
// interface (a table of methods and signals), turns each peer into a
// Connection the first time the peer calls, asks its delegate whether to
// accept that connection, and delivers the peer's calls to the methods'
// handlers with Connection::current() set.
//
// Two listeners implement it: BusListener (a real D-Bus connection, in
// BusListener.h) and LocalListener (in-process, for tests of the service
// core; a test double, in tests/support/LocalListener.h). The service codes
// against this interface.
//
// Delivery: calls run one at a time on the listener's delivery thread (the
// bus thread for BusListener), so handlers must return quickly and never
// block it: check arguments, note Connection::current(), queue the work,
// and answer the IncomingCall later from whichever queue finishes it. A
// listener may run that queued work on its delivery thread once the handler
// has returned (see SerialQueue::AdoptionScope).
//
// Threads: setDelegate() before resume(); the other members may be called
// from any thread. The delegate's calls run on the delivery thread.
#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Error.h"
#include "platform/dbus/BusValue.h"
#include "platform/dbus/Connection.h"
#include "platform/dbus/IncomingCall.h"

namespace platform {

class Listener;

using PeerCredentialsTable = std::map<std::string, PeerCredentials>;
using CredentialsCompletion = std::move_only_function<void(PeerCredentialsTable credentials)>;

// One method of the published interface.
struct MethodDescription {
  std::string name;
  std::string inputSignature;           // e.g. "sb"; "" for none
  std::vector<std::string> inputNames;  // argument names shown by introspection
  std::string outputSignature;          // e.g. "(siss)"; "" for none
  std::vector<std::string> outputNames;
  bool noReply = false;               // annotated as a method that sends no reply
  Connection::MethodHandler handler;  // runs on the delivery thread
  // The interface it belongs to when not the description's own (an object
  // may publish a second interface beside its main one).
  std::string interface;
};

// One signal of the published interface.
struct SignalDescription {
  std::string name;
  std::string signature;
  std::vector<std::string> names;
  std::string interface;  // as for methods: empty for the description's own
};

// A broadcast signal the listener receives, from any sender on the bus.
// `handler` gets its leading arguments of `signature`; a signal of that name
// whose arguments do not start so goes to `mismatchHandler` instead. Both run
// on the delivery thread.
struct SignalMatch {
  std::string interface;  // e.g. "org.quorvel.Events1"
  std::string member;     // e.g. "Event"
  std::string signature;  // e.g. "s"
  std::function<void(const BusValues& arguments)> handler;
  std::function<void()> mismatchHandler;
};

struct InterfaceDescription {
  std::string name;  // e.g. "org.quorvel.SavedRecordingService1"
  std::vector<MethodDescription> methods;
  std::vector<SignalDescription> signals;
  // Signals of others the listener subscribes to, installed before the name
  // is requested.
  std::vector<SignalMatch> matches;
};

// The listener's delegate decides about new connections. It is not owned
// by the listener and must outlive it (or be cleared first).
class ListenerDelegate {
 public:
  virtual ~ListenerDelegate() = default;
  // A peer has sent its first call. Answer true to accept the connection;
  // the connection's calls are delivered once it is resumed (usually from
  // here). A refused peer's calls are answered with AccessDenied, and the
  // delegate is not asked again about that peer.
  virtual bool shouldAcceptNewConnection(Listener& listener,
                                         std::shared_ptr<Connection> newConnection) = 0;
  // The listener has lost the bus; every connection has been invalidated.
  virtual void listenerDidLoseBus(Listener& /*listener*/) {}
};

class Listener {
 public:
  virtual ~Listener();
  Listener(const Listener&) = delete;
  Listener& operator=(const Listener&) = delete;

  // Sets the delegate (not owned). Call before resume().
  void setDelegate(ListenerDelegate* delegate);
  ListenerDelegate* delegate() const;

  // Starts listening: publishes the interface and its name. Errors come
  // back as values.
  virtual Status resume() = 0;
  // Broadcasts signal `name` of the interface with `arguments`.
  virtual void emitSignal(const std::string& name, const BusValues& arguments = {}) = 0;
  // What the bus says of each peer (by unique name): its process id, user
  // id and command name, from the bus's credentials of the peer, asked once
  // per connection and kept with it. `completion` runs on the delivery
  // thread once every answer is in; a peer whose credentials cannot be read
  // gets empty fields. Never blocks the caller. Any thread.
  // This base answers at once with empty fields.
  virtual void credentialsOfPeers(std::vector<std::string> uniqueNames,
                                  CredentialsCompletion completion);
  // Gives up the published name: new callers no longer reach this listener.
  virtual Status releaseName() = 0;
  // Orderly stop: delivers what has already been received, then stops
  // listening. Answers to calls still held are sent as they are produced.
  // Connections are dropped without running their handlers. Idempotent.
  virtual void stop() = 0;

  const InterfaceDescription& interfaceDescription() const { return interface_; }
  // The interface signal `name` belongs to (the description's own when it
  // names none), or nullptr for a signal not described.
  const std::string* interfaceOfSignal(std::string_view name) const;
  // The method `name` of the interface, or nullptr.
  const MethodDescription* method(std::string_view name) const;

  // The table of accepted (and refused) peers.
  std::size_t connectionCount() const;
  std::shared_ptr<Connection> connection(const std::string& uniqueName) const;

 protected:
  explicit Listener(InterfaceDescription interface);

  // Validates the interface: names present, signatures supported.
  Status validateInterface() const;

  // Delivery thread: routes a call of `method` from peer `sender`, creating
  // and offering the peer's connection first when it is new.
  void dispatch(const std::string& sender, const MethodDescription& method, BusValues arguments,
                bool noReplyExpected, std::unique_ptr<IncomingCall::Responder> responder);
  // Delivery thread: `uniqueName` has left the bus; invalidates its
  // connection, if any, exactly once.
  void peerVanished(const std::string& uniqueName);
  // Delivery thread: the bus is gone; invalidates every connection and tells
  // the delegate.
  void busLost();
  // Drops every connection without running handlers (for stop()).
  void forgetConnections();

 private:
  InterfaceDescription interface_;
  std::map<std::string, const MethodDescription*, std::less<>> methodsByName_;
  mutable std::mutex mutex_;  // guards the fields below
  ListenerDelegate* delegate_ = nullptr;
  std::map<std::string, std::shared_ptr<Connection>> connections_;
};

}  // namespace platform
