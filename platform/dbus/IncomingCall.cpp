#include "platform/dbus/IncomingCall.h"

#include "platform/Log.h"
#include "platform/dbus/Connection.h"

namespace platform {

IncomingCall::IncomingCall(std::string member, BusValues arguments,
                           std::shared_ptr<Connection> connection, bool noReplyExpected,
                           std::string replySignature, std::unique_ptr<Responder> responder)
    : member_(std::move(member)),
      arguments_(std::move(arguments)),
      connection_(std::move(connection)),
      noReplyExpected_(noReplyExpected),
      answered_(noReplyExpected),
      replySignature_(std::move(replySignature)),
      responder_(std::move(responder)) {}

IncomingCall::IncomingCall(IncomingCall&& other) noexcept
    : member_(std::move(other.member_)),
      arguments_(std::move(other.arguments_)),
      connection_(std::move(other.connection_)),
      noReplyExpected_(other.noReplyExpected_),
      answered_(other.answered_),
      replySignature_(std::move(other.replySignature_)),
      responder_(std::move(other.responder_)) {
  other.member_.clear();
  other.answered_ = true;
}

IncomingCall& IncomingCall::operator=(IncomingCall&& other) noexcept {
  if (this != &other) {
    answerDropped();
    member_ = std::move(other.member_);
    arguments_ = std::move(other.arguments_);
    connection_ = std::move(other.connection_);
    noReplyExpected_ = other.noReplyExpected_;
    answered_ = other.answered_;
    replySignature_ = std::move(other.replySignature_);
    responder_ = std::move(other.responder_);
    other.member_.clear();
    other.answered_ = true;
  }
  return *this;
}

IncomingCall::~IncomingCall() { answerDropped(); }

void IncomingCall::answerDropped() {
  if (answered_ || !responder_) return;
  answered_ = true;
  QV_LOG(kLogLevelDebug, "call {} from {} dropped without a reply", member_,
         connection_ ? connection_->uniqueName() : std::string("?"));
  responder_->sendError(kBusErrorFailed, kNoReplyProducedMessage);
}

void IncomingCall::reply(BusValues values) {
  if (noReplyExpected_ || !responder_) return;
  if (answered_) {
    QV_LOG(kLogLevelError, "second reply to call {} ignored", member_);
    return;
  }
  answered_ = true;
  std::string signature = signatureOf(values);
  if (signature != replySignature_) {
    QV_LOG(kLogLevelError, "reply to call {} has signature '{}', expected '{}'", member_, signature,
           replySignature_);
    responder_->sendError(kBusErrorFailed, "the service produced a malformed reply");
    return;
  }
  responder_->sendReply(values);
}

void IncomingCall::replyError(const std::string& errorName, const std::string& message) {
  if (noReplyExpected_ || !responder_) return;
  if (answered_) {
    QV_LOG(kLogLevelError, "second reply to call {} ignored", member_);
    return;
  }
  answered_ = true;
  responder_->sendError(errorName, message);
}

}  // namespace platform
