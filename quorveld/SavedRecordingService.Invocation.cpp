// Turning bus calls into requests.
//
// Each method of the exported interface delivers its call here, on the
// delivery thread. The call is decoded into the request's arguments (a
// string that is not a file URL or absolute path is a missing URL; the "no
// token" tuple is a missing token; a call sent without expecting a reply is a
// missing reply callback) and the request is invoked with a reply callback
// that owns the call and answers it. Nothing else happens here: no change of
// queue, no filtering.
#include <fmt/format.h>

#include "Quorvel/service/RCSSavedRecordingServiceConnection.h"
#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"
#include "platform/Log.h"
#include "platform/MainQueue.h"
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

}  // namespace

platform::InterfaceDescription SavedRecordingService::_exportedInterface() {
  platform::InterfaceDescription interface = RCSSavedRecordingServiceConnection::serviceInterface();
  for (auto& method : interface.methods) {
    method.handler = [weak = weak_from_this()](platform::IncomingCall call) {
      // A call that arrives while the service is gone is answered by the
      // call's own guard ("no reply was produced").
      if (auto service = weak.lock()) {
        auto connection = call.connection();
        service->connectionHandleInvocation(connection, std::move(call));
      }
    };
  }
  // Launch events: each named event is posted in-process on the main queue.
  interface.matches.push_back(platform::SignalMatch{
      .interface = kLaunchEventInterface,
      .member = kLaunchEventMember,
      .signature = "s",
      .handler =
          [weak = weak_from_this()](const platform::BusValues& arguments) {
            platform::mainQueue().async([weak, name = arguments.at(0).asString()] {
              if (auto service = weak.lock()) service->_handleLaunchEvent(name);
            });
          },
      .mismatchHandler =
          [weak = weak_from_this()] {
            platform::mainQueue().async([weak] {
              if (auto service = weak.lock()) service->_handleLaunchEvent(std::nullopt);
            });
          },
  });
  return interface;
}

void SavedRecordingService::connectionHandleInvocation(
    const std::shared_ptr<platform::Connection>& /*connection*/,
    platform::IncomingCall invocation) {
  const std::string member = invocation.member();
  if (member == RCSMethodPrepareToCapture) {
    auto url = urlArgument(invocation);
    prepareToCaptureToCompositionAVURL(std::move(url),
                                       accessRequestHandlerFor(std::move(invocation)));
  } else if (member == RCSMethodPrepareToPreview) {
    auto url = urlArgument(invocation);
    prepareToPreviewCompositionAVURL(std::move(url),
                                     accessRequestHandlerFor(std::move(invocation)));
  } else if (member == RCSMethodPrepareToExport) {
    auto url = urlArgument(invocation);
    bool cacheWaveform = invocation.arguments().at(1).asBool();
    prepareToExportCompositionAVURL(std::move(url), cacheWaveform,
                                    accessRequestHandlerFor(std::move(invocation)));
  } else if (member == RCSMethodPrepareToTrim) {
    auto url = urlArgument(invocation);
    prepareToTrimCompositionAVURL(std::move(url), accessRequestHandlerFor(std::move(invocation)));
  } else if (member == RCSMethodEndAccessSession) {
    // "No token" is a missing token; a tuple that names no possible token
    // (an identifier that is not a UUID) is an unknown one, like a token
    // whose session has ended.
    auto tuple = tokenArgument(invocation);
    if (tuple == RCSSavedRecordingAccessToken::noTokenTuple()) {
      endAccessSessionWithToken(std::nullopt);
    } else if (auto token = RCSSavedRecordingAccessToken::fromTuple(tuple)) {
      endAccessSessionWithToken(std::move(token));
    } else {
      QV_LOG(platform::kLogLevelDebug, "Ending access session: {}.",
             RCSSavedRecordingAccessToken::debugDescriptionOfTuple(tuple));
    }
  } else if (member == RCSMethodDisableOrphanedFragmentCleanup) {
    auto url = urlArgument(invocation);
    disableOrphanedFragmentCleanupForCompositionAVURL(std::move(url),
                                                      completionHandlerFor(std::move(invocation)));
  } else if (member == RCSMethodEnableOrphanedFragmentCleanup) {
    enableOrphanedFragmentCleanupForCompositionAVURL(urlArgument(invocation));
  } else if (member == RCSMethodDisableOrphanHandling) {
    disableOrphanHandlingWithCompletionBlock(completionHandlerFor(std::move(invocation)));
  } else if (member == RCSMethodEnableOrphanHandling) {
    enableOrphanHandlingWithCompletionBlock(completionHandlerFor(std::move(invocation)));
  } else if (member == RCSMethodFetchExportingCompositionAVURLs) {
    fetchExportingCompositionAVURLs(urlSetHandlerFor(std::move(invocation)));
  }
  // The listener only delivers the interface's own methods with their own
  // signatures, so there is no other case.
}

}  // namespace quorvel
