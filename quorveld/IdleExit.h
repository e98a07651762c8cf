// IdleExit: the daemon's way out once it has been idle long enough. It tells
// systemd the service is stopping, gives up the bus name so new callers start
// a fresh daemon, lets the listener deliver the calls it has already
// received, answers them, and stops the main queue only when nothing is left:
// the listener has stopped, the service serial queue has run everything
// queued before the check, and no keep-alive holds the root transaction.
//
// Owned through std::shared_ptr (install() keeps it in the idle handler); it
// holds the service. Every member runs on the main queue it was made for. It
// never blocks that queue: it waits for the service queue and for the root
// transaction by queueing the next step behind them.
#pragma once

#include <memory>

#include "platform/MainQueue.h"
#include "platform/ProcessLifetime.h"
#include "quorveld/SavedRecordingService.h"

namespace quorvel {

class IdleExit : public std::enable_shared_from_this<IdleExit> {
 public:
  // Makes the sequence for `service` and sets it as `lifetime`'s idle
  // handler. Any thread.
  static std::shared_ptr<IdleExit> install(
      std::shared_ptr<SavedRecordingService> service,
      platform::ProcessLifetime& lifetime = platform::ProcessLifetime::instance(),
      platform::MainQueue& mainQueue = platform::mainQueue());

  IdleExit(std::shared_ptr<SavedRecordingService> service, platform::ProcessLifetime& lifetime,
           platform::MainQueue& mainQueue);

  // Main queue. Starts the sequence; it ends with mainQueue.stop(). Later
  // calls (the idle timer firing again while it runs) do nothing.
  void start();
  // Main queue. Whether the sequence has stopped the main queue.
  bool hasStoppedMainQueue() const;

 private:
  // Main queue: the steps after the listener has stopped.
  void _drainServiceQueueThenCheck();
  void _checkKeepAlive();

  // Fixed at creation.
  std::shared_ptr<SavedRecordingService> _service;
  platform::ProcessLifetime& _lifetime;
  platform::MainQueue& _mainQueue;

  // Main queue only:
  bool _started = false;
  bool _stoppedMainQueue = false;
};

}  // namespace quorvel
