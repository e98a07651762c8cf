// What the Listener tests share: a delegate and method handlers that record
// what the listener delivers, and one harness per listener that makes peers,
// sends their calls and ends them. LocalHarness drives a LocalListener in
// process; BusHarness runs a BusListener on a private dbus-daemon, with each
// peer its own bus connection. Used from the test's thread only.
#pragma once

#include <gtest/gtest.h>
#include <sdbus-c++/sdbus-c++.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <future>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/dbus/BusListener.h"
#include "platform/dbus/LocalListener.h"
#include "platform/dbus/SdBusCodec.h"
#include "tests/support/Gate.h"
#include "tests/support/TestBus.h"

namespace platform::testing {

using namespace std::chrono_literals;

inline constexpr const char* kName = "org.quorvel.test.Listener";
inline constexpr const char* kPath = "/org/quorvel/test/Listener";
inline constexpr const char* kInterface = "org.quorvel.test.Listener1";

// What the listener did, recorded by the delegate and the handlers.
struct Observations {
  Gate gate;
  bool refuseAll = false;
  bool resumeImmediately = true;
  int accepted = 0;                          // times the delegate was asked
  std::map<std::string, int> invalidations;  // by unique name
  std::map<std::string, int> interruptions;  // by unique name
  int totalInvalidations = 0;
  bool lostBus = false;
  std::vector<std::shared_ptr<Connection>> offered;  // cleared by tests of lifetimes
  std::vector<std::weak_ptr<Connection>> connections;
  std::vector<IncomingCall> held;  // calls the test answers later
  struct Delivery {
    std::string member;
    BusValues arguments;
    bool noReply;
    std::shared_ptr<Connection> connection;
    std::shared_ptr<Connection> current;
  };
  std::vector<Delivery> deliveries;
};

class RecordingDelegate : public ListenerDelegate {
 public:
  explicit RecordingDelegate(Observations& seen) : seen_(seen) {}

  bool shouldAcceptNewConnection(Listener&, std::shared_ptr<Connection> connection) override {
    bool refuse = false;
    bool resume = false;
    seen_.gate.update([&] {
      ++seen_.accepted;
      seen_.offered.push_back(connection);
      seen_.connections.push_back(connection);
      refuse = seen_.refuseAll;
      resume = seen_.resumeImmediately;
    });
    if (refuse) return false;
    std::string name = connection->uniqueName();
    connection->setInvalidationHandler([this, name] {
      seen_.gate.update([&] {
        ++seen_.invalidations[name];
        ++seen_.totalInvalidations;
      });
    });
    connection->setInterruptionHandler(
        [this, name] { seen_.gate.update([&] { ++seen_.interruptions[name]; }); });
    connection->setValid(true);
    if (resume) connection->resume();
    return true;
  }
  void listenerDidLoseBus(Listener&) override {
    seen_.gate.update([&] { seen_.lostBus = true; });
  }

 private:
  Observations& seen_;
};

// Echo answers at once; Hold keeps the call for the test to answer; End
// takes a token and sends no reply.
inline InterfaceDescription testInterface(Observations& seen) {
  auto record = [&seen](const IncomingCall& call) {
    seen.gate.update([&] {
      seen.deliveries.push_back({call.member(), call.arguments(), call.noReplyExpected(),
                                 call.connection(), Connection::current()});
    });
  };
  InterfaceDescription interface {
    kInterface, {}, {
      {
        "Changed", "", {}
      }
    }
  };
  interface.methods.push_back(
      {"Echo", "s", {"text"}, "s", {"echo"}, false, [record](IncomingCall call) {
         record(call);
         BusValues arguments = call.arguments();
         call.reply(std::move(arguments));
       }});
  interface.methods.push_back(
      {"Hold", "", {}, "(siss)", {"token"}, false, [&seen, record](IncomingCall call) {
         record(call);
         seen.gate.update([&] { seen.held.push_back(std::move(call)); });
       }});
  interface.methods.push_back(
      {"End", "(siss)", {"token"}, "", {}, true, [record](IncomingCall call) {
         record(call);
         call.reply();  // does nothing: no reply expected
       }});
  return interface;
}

// The answer a peer got.
struct Answer {
  bool answered = false;
  int count = 0;          // answers the call produced
  std::string errorName;  // "" for a reply
  std::string errorMessage;
  BusValues values;
};
// Waits (at most kWait) for a call's answer. A call without reply returns
// at once, unanswered.
using PendingAnswer = std::function<Answer()>;

class LocalHarness {
 public:
  explicit LocalHarness(InterfaceDescription interface) : listener_(std::move(interface)) {}
  LocalListener& listener() { return listener_; }
  std::string newPeer() { return ":1." + std::to_string(++peers_); }
  PendingAnswer call(const std::string& peer, const std::string& member, BusValues arguments = {},
                     bool noReply = false) {
    auto reply = listener_.deliver(peer, member, std::move(arguments), noReply);
    return [reply, noReply] {
      if (!noReply) reply->waitFor(kWait);
      return Answer{reply->isAnswered(), reply->answerCount(), reply->errorName(),
                    reply->errorMessage(), reply->values()};
    };
  }
  void vanish(const std::string& peer) { listener_.vanish(peer); }
  void loseBus() { listener_.loseBus(); }
  // Returns once the listener has finished what it was delivering.
  void settle() {}

