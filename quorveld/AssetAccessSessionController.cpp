// The session registry.
//
// Opening runs the conflict test and the insertion in one synchronous block
// on the registry's queue, so no other open or close can come between them.
// Every caller is on the service serial queue, so the lookups, which read the
// table without the registry's queue, never overlap a change. The debug dump
// comes from the main queue instead and reads inside the registry's queue.
#include "quorveld/AssetAccessSessionController.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdio>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"

namespace quorvel {

AssetAccessSessionController::AssetAccessSessionController()
    : _serialQueue("AssetAccessSessionController") {}

std::string AssetAccessSessionController::description() const {
  return fmt::format("<AssetAccessSessionController {}>", static_cast<const void*>(this));
}

std::shared_ptr<AssetAccessSession> AssetAccessSessionController::openAccessSessionWithName(
    const std::string& name, std::shared_ptr<platform::Connection> xpcConnection,
    const platform::URL& compositionAVURL, bool exclusive, std::optional<platform::Error>* error) {
  QV_DCHECK_CALLED_ON_VALID_SEQUENCE(_serviceSequenceChecker);
  std::shared_ptr<AssetAccessSession> session;
  _serialQueue.sync([&] {
    auto list = _clientSessionsByCompositionAVURL.find(compositionAVURL);
    if (list != _clientSessionsByCompositionAVURL.end()) {
      bool conflicts = exclusive ? !list->second.empty()
                                 : std::ranges::any_of(list->second, [](const auto& open) {
                                     return open->accessToken().accessType() ==
                                            RCSSavedRecordingAccessTypeExclusive;
                                   });
      if (conflicts) return;
    }
    auto transaction = RCSXPCTransaction::initWithName(fmt::format(
        "Opening access session for compositionAVURL: {}, connection: {}", compositionAVURL.path(),
        xpcConnection ? xpcConnection->description() : std::string("(null)")));
    transaction->beginTransaction();
    auto token = RCSSavedRecordingAccessToken::tokenWithName(
        name, exclusive ? RCSSavedRecordingAccessTypeExclusive : RCSSavedRecordingAccessTypeShared,
        compositionAVURL);
    session = std::make_shared<AssetAccessSession>(
        std::move(token), compositionAVURL, std::move(xpcConnection), std::move(transaction));
    if (list == _clientSessionsByCompositionAVURL.end()) {
      _recordingsInOrder.push_back(compositionAVURL);
      _clientSessionsByCompositionAVURL.emplace(compositionAVURL, AssetAccessSessionList{session});
    } else {
      list->second.push_back(session);
    }
  });
  if (error) {
    *error = session ? std::nullopt
                     : std::optional(RCSSavedRecordingServiceError(
                           RCSSavedRecordingServiceErrorConflictingSession));
  }
  return session;
}

void AssetAccessSessionController::closeSession(
    const std::shared_ptr<AssetAccessSession>& session) {
  QV_DCHECK_CALLED_ON_VALID_SEQUENCE(_serviceSequenceChecker);
  if (!session) return;
  _serialQueue.sync([&] {
    auto list = _clientSessionsByCompositionAVURL.find(session->compositionAVURL());
    if (list == _clientSessionsByCompositionAVURL.end()) return;
    std::erase(list->second, session);
  });
  session->xpcTransaction()->endTransaction();
}

void AssetAccessSessionController::_enumerateActiveSessionsWithBlock(
    const std::function<void(const std::shared_ptr<AssetAccessSession>&, bool& stop)>& visitor)
    const {
  for (const auto& url : _recordingsInOrder) {
    for (const auto& session : _clientSessionsByCompositionAVURL.at(url)) {
      bool stop = false;
      visitor(session, stop);
      if (stop) return;
    }
  }
}

AssetAccessSessionList AssetAccessSessionController::_sessionsMatchingPredicate(
    const std::function<bool(const AssetAccessSession&)>& predicate) const {
  AssetAccessSessionList matches;
  _enumerateActiveSessionsWithBlock([&](const auto& session, bool&) {
    if (predicate(*session)) matches.push_back(session);
  });
  return matches;
}

std::shared_ptr<AssetAccessSession> AssetAccessSessionController::activeSessionWithAccessToken(
    const RCSSavedRecordingAccessToken& token) const {
  QV_DCHECK_CALLED_ON_VALID_SEQUENCE(_serviceSequenceChecker);
  // A token names its session's recording, so only that recording's list
  // can hold it.
  const std::optional<platform::URL>& url = token.compositionAVURL();
  if (!url) return nullptr;
  for (const auto& session : activeSessionsWithWithCompositionAVURL(*url)) {
    if (session->accessToken() == token) return session;
  }
  return nullptr;
}

const AssetAccessSessionList& AssetAccessSessionController::activeSessionsWithWithCompositionAVURL(
    const platform::URL& compositionAVURL) const {
  QV_DCHECK_CALLED_ON_VALID_SEQUENCE(_serviceSequenceChecker);
  // Every session is listed under the URL its token names, in the order of
  // the walk.
  static const AssetAccessSessionList kNone;
  auto list = _clientSessionsByCompositionAVURL.find(compositionAVURL);
  return list == _clientSessionsByCompositionAVURL.end() ? kNone : list->second;
}

AssetAccessSessionList AssetAccessSessionController::activeSessionsWithXPCConnection(
    const std::shared_ptr<platform::Connection>& xpcConnection) const {
  QV_DCHECK_CALLED_ON_VALID_SEQUENCE(_serviceSequenceChecker);
  return _sessionsMatchingPredicate([&](const AssetAccessSession& session) {
    return xpcConnection && session.xpcConnection() == xpcConnection;
  });
}

AssetAccessSessionList AssetAccessSessionController::activeSessions() const {
  QV_DCHECK_CALLED_ON_VALID_SEQUENCE(_serviceSequenceChecker);
  return _sessionsMatchingPredicate([](const AssetAccessSession&) { return true; });
}

std::string AssetAccessSessionController::stateDescription() {
  // Group by the URL each token names, in walk order.
  std::vector<std::pair<platform::URL, AssetAccessSessionList>> byURL;
  _serialQueue.sync([&] {
    _enumerateActiveSessionsWithBlock([&](const auto& session, bool&) {
      const platform::URL& url = *session->accessToken().compositionAVURL();
      auto entry = std::ranges::find(byURL, url, &decltype(byURL)::value_type::first);
      if (entry == byURL.end()) {
        byURL.emplace_back(url, AssetAccessSessionList{session});
      } else {
        entry->second.push_back(session);
      }
    });
  });

  std::string self = description();
  if (byURL.empty()) return fmt::format("[{}] *** No Active Sessions ***\n", self);
  std::string text =
      fmt::format("[{}] *** Active Sessions (by compositionAVURL/URL) ***\n\n", self);
  for (const auto& [url, sessions] : byURL) {
    std::string descriptions;
    for (const auto& session : sessions) {
      if (!descriptions.empty()) descriptions += "; ";
      descriptions += session->debugDescription();
    }
    auto composition =
        RCCompositionController::compositionControllerForComposedAVURL(url)->composition();
    text += fmt::format("compositionAVURL = {}\n", url.absoluteString());
    text += fmt::format("\tActive Sessions ({}) = {}\n", sessions.size(), descriptions);
    text += fmt::format("\tComposition Metadata = {}\n\n\n",
                        composition ? composition->debugDescription() : std::string("(null)"));
  }
  text += std::string(41, '*') + "\n";
  return text;
}

void AssetAccessSessionController::dumpState() {
  std::string text = stateDescription();
  std::fwrite(text.data(), 1, text.size(), stderr);
  std::fflush(stderr);
}

}  // namespace quorvel
