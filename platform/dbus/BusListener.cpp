// The bus thread
// ==============
//
// sdbus-c++ serializes every sd-bus call behind one lock and flushes after
// each send, so replies and signals can be sent from any thread while the
// bus thread waits in poll(). We run the event loop ourselves instead of
// using enterEventLoopAsync(), for three reasons:
//  - a lost bus makes sd_bus_process() fail, which sdbus-c++ reports by
//    throwing; on its own loop thread that would end the process, here the
//    exception is caught and turned into the invalidation of every
//    connection;
//  - an orderly stop must deliver what has already been read before the loop
//    ends, which enterEventLoop() does not do;
//  - synchronous bus calls (releasing the name) made from another thread
//    while the loop polls may leave read messages queued inside sd-bus with
//    nobody woken up to dispatch them; running them as tasks on the bus
//    thread avoids that.
// Tasks are queued under a mutex and an eventfd wakes the poll().
//
// Each message is delivered inside a SerialQueue::AdoptionScope: the work a
// request queues onto an idle serial queue (the service's) runs on this
// thread right after the delivery, replies included, instead of waking that
// queue's worker and then having the worker's replies wait for the sd-bus
// lock this thread holds while it reads. On a busy daemon that spares each
// request two thread switches and the lock hand-overs. Work queued while the
// queue is busy still goes to its worker, and a run here stops after a short
// budget, so a flood of queued work never keeps this thread from reading.
//
// Lifetimes: every sdbus::Message refers to the sdbus connection that read
// it, so the connection (Core) is shared by the listener and every
// outstanding call's responder, and outlives both. The object's method
// callbacks refer to the listener; they only run on the bus thread, which
// the listener's destructor joins before it lets go of the Core.
#include "platform/dbus/BusListener.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <sdbus-c++/sdbus-c++.h>

#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <deque>
#include <fstream>
#include <future>
#include <map>
#include <mutex>
#include <thread>

#include "platform/Log.h"
#include "platform/SerialQueue.h"
#include "platform/dbus/SdBusCodec.h"

namespace platform {
namespace {

constexpr const char* kDomain = "BusTransportErrorDomain";
constexpr const char* kNameOwnerChangedRule =
    "type='signal',sender='org.freedesktop.DBus',path='/org/freedesktop/DBus',"
    "interface='org.freedesktop.DBus',member='NameOwnerChanged'";

Error busError(long code, const std::string& what, const sdbus::Error& error) {
  return Error(kDomain, code, what + ": " + error.getName() + ": " + error.getMessage());
}

}  // namespace

struct BusListener::Core {
  // Declaration order is destruction order in reverse: the match, the
  // object and the proxy go before the connection they are registered on.
  std::unique_ptr<sdbus::IConnection> bus;
  std::unique_ptr<sdbus::IObject> object;
  // The bus itself, asked for its peers' credentials.
  std::unique_ptr<sdbus::IProxy> busDaemon;
  sdbus::Slot nameOwnerChangedMatch;
  std::vector<sdbus::Slot> signalMatches;
};

struct BusListener::Loop {
  std::mutex mutex;  // guards the fields below
  std::deque<std::function<void()>> tasks;
  bool started = false;
  bool running = false;
  bool stopRequested = false;
  std::thread thread;
  std::thread::id threadId;
  int wakeFd = -1;

  ~Loop() {
    if (wakeFd >= 0) ::close(wakeFd);
  }
  void wake() const {
    std::uint64_t one = 1;
    [[maybe_unused]] auto written = ::write(wakeFd, &one, sizeof one);
  }
};

namespace {

// Answers one call on the bus it came from. Keeps the bus connection alive
// until the call is answered or dropped.
class BusResponder final : public IncomingCall::Responder {
 public:
  BusResponder(std::shared_ptr<void> keepAlive, sdbus::MethodCall call)
      : keepAlive_(std::move(keepAlive)), call_(std::move(call)) {}

  void sendReply(const BusValues& values) override {
    try {
      auto reply = call_.createReply();
      sdbuscodec::appendValues(reply, values);
      reply.send();
    } catch (const std::exception& error) {
      QV_LOG(kLogLevelDebug, "reply to {} dropped: {}", call_.getMemberName(), error.what());
    }
  }