 private:
  LocalListener listener_;
  int peers_ = 0;
};

class BusHarness {
 public:
  explicit BusHarness(InterfaceDescription interface)
      : listener_(BusListenerOptions{bus_.address(), kName, kPath}, std::move(interface)) {}
  BusListener& listener() { return listener_; }
  TestBus& bus() { return bus_; }
  std::string newPeer() {
    auto peer = std::make_unique<Peer>(bus_.address());
    std::string name = peer->bus->getUniqueName();
    peers_[name] = std::move(peer);
    return name;
  }
  PendingAnswer call(const std::string& peer, const std::string& member, BusValues arguments = {},
                     bool noReply = false) {
    auto& proxy = *peers_.at(peer)->proxy;
    auto message = proxy.createMethodCall(kInterface, member);
    sdbuscodec::appendValues(message, arguments);
    if (noReply) {
      message.dontExpectReply();
      proxy.callMethod(message);
      return [] { return Answer{}; };
    }
    const MethodDescription* method = listener_.method(member);
    std::string signature = method ? method->outputSignature : "";
    auto promise = std::make_shared<std::promise<Answer>>();
    std::shared_future<Answer> answer = promise->get_future().share();
    proxy.callMethod(message,
                     [promise, signature](sdbus::MethodReply& reply, const sdbus::Error* error) {
                       Answer answer{true, 1, {}, {}, {}};
                       if (error) {
                         answer.errorName = error->getName();
                         answer.errorMessage = error->getMessage();
                       } else if (auto values = sdbuscodec::readValues(reply, signature)) {
                         answer.values = *values;
                       } else {
                         answer.errorName = "undecodable reply";
                       }
                       promise->set_value(std::move(answer));
                     });
    return [answer] {
      return answer.wait_for(kWait) == std::future_status::ready ? answer.get() : Answer{};
    };
  }
  // The peer disconnects from the bus.
  void vanish(const std::string& peer) { peers_.erase(peer); }
  // The peers stop servicing their connections first: their threads would
  // throw once the bus is gone.
  void loseBus() {
    for (auto& [name, peer] : peers_) peer->bus->leaveEventLoop();
    bus_.kill();
  }
  void settle() {
    std::promise<void> barrier;
    if (listener_.performOnBusThread([&] { barrier.set_value(); })) barrier.get_future().wait();
  }

 private:
  // A client: its own bus connection, serviced by its own thread, and a
  // proxy to the listener.
  struct Peer {
    explicit Peer(const std::string& address)
        : bus(sdbus::createSessionBusConnectionWithAddress(address)),
          proxy(sdbus::createProxy(*bus, kName, kPath)) {
      bus->enterEventLoopAsync();
    }
    ~Peer() { bus->leaveEventLoop(); }
    std::unique_ptr<sdbus::IConnection> bus;
    std::unique_ptr<sdbus::IProxy> proxy;
  };

  TestBus bus_;
  BusListener listener_;
  std::map<std::string, std::unique_ptr<Peer>> peers_;
};

}  // namespace platform::testing
