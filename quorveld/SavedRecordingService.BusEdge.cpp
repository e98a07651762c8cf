// Decoding: a string that is not a file URL or absolute path is a missing
// URL; the "no token" tuple is a missing token, and a tuple that names no
// possible token (an identifier that is not a UUID) an unknown one, like a
// token whose session has ended; a call sent without expecting a reply is a
// missing reply callback. The calling connection is passed to the request
// explicitly. Each reply callback owns its call and answers it.
#include "quorveld/SavedRecordingService.BusEdge.h"

#include <fmt/format.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <string_view>
#include <utility>

#include "Quorvel/service/RCSSavedRecordingServiceConnection.h"
#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"
#include "platform/Log.h"
#include "platform/MainQueue.h"
#include "platform/Misuse.h"
#include "quorveld/SavedRecordingService.h"

namespace quorvel {

namespace {

constexpr std::string_view kBusErrorPrefix = "org.freedesktop.DBus.Error.";
// The broadcast that stands for the platform's launch events.
constexpr const char* kLaunchEventInterface = "org.quorvel.Events1";
constexpr const char* kLaunchEventMember = "Event";

void answerError(platform::IncomingCall& call, const platform::Error& error) {
  if (error.domain().starts_with(kBusErrorPrefix)) {
    call.replyError(error.domain(), error.localizedDescription());
    return;
  }
  RCSDBusError busError = RCSDBusErrorFromError(error);
  call.replyError(busError.name, busError.message);
}

std::optional<platform::URL> urlArgument(const platform::IncomingCall& call) {
  return platform::URL::fromFileURLStringOrPath(call.arguments().at(0).asString());
}

RCSSavedRecordingAccessToken::Tuple tokenArgument(const platform::IncomingCall& call) {
  const auto& fields = call.arguments().at(0).fields();
  return {fields.at(0).asString(), fields.at(1).asInt32(), fields.at(2).asString(),
          fields.at(3).asString()};
}

platform::BusValue tokenValue(const RCSSavedRecordingAccessToken::Tuple& tuple) {
  const auto& [name, type, url, identifier] = tuple;
  return platform::BusValue::structure({name, type, url, identifier});
}

SavedRecordingService::AccessRequestHandler accessRequestHandlerFor(platform::IncomingCall call) {
  if (call.noReplyExpected()) return {};
  return [call = std::move(call)](std::optional<RCSSavedRecordingAccessToken> token,
                                  std::optional<platform::Error> error) mutable {
    if (error) return answerError(call, *error);
    call.reply(
        {tokenValue(token ? token->toTuple() : RCSSavedRecordingAccessToken::noTokenTuple())});
  };
}

SavedRecordingService::CompletionHandler completionHandlerFor(platform::IncomingCall call) {
  if (call.noReplyExpected()) return {};
  return [call = std::move(call)](std::optional<platform::Error> error) mutable {
    if (error) return answerError(call, *error);
    call.reply();
  };
}

SavedRecordingService::URLSetHandler urlSetHandlerFor(platform::IncomingCall call) {
  if (call.noReplyExpected()) return {};
  return [call = std::move(call)](std::set<platform::URL> urls) mutable {
    std::vector<std::string> strings;
    strings.reserve(urls.size());
    for (const auto& url : urls) strings.push_back(url.absoluteString());
    call.reply({platform::BusValue(std::move(strings))});
  };
}

using Handler = void (*)(SavedRecordingService& service, platform::IncomingCall call);

// PrepareToCapture, PrepareToPreview and PrepareToTrim: a URL in, a token
// out, through the service's request `Request`.
template <auto Request>
void prepareAccess(SavedRecordingService& service, platform::IncomingCall call) {
  auto url = urlArgument(call);
  auto connection = call.connection();
  (service.*Request)(std::move(url), accessRequestHandlerFor(std::move(call)),
                     std::move(connection));
}

void prepareToExport(SavedRecordingService& service, platform::IncomingCall call) {
  auto url = urlArgument(call);
  const bool cacheWaveform = call.arguments().at(1).asBool();
  auto connection = call.connection();
  service.prepareToExportCompositionAVURL(std::move(url), cacheWaveform,
                                          accessRequestHandlerFor(std::move(call)),
                                          std::move(connection));
}

void endAccessSession(SavedRecordingService& service, platform::IncomingCall call) {
  auto tuple = tokenArgument(call);
  if (tuple == RCSSavedRecordingAccessToken::noTokenTuple()) {
    service.endAccessSessionWithToken(std::nullopt, call.connection());
  } else if (auto token = RCSSavedRecordingAccessToken::fromTuple(tuple)) {
    service.endAccessSessionWithToken(std::move(token), call.connection());
  } else {
    QV_LOG(platform::kLogLevelDebug, "Ending access session: {}.",
           RCSSavedRecordingAccessToken::debugDescriptionOfTuple(tuple));
  }
}

void disableOrphanedFragmentCleanup(SavedRecordingService& service, platform::IncomingCall call) {
  auto url = urlArgument(call);
  auto connection = call.connection();
  service.disableOrphanedFragmentCleanupForCompositionAVURL(
      std::move(url), completionHandlerFor(std::move(call)), std::move(connection));
}

void enableOrphanedFragmentCleanup(SavedRecordingService& service, platform::IncomingCall call) {
  service.enableOrphanedFragmentCleanupForCompositionAVURL(urlArgument(call), call.connection());
}

void disableOrphanHandling(SavedRecordingService& service, platform::IncomingCall call) {
  service.disableOrphanHandlingWithCompletionBlock(completionHandlerFor(std::move(call)));
}

void enableOrphanHandling(SavedRecordingService& service, platform::IncomingCall call) {
  service.enableOrphanHandlingWithCompletionBlock(completionHandlerFor(std::move(call)));
}

void fetchExportingCompositionAVURLs(SavedRecordingService& service, platform::IncomingCall call) {
  service.fetchExportingCompositionAVURLs(urlSetHandlerFor(std::move(call)));
}

// Microseconds since the Unix epoch, as D-Bus services give times.
std::int64_t microsecondsSinceEpoch(std::chrono::system_clock::time_point time) {
  return std::chrono::duration_cast<std::chrono::microseconds>(time.time_since_epoch()).count();
}

// Answers `call` with `listing`, each entry with its holder's credentials,
// asked of the listener once the snapshot is taken (never on the service
// queue's time). `withState` adds the state field of the session listing.
void replyWithHolders(SavedRecordingService& service, platform::IncomingCall call,
                      std::vector<SavedRecordingService::AccessListing> listing, bool withState) {
  // Each holder once: a client with many sessions is asked about once.
  std::vector<std::string> peers;
  const platform::Connection* last = nullptr;
  for (const auto& entry : listing) {
    if (!entry.connection || entry.connection.get() == last) continue;
    last = entry.connection.get();
    peers.push_back(entry.connection->uniqueName());
  }
  std::ranges::sort(peers);
  peers.erase(std::unique(peers.begin(), peers.end()), peers.end());
  auto listener = service.listener();
  auto answer = [call = std::move(call), listing = std::move(listing),
                 withState](platform::PeerCredentialsTable holders) mutable {
    // Built field by field and moved, never copied: a list of a thousand
    // sessions is nine thousand values.
    static const platform::PeerCredentials kNobody;
    std::vector<platform::BusValue> elements;
    elements.reserve(listing.size());
    for (auto& entry : listing) {
      std::string peer = entry.connection ? entry.connection->uniqueName() : std::string();
      const auto found = holders.find(peer);
      const platform::PeerCredentials& holder = found == holders.end() ? kNobody : found->second;
      std::vector<platform::BusValue> fields;
      fields.reserve(9);
      fields.emplace_back(std::move(entry.accessName));
      fields.emplace_back(std::int32_t(entry.exclusive ? RCSSavedRecordingAccessTypeExclusive
                                                       : RCSSavedRecordingAccessTypeShared));
      fields.emplace_back(entry.compositionAVURL.absoluteString());
      if (withState) fields.emplace_back(entry.state);
      fields.emplace_back(microsecondsSinceEpoch(entry.since));
      fields.emplace_back(std::move(peer));
      fields.emplace_back(holder.pid);
      fields.emplace_back(holder.uid);
      fields.emplace_back(holder.command);
      elements.push_back(platform::BusValue::structure(std::move(fields)));
    }
    platform::BusValues reply;
    reply.push_back(
        platform::BusValue::array(withState ? "(sissxsuus)" : "(sisxsuus)", std::move(elements)));
    call.reply(std::move(reply));
  };
  if (listener) {
    listener->credentialsOfPeers(std::move(peers), std::move(answer));
  } else {
    answer({});
  }
}

void listAccessSessions(SavedRecordingService& service, platform::IncomingCall call) {
  service.listAccessSessions(
      [self = service.shared_from_this(),
       call = std::move(call)](std::vector<SavedRecordingService::AccessListing> listing) mutable {
        replyWithHolders(*self, std::move(call), std::move(listing), /*withState=*/true);
      });
}

void listDeferredRequests(SavedRecordingService& service, platform::IncomingCall call) {
  service.listDeferredRequests(
      [self = service.shared_from_this(),
       call = std::move(call)](std::vector<SavedRecordingService::AccessListing> listing) mutable {
        replyWithHolders(*self, std::move(call), std::move(listing), /*withState=*/false);
      });
}

constexpr std::pair<std::string_view, Handler> kHandlers[] = {
    {RCSMethodPrepareToCapture,
     prepareAccess<&SavedRecordingService::prepareToCaptureToCompositionAVURL>},
    {RCSMethodPrepareToPreview,
     prepareAccess<&SavedRecordingService::prepareToPreviewCompositionAVURL>},
    {RCSMethodPrepareToExport, prepareToExport},
    {RCSMethodPrepareToTrim, prepareAccess<&SavedRecordingService::prepareToTrimCompositionAVURL>},
    {RCSMethodEndAccessSession, endAccessSession},
    {RCSMethodDisableOrphanedFragmentCleanup, disableOrphanedFragmentCleanup},
    {RCSMethodEnableOrphanedFragmentCleanup, enableOrphanedFragmentCleanup},
    {RCSMethodDisableOrphanHandling, disableOrphanHandling},
    {RCSMethodEnableOrphanHandling, enableOrphanHandling},
    {RCSMethodFetchExportingCompositionAVURLs, fetchExportingCompositionAVURLs},
    {RCSMethodListAccessSessions, listAccessSessions},
    {RCSMethodListDeferredRequests, listDeferredRequests},
};

Handler handlerFor(std::string_view method) {
  for (const auto& [name, handler] : kHandlers) {
    if (name == method) return handler;
  }
  return nullptr;
}

}  // namespace

platform::InterfaceDescription SavedRecordingServiceBusEdge::interfaceFor(
    std::weak_ptr<SavedRecordingService> service) {
  platform::InterfaceDescription interface = RCSSavedRecordingServiceConnection::serviceInterface();
  for (auto& method : interface.methods) {
    Handler handler = handlerFor(method.name);
    QV_MISUSE(handler == nullptr, "no handler for the method {}", method.name);
    method.handler = [service, handler](platform::IncomingCall call) {
      if (auto strong = service.lock()) handler(*strong, std::move(call));
    };
  }
  // Launch events: each named event is posted in-process on the main queue.
  interface.matches.push_back(platform::SignalMatch{
      .interface = kLaunchEventInterface,
      .member = kLaunchEventMember,
      .signature = "s",
      .handler =
          [service](const platform::BusValues& arguments) {
            platform::mainQueue().async([service, name = arguments.at(0).asString()] {
              if (auto strong = service.lock()) strong->_handleLaunchEvent(name);
            });
          },
      .mismatchHandler =
          [service] {
            platform::mainQueue().async([service] {
              if (auto strong = service.lock()) strong->_handleLaunchEvent(std::nullopt);
            });
          },
  });
  return interface;
}

}  // namespace quorvel
