// SavedRecordingServiceBusEdge: the service's D-Bus edge. It gives every
// method of the contract interface the one handler that decodes its call
// into the service's request and answers the call from the request's reply
// callback, and subscribes to the launch events. Nothing else happens here:
// no change of queue, no filtering.
//
// A table of free handlers; the interface it makes holds the service
// weakly. The handlers run on the listener's delivery thread.
#pragma once

#include <memory>

#include "platform/dbus/Listener.h"

namespace quorvel {

class SavedRecordingService;

class SavedRecordingServiceBusEdge {
 public:
  // The contract interface with a handler for each method and the
  // launch-event match, all reaching `service` while it lives. A call that
  // arrives once it is gone is answered by the call's own guard.
  static platform::InterfaceDescription interfaceFor(std::weak_ptr<SavedRecordingService> service);
};

}  // namespace quorvel
