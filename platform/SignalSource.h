// SignalSource: watches one signal and runs a handler on a queue for it,
// instead of letting the signal's default action end the process.
//
// Linux discards a signal whose disposition is "ignore", so the signal is
// blocked instead: main() calls blockInThisThread() before any thread starts,
// every later thread inherits the mask, and the source's own thread reads the
// pending signal through a signalfd. A thread that did not inherit the mask
// cannot end the process either: the source installs a handler that forwards
// such a delivery to the same thread. Deliveries that arrive before the
// handler has run are merged into one run.
//
// Owned by its creator; destroying it cancels it. One source per signal
// number at a time. Every member may be called from any thread.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include "platform/DispatchQueue.h"
#include "platform/GlobalQueue.h"

namespace platform {

class SignalSource {
 public:
  // Blocks `signo` in the calling thread (and so in every thread it starts
  // afterwards).
  static void blockInThisThread(int signo);

  // Starts watching `signo` at once; `handler` runs on `queue`.
  SignalSource(int signo, std::function<void()> handler, DispatchQueue& queue = globalQueue());
  ~SignalSource();
  SignalSource(const SignalSource&) = delete;
  SignalSource& operator=(const SignalSource&) = delete;

  // Stops watching. A handler run that was queued and has not started yet is
  // skipped; one already running goes on. The signal stays harmless.
  void cancel();

  // Deliveries read so far (a delivery the kernel merged with a pending one
  // counts once).
  std::uint64_t receivedCount() const;
  // Tests: blocks until `count` deliveries have been read and the handler run
  // for the last of them has been queued (or merged into a queued one).
  void waitUntilReceived(std::uint64_t count) const;

 private:
  struct State;
  std::shared_ptr<State> state_;
};

}  // namespace platform
