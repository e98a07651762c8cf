// The idle exit.
//
// Order matters. The listener's orderly stop still delivers the calls it has
// already read, and their handlers hand work to the service serial queue, so
// the queue is drained only after the listener has stopped; a drain before
// the stop would let that work run after main() returned, and its callers
// would never get their answers. A request holds a keep-alive until its work
// and its answer are done (some end a second later, on a main-queue timer),
// so after the drain the sequence also waits for the root transaction to end.
// Work that ends the root may have queued more service work, so every end is
// followed by another drain and check; the loop ends when a drain finds the
// root free.
//
// Nothing here blocks the main queue: the drain is a marker task queued on
// the service queue that queues the next step back on the main queue, and the
// wait for the root is ProcessLifetime's whenNoTransaction callback doing the
// same. Timers and deliveries the requests depend on keep running meanwhile.
#define QV_LOG_TAG "IdleExit"
#include "quorveld/IdleExit.h"

#include <systemd/sd-daemon.h>

#include "platform/Log.h"
#include "platform/dbus/Listener.h"

namespace quorvel {

std::shared_ptr<IdleExit> IdleExit::install(std::shared_ptr<SavedRecordingService> service,
                                            platform::ProcessLifetime& lifetime,
                                            platform::MainQueue& mainQueue) {
  auto idleExit = std::make_shared<IdleExit>(std::move(service), lifetime, mainQueue);
  lifetime.setIdleHandler([idleExit] { idleExit->start(); });
  return idleExit;
}

IdleExit::IdleExit(std::shared_ptr<SavedRecordingService> service,
                   platform::ProcessLifetime& lifetime, platform::MainQueue& mainQueue)
    : _service(std::move(service)), _lifetime(lifetime), _mainQueue(mainQueue) {}

void IdleExit::start() {
  QV_DCHECK_ON_QUEUE(_mainQueue);
  if (_started) return;
  _started = true;
  QV_LOG(platform::kLogLevelNotice, "Idle; exiting");
  sd_notify(0, "STOPPING=1");
  if (auto listener = _service->listener()) {
    if (auto released = listener->releaseName(); !released) {
      QV_LOG(platform::kLogLevelError, "Could not release the service name: {}", released.error());
    }
    // Delivers what was received before the name went; handlers only queue.
    listener->stop();
  }
  _drainServiceQueueThenCheck();
}

bool IdleExit::hasStoppedMainQueue() const {
  QV_DCHECK_ON_QUEUE(_mainQueue);
  return _stoppedMainQueue;
}

void IdleExit::_drainServiceQueueThenCheck() {
  QV_DCHECK_ON_QUEUE(_mainQueue);
  _service->serviceSerialQueue().async(
      [self = shared_from_this()] { self->_mainQueue.async([self] { self->_checkKeepAlive(); }); });
}

void IdleExit::_checkKeepAlive() {
  QV_DCHECK_ON_QUEUE(_mainQueue);
  if (_lifetime.isInTransaction()) {
    QV_LOG(platform::kLogLevelDebug, "Waiting for the open work to end before exiting");
    _lifetime.whenNoTransaction([self = shared_from_this()] {
      self->_mainQueue.async([self] { self->_drainServiceQueueThenCheck(); });
    });
    return;
  }
  QV_LOG(platform::kLogLevelDebug, "Nothing left to answer; stopping the main queue");
  _stoppedMainQueue = true;
  _mainQueue.stop();
}

}  // namespace quorvel
