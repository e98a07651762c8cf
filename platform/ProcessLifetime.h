// ProcessLifetime: the process's keep-alive root transaction and idle exit.
// begin/end are called in strict alternation by the transaction controller.
// Once transactions are enabled and no root transaction has been held for
// the idle period, the idle handler runs on the main queue (quorveld then
// tells systemd STOPPING=1, releases its bus name, answers what is queued
// and exits 0). An idle period of zero never exits.
// Every member may be called from any thread.
#pragma once

#include <functional>
#include <memory>

#include "platform/Clock.h"
#include "platform/MainQueue.h"

namespace platform {

class ProcessLifetime {
 public:
  static ProcessLifetime& instance();  // on mainQueue()
  explicit ProcessLifetime(MainQueue& queue);

  // How long the process may be idle before the idle handler runs (30 s by
  // default; zero or less: never). A pending idle exit restarts with the new
  // period.
  void setIdleExitAfter(Duration idle);
  // Runs on the main queue when the process has been idle long enough.
  void setIdleHandler(std::function<void()> handler);

  // Puts the process under transaction-managed lifetime: from now on, a
  // period of no root transaction leads to the idle handler.
  void enableTransactions();
  // begin and end must alternate, starting with a begin; debug builds abort
  // on a second begin or an end without a begin, release builds ignore it.
  // A begin cancels a pending idle exit; an end (once enabled) arms it.
  void beginTransaction();
  void endTransaction();
  bool isInTransaction() const;

  // Runs `callback` once no root transaction is held: at once on the calling
  // thread when none is held now, else on the thread that ends the root
  // transaction, right after it did (without any lock held). For shutdown
  // sequences that must outlast every keep-alive; the callback should only
  // queue work.
  void whenNoTransaction(std::function<void()> callback);

 private:
  struct State;
  std::shared_ptr<State> state_;
};

}  // namespace platform
