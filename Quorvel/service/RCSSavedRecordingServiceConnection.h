// RCSSavedRecordingServiceConnection: the service interface as the bus sees
// it — every method with its argument and reply signatures and names, and the
// exporting-set signal — and, as a second interface of the same object, the
// session listing and its change signal. The daemon attaches a handler to
// each method; packaging/org.quorvel.SavedRecordingService1.xml and
// org.quorvel.SavedRecordingService1.Sessions.xml say the same in the bus's
// introspection format. Constant data; usable from any thread.
#pragma once

#include "platform/dbus/Listener.h"

namespace quorvel {

class RCSSavedRecordingServiceConnection {
 public:
  // The interface the service exports (methods without handlers).
  static platform::InterfaceDescription serviceInterface();
};

}  // namespace quorvel
