// BusListener: a Listener on a D-Bus bus (the session bus, or the bus at a
// given address). resume() connects, publishes the object path with the
// interface (introspectable, so `gdbus introspect` shows it), installs one
// NameOwnerChanged match (before the name is requested, so no peer can
// vanish unseen), requests the well-known name, and starts the bus thread.
//
// The bus thread reads and dispatches messages one at a time: method calls
// go through Listener::dispatch() to the method handlers; a peer whose
// unique name leaves the bus has its connection invalidated; a lost bus
// invalidates every connection. Calls with a wrong argument signature are
// answered with org.freedesktop.DBus.Error.InvalidArgs and unknown methods
// with org.freedesktop.DBus.Error.UnknownMethod, without reaching a handler.
// Replies and signals may be sent from any thread. The work a handler queues
// onto an idle serial queue runs on the bus thread right after the handler
// (SerialQueue::AdoptionScope), before the next message is read.
//
// Owner: the service, which destroys it (destruction stops it). Never
// destroy it on its own bus thread.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/dbus/Listener.h"

namespace platform {

struct BusListenerOptions {
  std::string busAddress;   // empty: the session bus
  std::string serviceName;  // the well-known name to own; empty: none
  std::string objectPath;   // e.g. "/org/quorvel/SavedRecordingService"
};

class BusListener final : public Listener {
 public:
  BusListener(BusListenerOptions options, InterfaceDescription interface);
  // Stops (see stop()) and waits for the bus thread.
  ~BusListener() override;

  // Connects and starts serving. Fails (as a value) when the bus cannot be
  // reached, the interface cannot be registered or the name is owned by
  // someone else. A second call after success does nothing.
  Status resume() override;
  // Broadcasts the signal from the object path. Does nothing unless running.
  void emitSignal(const std::string& name, const BusValues& arguments = {}) override;
  // Asks the bus (GetConnectionCredentials, asynchronously, on the bus
  // thread) for the peers whose connections do not know theirs yet.
  void credentialsOfPeers(std::vector<std::string> uniqueNames,
                          CredentialsCompletion completion) override;
  // Releases the well-known name, on the bus thread; waits for the answer.
  Status releaseName() override;
  // Stops reading after delivering every message already received, then
  // ends the bus thread. Calls still held may be answered afterwards; their
  // answers are still sent. Idempotent; must not be called on the bus thread.
  void stop() override;

  // This listener's own unique name on the bus (":1.7"); empty before resume().
  std::string uniqueName() const;
  // Whether the calling thread is the bus thread.
  bool isOnBusThread() const;
  // Runs `task` on the bus thread, between two messages. Returns false (and
  // drops the task) when the bus thread is not running.
  bool performOnBusThread(std::function<void()> task);

 private:
  struct Core;
  struct Loop;

  void run();

  BusListenerOptions options_;
  std::shared_ptr<Core> core_;
  std::unique_ptr<Loop> loop_;
};

}  // namespace platform
