// AcceptAll: a listener delegate for benchmarks that accepts every
// connection as valid. Owned by the benchmark, which keeps it alive while
// its listener runs; called on the listener's delivery thread.
#pragma once

#include <memory>

#include "platform/dbus/Listener.h"

namespace quorvel::bench {

class AcceptAll : public platform::ListenerDelegate {
 public:
  bool shouldAcceptNewConnection(platform::Listener&,
                                 std::shared_ptr<platform::Connection> connection) override {
    connection->setValid(true);
    connection->resume();
    return true;
  }
};

}  // namespace quorvel::bench
