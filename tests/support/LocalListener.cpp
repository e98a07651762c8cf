#include "tests/support/LocalListener.h"

#include <fmt/format.h>

namespace platform {
namespace {

class LocalResponder final : public IncomingCall::Responder {
 public:
  explicit LocalResponder(std::shared_ptr<LocalReply> reply) : reply_(std::move(reply)) {}
  void sendReply(const BusValues& values) override { reply_->record(false, values, {}, {}); }
  void sendError(const std::string& errorName, const std::string& message) override {
    reply_->record(true, {}, errorName, message);
  }

 private:
  std::shared_ptr<LocalReply> reply_;
};

}  // namespace

bool LocalReply::waitFor(std::chrono::milliseconds timeout) const {
  std::unique_lock lock(mutex_);
  return answered_.wait_for(lock, timeout, [this] { return count_ > 0; });
}

void LocalReply::record(bool isError, BusValues values, std::string errorName,
                        std::string message) {
  {
    std::lock_guard lock(mutex_);
    if (count_++ == 0) {
      isError_ = isError;
      values_ = std::move(values);
      errorName_ = std::move(errorName);
      errorMessage_ = std::move(message);
    }
  }
  answered_.notify_all();
}

struct LocalListener::Received {
  std::string sender;
  std::string member;
  BusValues arguments;
  bool noReplyExpected;
  std::unique_ptr<IncomingCall::Responder> responder;
};

LocalListener::LocalListener(InterfaceDescription interface) : Listener(std::move(interface)) {}

LocalListener::~LocalListener() { stop(); }

Status LocalListener::resume() {
  if (auto valid = validateInterface(); !valid) return valid;
  std::lock_guard lock(stateMutex_);
  resumed_ = true;
  return {};
}

void LocalListener::emitSignal(const std::string& name, const BusValues& arguments) {
  std::lock_guard lock(stateMutex_);
  signals_.emplace_back(name, arguments);
}

void LocalListener::credentialsOfPeers(std::vector<std::string> uniqueNames,
                                       CredentialsCompletion completion) {
  PeerCredentialsTable table;
  {
    std::lock_guard lock(stateMutex_);
    for (const std::string& name : uniqueNames) {
      auto known = credentials_.find(name);
      table[name] = known == credentials_.end() ? PeerCredentials() : known->second;
    }
  }
  completion(std::move(table));
}

void LocalListener::setPeerCredentials(const std::string& uniqueName, PeerCredentials credentials) {
  std::lock_guard lock(stateMutex_);
  credentials_[uniqueName] = std::move(credentials);
}

Status LocalListener::releaseName() {
  std::lock_guard lock(stateMutex_);
  nameReleased_ = true;
  return {};
}

void LocalListener::stop() {
  std::lock_guard delivery(deliveryMutex_);
  {
    std::lock_guard lock(stateMutex_);
    if (stopped_) return;
  }
  deliverReceived();  // the orderly stop: what was received is delivered
  {
    std::lock_guard lock(stateMutex_);
    stopped_ = true;
  }
  forgetConnections();
}

std::shared_ptr<LocalReply> LocalListener::receive(const std::string& sender,
                                                   const std::string& member, BusValues arguments,
                                                   bool noReplyExpected) {
  auto reply = std::make_shared<LocalReply>();
  auto responder = std::make_unique<LocalResponder>(reply);
  std::lock_guard lock(stateMutex_);
  if (refusedLocked(*responder, noReplyExpected)) return reply;
  received_.push_back(
      Received{sender, member, std::move(arguments), noReplyExpected, std::move(responder)});
  return reply;
}

void LocalListener::deliverReceived() {
  std::lock_guard delivery(deliveryMutex_);
  std::vector<Received> received;
  {
    std::lock_guard lock(stateMutex_);
    received.swap(received_);
  }
  for (Received& call : received) {
    deliverChecked(call.sender, call.member, std::move(call.arguments), call.noReplyExpected,
                   std::move(call.responder));
  }
}

std::shared_ptr<LocalReply> LocalListener::deliver(const std::string& sender,
                                                   const std::string& member, BusValues arguments,
                                                   bool noReplyExpected) {
  auto reply = std::make_shared<LocalReply>();
  auto responder = std::make_unique<LocalResponder>(reply);
  std::lock_guard delivery(deliveryMutex_);
  {
    std::lock_guard lock(stateMutex_);
    if (refusedLocked(*responder, noReplyExpected)) return reply;
  }
  deliverChecked(sender, member, std::move(arguments), noReplyExpected, std::move(responder));
  return reply;
}

bool LocalListener::refusedLocked(IncomingCall::Responder& responder, bool noReplyExpected) {
  if (resumed_ && !stopped_ && !nameReleased_) return false;
  if (!noReplyExpected) responder.sendError(kBusErrorServiceUnknown, "no listener");
  return true;
}

void LocalListener::deliverChecked(const std::string& sender, const std::string& member,
                                   BusValues arguments, bool noReplyExpected,
                                   std::unique_ptr<IncomingCall::Responder> responder) {
  const MethodDescription* declared = method(member);
  if (!declared) {
    if (!noReplyExpected) {
      responder->sendError(
          kBusErrorUnknownMethod,
          fmt::format("Unknown method {} or interface {}.", member, interfaceDescription().name));
    }
    return;
  }
  std::string signature = signatureOf(arguments);
  if (signature != declared->inputSignature) {
    if (!noReplyExpected) {
      responder->sendError(
          kBusErrorInvalidArgs,
          fmt::format("Invalid arguments '{}' to call {}.{}(), expecting '{}'.", signature,
                      interfaceDescription().name, member, declared->inputSignature));
    }
    return;
  }
  dispatch(sender, *declared, std::move(arguments), noReplyExpected, std::move(responder));
}

void LocalListener::vanish(const std::string& sender) {
  std::lock_guard delivery(deliveryMutex_);
  peerVanished(sender);
}

void LocalListener::loseBus() {
  std::lock_guard delivery(deliveryMutex_);
  busLost();
}

void LocalListener::deliverSignal(const std::string& interface, const std::string& member,
                                  const BusValues& arguments) {
  std::lock_guard delivery(deliveryMutex_);
  for (const SignalMatch& match : interfaceDescription().matches) {
    if (match.interface != interface || match.member != member) continue;
    if (signatureOf(arguments).starts_with(match.signature)) {
      if (match.handler) match.handler(arguments);
    } else if (match.mismatchHandler) {
      match.mismatchHandler();
    }
  }
}

}  // namespace platform
