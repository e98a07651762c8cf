// LocalListener: an in-process Listener for tests of the service core. No
// bus: a test names peers (":1.1", ":1.2"...), delivers their calls with
// deliver() (or leaves them received but undelivered with receive(), as calls
// the bus thread has read and not dispatched yet), and ends them with vanish() (invalidation) or
// loseBus() (invalidation of every connection). Deliveries behave as on the bus: the member and
// argument signature are checked (UnknownMethod, InvalidArgs), the delegate is asked about a peer's
// first call, the call runs on the calling thread with Connection::current() set, and its answer
// lands in a LocalReply that the test can wait on.
//
// Threads: any; deliveries, vanish() and loseBus() are serialized (one at a
// time, like the bus thread). Owned by the test.
#pragma once

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "platform/dbus/Listener.h"
#include "tests/support/Gate.h"

namespace platform {

// The answer to one delivered call. Filled from whichever thread answers.
class LocalReply {
 public:
  // Whether an answer (reply or error) has arrived.
  bool isAnswered() const { return answerCount() > 0; }
  // Blocks until answered. Returns false if `timeout` passes first.
  bool waitFor(std::chrono::milliseconds timeout) const;
  // How many answers arrived (more than one is a transport bug).
  int answerCount() const { return testing::readLocked(mutex_, count_); }
  bool isError() const { return testing::readLocked(mutex_, isError_); }
  std::string errorName() const { return testing::readLocked(mutex_, errorName_); }
  std::string errorMessage() const { return testing::readLocked(mutex_, errorMessage_); }
  BusValues values() const { return testing::readLocked(mutex_, values_); }

  // Used by the listener's responder.
  void record(bool isError, BusValues values, std::string errorName, std::string message);

 private:
  mutable std::mutex mutex_;
  mutable std::condition_variable answered_;
  int count_ = 0;
  bool isError_ = false;
  BusValues values_;
  std::string errorName_;
  std::string errorMessage_;
};

class LocalListener final : public Listener {
 public:
  explicit LocalListener(InterfaceDescription interface);
  ~LocalListener() override;

  // Validates the interface and starts accepting deliveries.
  Status resume() override;
  // Records the signal (see emittedSignals()).
  void emitSignal(const std::string& name, const BusValues& arguments = {}) override;
  // The credentials set with setPeerCredentials() (empty fields for other
  // peers), at once, on the calling thread.
  void credentialsOfPeers(std::vector<std::string> uniqueNames,
                          CredentialsCompletion completion) override;
  void setPeerCredentials(const std::string& uniqueName, PeerCredentials credentials);
  Status releaseName() override;
  void stop() override;

  // Delivers a call of `member` with `arguments` from peer `sender` and
  // returns where its answer will land. A listener that is not resumed, or
  // is stopped, answers ServiceUnknown.
  std::shared_ptr<LocalReply> deliver(const std::string& sender, const std::string& member,
                                      BusValues arguments = {}, bool noReplyExpected = false);
  // A call that has reached the listener and waits for delivery: delivered,
  // in the order received, by deliverReceived() or by stop(), whose orderly
  // stop delivers what was received, also after releaseName(). A listener
  // that is not resumed, is stopped, or has released its name answers
  // ServiceUnknown at once.
  std::shared_ptr<LocalReply> receive(const std::string& sender, const std::string& member,
                                      BusValues arguments = {}, bool noReplyExpected = false);
  void deliverReceived();
  // A broadcast signal arrives: runs the handler of each matching
  // subscription (see SignalMatch) on the calling thread.
  void deliverSignal(const std::string& interface, const std::string& member,
                     const BusValues& arguments);
  // The peer `sender` has left: its connection is invalidated.
  void vanish(const std::string& sender);
  // The bus is gone: every connection is invalidated.
  void loseBus();

  std::vector<std::pair<std::string, BusValues>> emittedSignals() const {
    return testing::readLocked(stateMutex_, signals_);
  }
  bool isNameReleased() const { return testing::readLocked(stateMutex_, nameReleased_); }
  bool isStopped() const { return testing::readLocked(stateMutex_, stopped_); }

 private:
  struct Received;
  // With stateMutex_ held: whether the listener takes no calls now; if so,
  // answers ServiceUnknown (unless no reply is expected).
  bool refusedLocked(IncomingCall::Responder& responder, bool noReplyExpected);
  // With deliveryMutex_ held: checks and dispatches one call.
  void deliverChecked(const std::string& sender, const std::string& member, BusValues arguments,
                      bool noReplyExpected, std::unique_ptr<IncomingCall::Responder> responder);

  mutable std::recursive_mutex deliveryMutex_;  // one delivery at a time
  mutable std::mutex stateMutex_;               // guards the fields below
  bool resumed_ = false;
  bool nameReleased_ = false;
  bool stopped_ = false;
  std::vector<std::pair<std::string, BusValues>> signals_;
  PeerCredentialsTable credentials_;
  std::vector<Received> received_;
};

}  // namespace platform
