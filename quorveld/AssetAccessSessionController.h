// AssetAccessSessionController: the session registry. Holds every open
// access session, grouped by recording, decides whether a new session is
// compatible with the ones open on its recording (exclusive sessions need
// the recording to themselves; shared ones only exclude exclusive ones), and
// creates each session's token and keep-alive transaction.
//
// Owned by the service. openAccessSession… and closeSession must be called
// on the service serial queue; they change the table inside synchronous
// blocks on the registry's own queue. The lookups read the table without
// that queue and must also be called on the service serial queue, the only
// thread that changes it. The registry does not know that queue: debug
// builds bind a sequence checker to the queue of the first open, close or
// lookup and abort when a later one comes from elsewhere. dumpState() and
// stateDescription() may be called from any thread (the main queue): they
// read the table inside the registry's queue.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "Quorvel/service/RCSSavedRecordingAccessToken.h"
#include "platform/Error.h"
#include "platform/SequenceChecker.h"
#include "platform/SerialQueue.h"
#include "platform/URL.h"
#include "platform/dbus/Connection.h"
#include "quorveld/AssetAccessSession.h"

namespace quorvel {

using AssetAccessSessionList = std::vector<std::shared_ptr<AssetAccessSession>>;

class AssetAccessSessionController {
 public:
  AssetAccessSessionController();

  // Opens a session, or refuses it with error 301 when it conflicts with a
  // session open on the recording. `error`, when given, receives the
  // refusal (nullopt when the session was made).
  std::shared_ptr<AssetAccessSession> openAccessSessionWithName(
      const std::string& name, std::shared_ptr<platform::Connection> xpcConnection,
      const platform::URL& compositionAVURL, bool exclusive,
      std::optional<platform::Error>* error = nullptr);
  // Removes the session from its recording's list, then ends its
  // transaction (also when it was not listed).
  void closeSession(const std::shared_ptr<AssetAccessSession>& session);

  // The first session whose token equals `token`, or nullptr.
  std::shared_ptr<AssetAccessSession> activeSessionWithAccessToken(
      const RCSSavedRecordingAccessToken& token) const;
  // The sessions whose token names `compositionAVURL`: the registry's own
  // list, valid until the next open or close.
  const AssetAccessSessionList& activeSessionsWithWithCompositionAVURL(
      const platform::URL& compositionAVURL) const;
  AssetAccessSessionList activeSessionsWithXPCConnection(
      const std::shared_ptr<platform::Connection>& xpcConnection) const;
  AssetAccessSessionList activeSessions() const;

  // Prints the open sessions to standard error.
  void dumpState();
  // What dumpState() prints.
  std::string stateDescription();

  std::string description() const;

 private:
  // Walk the table: on the service serial queue (the lookups) or inside the
  // registry's queue (the dump).
  void _enumerateActiveSessionsWithBlock(
      const std::function<void(const std::shared_ptr<AssetAccessSession>&, bool& stop)>& visitor)
      const;
  AssetAccessSessionList _sessionsMatchingPredicate(
      const std::function<bool(const AssetAccessSession&)>& predicate) const;

  // Any thread: the registry's queue and the checker of the service queue.
  platform::SerialQueue _serialQueue;
  platform::SequenceChecker _serviceSequenceChecker;

  // Service serial queue only, changed inside the registry's queue (which is
  // also where the dump reads them):
  // Recording -> its sessions in order of opening. A recording's list stays
  // once made, even when empty. Keys in insertion order for a stable walk.
  std::vector<platform::URL> _recordingsInOrder;
  std::unordered_map<platform::URL, AssetAccessSessionList> _clientSessionsByCompositionAVURL;
};

}  // namespace quorvel
