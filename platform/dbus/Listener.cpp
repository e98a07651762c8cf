#include "platform/dbus/Listener.h"

#include <set>

#include "platform/Log.h"

namespace platform {

Listener::Listener(InterfaceDescription interface) : interface_(std::move(interface)) {
  for (const MethodDescription& method : interface_.methods) methodsByName_[method.name] = &method;
}

Listener::~Listener() = default;

void Listener::setDelegate(ListenerDelegate* delegate) {
  std::lock_guard lock(mutex_);
  delegate_ = delegate;
}

ListenerDelegate* Listener::delegate() const {
  std::lock_guard lock(mutex_);
  return delegate_;
}

const MethodDescription* Listener::method(std::string_view name) const {
  auto it = methodsByName_.find(name);
  return it == methodsByName_.end() ? nullptr : it->second;
}

std::size_t Listener::connectionCount() const {
  std::lock_guard lock(mutex_);
  return connections_.size();
}

std::shared_ptr<Connection> Listener::connection(const std::string& uniqueName) const {
  std::lock_guard lock(mutex_);
  auto it = connections_.find(uniqueName);
  return it == connections_.end() ? nullptr : it->second;
}

void Listener::credentialsOfPeers(std::vector<std::string> uniqueNames,
                                  CredentialsCompletion completion) {
  PeerCredentialsTable table;
  for (std::string& name : uniqueNames) table[std::move(name)] = PeerCredentials();
  completion(std::move(table));
}

const std::string* Listener::interfaceOfSignal(std::string_view name) const {
  for (const SignalDescription& signal : interface_.signals) {
    if (signal.name == name) return signal.interface.empty() ? &interface_.name : &signal.interface;
  }
  return nullptr;
}

Status Listener::validateInterface() const {
  auto invalid = [](std::string what) {
    return fail(Error("BusTransportErrorDomain", 1, "invalid interface: " + what));
  };
  if (interface_.name.empty()) return invalid("no name");
  std::set<std::string> names;
  for (const MethodDescription& method : interface_.methods) {
    if (method.name.empty() || !names.insert(method.name).second)
      return invalid("missing or duplicate method name '" + method.name + "'");
    if (!isSupportedSignature(method.inputSignature) ||
        !isSupportedSignature(method.outputSignature))
      return invalid("unsupported signature in method " + method.name);
    if (!method.handler) return invalid("method " + method.name + " has no handler");
  }
  for (const SignalDescription& signal : interface_.signals) {
    if (signal.name.empty() || !isSupportedSignature(signal.signature))
      return invalid("bad signal '" + signal.name + "'");
  }
  return {};
}

void Listener::dispatch(const std::string& sender, const MethodDescription& method,
                        BusValues arguments, bool noReplyExpected,
                        std::unique_ptr<IncomingCall::Responder> responder) {
  std::shared_ptr<Connection> connection;
  ListenerDelegate* delegate = nullptr;
  bool isNew = false;
  {
    std::lock_guard lock(mutex_);
    auto it = connections_.find(sender);
    if (it != connections_.end()) {
      connection = it->second;
    } else {
      connection = Connection::createForListener(sender);
      connections_.emplace(sender, connection);
      isNew = true;
    }
    delegate = delegate_;
  }
  if (isNew) {
    bool accepted = delegate && delegate->shouldAcceptNewConnection(*this, connection);
    connection->accepted_.store(accepted ? 1 : 0, std::memory_order_release);
    if (!accepted) QV_LOG(kLogLevelDebug, "refused connection {}", connection->description());
  }
  IncomingCall call(method.name, std::move(arguments), connection, noReplyExpected,
                    method.outputSignature, std::move(responder));
  if (connection->accepted_.load(std::memory_order_acquire) != 1) {
    call.replyError(kBusErrorAccessDenied, "the service refused the connection");
    return;
  }
  connection->deliverOrQueue(std::move(call), method.handler);
}

void Listener::peerVanished(const std::string& uniqueName) {
  std::shared_ptr<Connection> connection;
  {
    std::lock_guard lock(mutex_);
    auto it = connections_.find(uniqueName);
    if (it == connections_.end()) return;
    connection = std::move(it->second);
    connections_.erase(it);
  }
  connection->end(Connection::End::Invalidated);
}

void Listener::busLost() {
  std::map<std::string, std::shared_ptr<Connection>> connections;
  ListenerDelegate* delegate = nullptr;
  {
    std::lock_guard lock(mutex_);
    connections.swap(connections_);
    delegate = delegate_;
  }
  // The connections cannot come back: their peers' unique names died with
  // the bus, and a new bus makes new connections.
  for (auto& [name, connection] : connections) connection->end(Connection::End::Invalidated);
  connections.clear();
  if (delegate) delegate->listenerDidLoseBus(*this);
}

void Listener::forgetConnections() {
  std::map<std::string, std::shared_ptr<Connection>> connections;
  {
    std::lock_guard lock(mutex_);
    connections.swap(connections_);
  }
  for (auto& [name, connection] : connections) connection->end(Connection::End::Dropped);
}

}  // namespace platform
