#include "quorveld/AssetAccessSession.h"

#include <fmt/format.h>

namespace quorvel {

AssetAccessSession::AssetAccessSession(RCSSavedRecordingAccessToken accessToken,
                                       platform::URL compositionAVURL,
                                       std::shared_ptr<platform::Connection> xpcConnection,
                                       std::shared_ptr<RCSXPCTransaction> xpcTransaction)
    : _accessToken(std::move(accessToken)),
      _compositionAVURL(std::move(compositionAVURL)),
      _xpcConnection(std::move(xpcConnection)),
      _xpcTransaction(std::move(xpcTransaction)) {}

std::string AssetAccessSession::debugDescription() const {
  return fmt::format("<AssetAccessSession {}> {}", static_cast<const void*>(this),
                     _accessToken.debugDescription());
}

}  // namespace quorvel
