// AssetAccessSession: one open access session on a recording: the token
// handed to the client, the recording, the client's connection (none for a
// session the daemon opens for itself) and the keep-alive transaction that
// lasts as long as the session is open.
//
// Immutable once made; owned by the session registry (and, while a close is
// under way, by the service's closing list) through std::shared_ptr. Sessions
// are compared by identity. Readable from any thread.
#pragma once

#include <chrono>
#include <memory>
#include <string>

#include "Quorvel/service/RCSSavedRecordingAccessToken.h"
#include "platform/URL.h"
#include "platform/dbus/Connection.h"
#include "quorveld/RCSXPCTransaction.h"

namespace quorvel {

class AssetAccessSession {
 public:
  AssetAccessSession(RCSSavedRecordingAccessToken accessToken, platform::URL compositionAVURL,
                     std::shared_ptr<platform::Connection> xpcConnection,
                     std::shared_ptr<RCSXPCTransaction> xpcTransaction);

  const RCSSavedRecordingAccessToken& accessToken() const { return _accessToken; }
  const platform::URL& compositionAVURL() const { return _compositionAVURL; }
  const std::shared_ptr<platform::Connection>& xpcConnection() const { return _xpcConnection; }
  const std::shared_ptr<RCSXPCTransaction>& xpcTransaction() const { return _xpcTransaction; }
  // When the session was made (the wall clock, for listings).
  std::chrono::system_clock::time_point openedAt() const { return _openedAt; }

  // "<AssetAccessSession 0x…> <token's debug description>"
  std::string debugDescription() const;

 private:
  const RCSSavedRecordingAccessToken _accessToken;
  const platform::URL _compositionAVURL;
  const std::shared_ptr<platform::Connection> _xpcConnection;
  const std::shared_ptr<RCSXPCTransaction> _xpcTransaction;
  const std::chrono::system_clock::time_point _openedAt = std::chrono::system_clock::now();
};

}  // namespace quorvel
