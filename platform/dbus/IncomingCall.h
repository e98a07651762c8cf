// IncomingCall: one method call received by a Listener, with its member
// name, its arguments, the calling Connection and the means to answer it.
//
// Every call that expects a reply gets exactly one answer: reply() or
// replyError(), from any thread. An IncomingCall destroyed without an answer
// answers its caller with org.freedesktop.DBus.Error.Failed "no reply was
// produced", so a lost reply never leaves a caller hanging. For a call sent
// with the no-reply-expected flag, reply() and replyError() do nothing.
// Answers to callers that have gone away, or after the bus is lost, are
// dropped silently.
//
// Ownership: move-only; one owner at a time. Move it to whichever queue will
// answer it (std::move_only_function captures it fine). Not for concurrent
// use by two threads.
#pragma once

#include <memory>
#include <string>

#include "platform/dbus/BusValue.h"

namespace platform {

class Connection;

// Standard error names used by the transport.
inline constexpr const char* kBusErrorFailed = "org.freedesktop.DBus.Error.Failed";
inline constexpr const char* kBusErrorAccessDenied = "org.freedesktop.DBus.Error.AccessDenied";
inline constexpr const char* kBusErrorInvalidArgs = "org.freedesktop.DBus.Error.InvalidArgs";
inline constexpr const char* kBusErrorUnknownMethod = "org.freedesktop.DBus.Error.UnknownMethod";
inline constexpr const char* kBusErrorServiceUnknown = "org.freedesktop.DBus.Error.ServiceUnknown";
inline constexpr const char* kBusErrorNoReply = "org.freedesktop.DBus.Error.NoReply";
// The message of the error sent for a call dropped without an answer.
inline constexpr const char* kNoReplyProducedMessage = "no reply was produced";

class IncomingCall {
 public:
  // How a transport sends an answer. Called at most once per call, from any
  // thread; must not throw.
  class Responder {
   public:
    virtual ~Responder() = default;
    virtual void sendReply(const BusValues& values) = 0;
    virtual void sendError(const std::string& errorName, const std::string& message) = 0;
  };

  // An empty call: answers nothing.
  IncomingCall() = default;
  // `replySignature` is the method's output signature; reply() checks
  // its values against it.
  IncomingCall(std::string member, BusValues arguments, std::shared_ptr<Connection> connection,
               bool noReplyExpected, std::string replySignature,
               std::unique_ptr<Responder> responder);
  IncomingCall(IncomingCall&& other) noexcept;
  // Answers the call held so far (as a dropped call) before taking `other`.
  IncomingCall& operator=(IncomingCall&& other) noexcept;
  ~IncomingCall();

  // Whether this object holds a call (false once moved from).
  explicit operator bool() const { return responder_ != nullptr || !member_.empty(); }

  const std::string& member() const { return member_; }
  const BusValues& arguments() const { return arguments_; }
  // The connection of the caller; nullptr only for an empty call.
  const std::shared_ptr<Connection>& connection() const { return connection_; }
  bool noReplyExpected() const { return noReplyExpected_; }
  // Whether reply() or replyError() has been called (or none is expected).
  bool isAnswered() const { return answered_; }

  // Answers with `values`, which must match the method's output signature;
  // values that do not are a programming error, logged, and the caller gets
  // org.freedesktop.DBus.Error.Failed instead. A second answer is ignored
  // and logged.
  void reply(BusValues values = {});
  void replyError(const std::string& errorName, const std::string& message);

 private:
  void answerDropped();

  std::string member_;
  BusValues arguments_;
  std::shared_ptr<Connection> connection_;
  bool noReplyExpected_ = false;
  bool answered_ = false;
  std::string replySignature_;
  std::unique_ptr<Responder> responder_;
};

}  // namespace platform