  void sendError(const std::string& errorName, const std::string& message) override {
    try {
      auto reply = call_.createErrorReply(sdbus::Error(errorName, message));
      reply.send();
    } catch (const std::exception& error) {
      QV_LOG(kLogLevelDebug, "error reply to {} dropped: {}", call_.getMemberName(), error.what());
    }
  }

 private:
  std::shared_ptr<void> keepAlive_;  // declared first: destroyed after call_
  sdbus::MethodCall call_;
};

}  // namespace

BusListener::BusListener(BusListenerOptions options, InterfaceDescription interface)
    : Listener(std::move(interface)),
      options_(std::move(options)),
      core_(std::make_shared<Core>()),
      loop_(std::make_unique<Loop>()) {}

BusListener::~BusListener() {
  stop();
  // The bus thread is gone: no callback can run any more. Unregister now so
  // that late answers (which keep the Core alive) never see this listener.
  try {
    core_->nameOwnerChangedMatch.reset();
    core_->signalMatches.clear();
    core_->busDaemon.reset();
    core_->object.reset();
  } catch (const std::exception& error) {
    QV_LOG(kLogLevelError, "unregistering the listener failed: {}", error.what());
  }
}

Status BusListener::resume() {
  std::lock_guard lock(loop_->mutex);
  if (loop_->started) return {};
  if (auto valid = validateInterface(); !valid) return valid;
  const InterfaceDescription& interface = interfaceDescription();
  try {
    core_->bus = options_.busAddress.empty()
                     ? sdbus::createSessionBusConnection()
                     : sdbus::createSessionBusConnectionWithAddress(options_.busAddress);
  } catch (const sdbus::Error& error) {
    return fail(busError(2, "cannot connect to the bus", error));
  }
  try {
    core_->object = sdbus::createObject(*core_->bus, options_.objectPath);
    for (const MethodDescription& declared : interface.methods) {
      sdbus::Flags flags;
      if (declared.noReply) flags.set(sdbus::Flags::METHOD_NO_REPLY);
      const MethodDescription* method = &declared;
      auto callback = [this, method](sdbus::MethodCall call) {
        std::string sender = call.getSender();
        bool noReply = call.doesntExpectReply();
        auto arguments = sdbuscodec::readValues(call, method->inputSignature);
        if (!arguments) {
          if (!noReply)
            call.createErrorReply(sdbus::Error(kBusErrorInvalidArgs, "malformed arguments")).send();
          return;
        }
        auto responder = std::make_unique<BusResponder>(core_, std::move(call));
        try {
          dispatch(sender, *method, std::move(*arguments), noReply, std::move(responder));
        } catch (const std::exception& error) {
          // A handler threw: a programming error. The call, dropped, answers
          // its caller; the bus thread goes on.
          QV_LOG(kLogLevelError, "handler of {} threw: {}", method->name, error.what());
        }
      };
      const std::string& on = declared.interface.empty() ? interface.name : declared.interface;
      bool named = !declared.inputNames.empty() || !declared.outputNames.empty();
      if (named) {
        core_->object->registerMethod(on, declared.name, declared.inputSignature,
                                      declared.inputNames, declared.outputSignature,
                                      declared.outputNames, std::move(callback), flags);
      } else {
        core_->object->registerMethod(on, declared.name, declared.inputSignature,
                                      declared.outputSignature, std::move(callback), flags);
      }
    }
    for (const SignalDescription& signal : interface.signals) {
      core_->object->registerSignal(*interfaceOfSignal(signal.name), signal.name, signal.signature,
                                    signal.names);
    }
    core_->object->finishRegistration();
  } catch (const sdbus::Error& error) {
    core_->object.reset();
    core_->bus.reset();
    return fail(busError(3, "cannot publish " + options_.objectPath, error));
  }
  try {
    // Installed before the name is requested: from the moment a peer can
    // find us by name, its departure is seen.
    core_->nameOwnerChangedMatch =
        core_->bus->addMatch(kNameOwnerChangedRule, [this](sdbus::Message& message) {
          std::string name, oldOwner, newOwner;
          message >> name >> oldOwner >> newOwner;
          if (!message) return;
          if (!name.empty() && name.front() == ':' && newOwner.empty()) peerVanished(name);
        });
    for (const SignalMatch& match : interfaceDescription().matches) {
      std::string rule =
          "type='signal',interface='" + match.interface + "',member='" + match.member + "'";
      core_->signalMatches.push_back(core_->bus->addMatch(rule, [&match](sdbus::Message& message) {
        auto values = sdbuscodec::readValues(message, match.signature);
        if (values) {
          if (match.handler) match.handler(*values);
        } else if (match.mismatchHandler) {
          match.mismatchHandler();
        }
      }));
    }
    core_->busDaemon =
        sdbus::createProxy(*core_->bus, "org.freedesktop.DBus", "/org/freedesktop/DBus");
    if (!options_.serviceName.empty()) core_->bus->requestName(options_.serviceName);
  } catch (const sdbus::Error& error) {
    core_->nameOwnerChangedMatch.reset();
    core_->signalMatches.clear();
    core_->busDaemon.reset();
    core_->object.reset();
    core_->bus.reset();
    return fail(busError(4, "cannot own the name '" + options_.serviceName + "'", error));
  }
  loop_->wakeFd = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (loop_->wakeFd < 0) return fail(posixError(errno, "eventfd"));
  loop_->started = true;
  loop_->running = true;
  loop_->thread = std::thread([this] { run(); });
  loop_->threadId = loop_->thread.get_id();
  QV_LOG(kLogLevelDebug, "listening as {} on {}", uniqueName(), options_.objectPath);
  return {};
}

void BusListener::run() {
  sdbus::IConnection& bus = *core_->bus;
  auto runTasks = [this](std::unique_lock<std::mutex>& lock) {
    while (!loop_->tasks.empty()) {
      auto task = std::move(loop_->tasks.front());
      loop_->tasks.pop_front();
      lock.unlock();
      task();
      lock.lock();
    }
  };
  try {
    while (true) {
      {
        std::unique_lock lock(loop_->mutex);
        runTasks(lock);
        if (loop_->stopRequested) break;
      }
      bool processed;
      {
        SerialQueue::AdoptionScope adoption;
        processed = bus.processPendingRequest();
      }
      if (processed) continue;
      auto pollData = bus.getEventLoopPollData();
      struct pollfd fds[] = {{pollData.fd, pollData.events, 0}, {loop_->wakeFd, POLLIN, 0}};
      int result = ::poll(fds, 2, pollData.getPollTimeout());
      if (result < 0 && errno != EINTR) {
        QV_LOG(kLogLevelError, "poll on the bus failed: {}", posixError(errno, "poll"));
        break;
      }
      if (result > 0 && (fds[1].revents & POLLIN)) {
        std::uint64_t count;
        [[maybe_unused]] auto read = ::read(loop_->wakeFd, &count, sizeof count);
      }
    }
    // Orderly stop: deliver what has already been received.
    while (bus.processPendingRequest()) {
    }
  } catch (const sdbus::Error& error) {
    QV_LOG(kLogLevelError, "lost the bus: {} {}", error.getName(), error.getMessage());
    busLost();
  }
  std::deque<std::function<void()>> dropped;
  std::lock_guard lock(loop_->mutex);
  loop_->running = false;
  dropped.swap(loop_->tasks);
}

bool BusListener::performOnBusThread(std::function<void()> task) {
  std::lock_guard lock(loop_->mutex);
  if (!loop_->running || loop_->stopRequested) return false;
  loop_->tasks.push_back(std::move(task));
  loop_->wake();
  return true;
}

void BusListener::emitSignal(const std::string& name, const BusValues& arguments) {
  {
    std::lock_guard lock(loop_->mutex);
    if (!loop_->running) return;
  }
  const std::string* interface = interfaceOfSignal(name);
  try {
    auto signal =
        core_->object->createSignal(interface ? *interface : interfaceDescription().name, name);
    sdbuscodec::appendValues(signal, arguments);
    core_->object->emitSignal(signal);
  } catch (const sdbus::Error& error) {
    QV_LOG(kLogLevelError, "cannot emit signal {}: {}", name, error.what());
  }
}

namespace {

// The command name of process `pid`, as the kernel keeps it; empty when it
// cannot be read.
std::string commandOf(std::uint32_t pid) {
  if (pid == 0) return {};
  std::ifstream comm("/proc/" + std::to_string(pid) + "/comm");
  std::string name;
  std::getline(comm, name);
  return name;
}

PeerCredentials credentialsFrom(sdbus::MethodReply& reply) {
  PeerCredentials credentials;
  std::map<std::string, sdbus::Variant> fields;
  reply >> fields;
  if (auto pid = fields.find("ProcessID"); pid != fields.end())
    credentials.pid = pid->second.get<std::uint32_t>();
  if (auto uid = fields.find("UnixUserID"); uid != fields.end())
    credentials.uid = uid->second.get<std::uint32_t>();
  credentials.command = commandOf(credentials.pid);
  return credentials;
}

}  // namespace

void BusListener::credentialsOfPeers(std::vector<std::string> uniqueNames,
                                     CredentialsCompletion completion) {
  struct Gathering {
    PeerCredentialsTable table;
    std::size_t pending = 1;  // the asking itself, until every call is sent
    CredentialsCompletion completion;
    void done() {
      if (--pending == 0) completion(std::move(table));
    }
  };
  auto gathering = std::make_shared<Gathering>();
  gathering->completion = std::move(completion);
  auto ask = [this, gathering, names = std::move(uniqueNames)] {
    for (const std::string& name : names) {
      if (gathering->table.contains(name)) continue;
      auto connection = this->connection(name);
      if (auto known = connection ? connection->credentials() : std::nullopt) {
        gathering->table[name] = *known;
        continue;
      }
      gathering->table[name] = PeerCredentials();
      ++gathering->pending;
      try {
        auto call =
            core_->busDaemon->createMethodCall("org.freedesktop.DBus", "GetConnectionCredentials");
        call << name;
        core_->busDaemon->callMethod(
            call,
            [gathering, name, connection](sdbus::MethodReply& reply, const sdbus::Error* error) {
              if (!error) {
                try {
                  PeerCredentials credentials = credentialsFrom(reply);
                  if (connection) connection->setCredentials(credentials);
                  gathering->table[name] = std::move(credentials);
                } catch (const sdbus::Error&) {
                  // A malformed answer: the peer is listed without credentials.
                }
              }
              gathering->done();
            });
      } catch (const sdbus::Error& error) {
        QV_LOG(kLogLevelDebug, "cannot ask for the credentials of {}: {}", name, error.what());
        --gathering->pending;
      }
    }
    gathering->done();
  };
  if (isOnBusThread()) {
    ask();
  } else if (!performOnBusThread(ask)) {
    // Not listening: nobody can be asked.
    gathering->done();
  }
}

Status BusListener::releaseName() {
  if (options_.serviceName.empty()) return {};
  auto done = std::make_shared<std::promise<Status>>();
  auto result = done->get_future();
  auto release = [this, done] {
    try {
      core_->bus->releaseName(options_.serviceName);
      done->set_value({});
    } catch (const sdbus::Error& error) {
      done->set_value(fail(busError(6, "cannot release '" + options_.serviceName + "'", error)));
    }
  };
  if (isOnBusThread()) {
    release();
  } else if (!performOnBusThread(release)) {
    return fail(Error(kDomain, 7, "the listener is not running"));
  }
  return result.get();
}

void BusListener::stop() {
  std::thread thread;
  {
    std::lock_guard lock(loop_->mutex);
    if (!loop_->started || loop_->stopRequested) return;
    loop_->stopRequested = true;
    loop_->wake();
    thread = std::move(loop_->thread);
  }
  if (thread.get_id() == std::this_thread::get_id()) {
    // A programming error: the bus thread cannot wait for itself.
    QV_LOG(kLogLevelError, "stop() called on the bus thread");
    thread.detach();
    return;
  }
  if (thread.joinable()) thread.join();
  forgetConnections();
}

std::string BusListener::uniqueName() const {
  try {
    return core_->bus ? core_->bus->getUniqueName() : std::string();
  } catch (const sdbus::Error&) {
    return {};
  }
}

bool BusListener::isOnBusThread() const {
  std::lock_guard lock(loop_->mutex);
  return loop_->started && loop_->threadId == std::this_thread::get_id();
}

}  // namespace platform
