// The client side of the service contract, on sdbus-c++.
//
// The proxy owns its bus connection and runs that connection's event loop on
// a thread of its own; every reply and the exporting-set signal arrive there.
// Blocking helpers are the asynchronous calls plus a promise, so only the
// event-loop thread ever reads from the bus.
#include "Quorvel/service/SavedRecordingServiceClient.h"

#include <sdbus-c++/sdbus-c++.h>

#include <chrono>
#include <future>
#include <mutex>

#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"

namespace quorvel {
namespace {

using TokenStruct = sdbus::Struct<std::string, std::int32_t, std::string, std::string>;

// Prepare requests may wait behind a closing session or a finalization for
// as long as that takes: no practical limit.
constexpr std::chrono::microseconds kNoTimeout = std::chrono::hours(24 * 365);

platform::Error errorFromReply(const sdbus::Error& error) {
  return RCSErrorFromDBusError(error.getName(), error.getMessage());
}

platform::Error malformedReply(std::string_view method, std::string_view what) {
  return platform::Error(RCSDBusErrorGeneric, 0,
                         fmt::format("malformed reply to {}: {}", method, what));
}

}  // namespace

struct SavedRecordingServiceClient::Impl {
  std::unique_ptr<sdbus::IProxy> proxy;
  std::mutex handlerMutex;
  std::function<void()> exportingChangedHandler;
  std::function<void(const std::string&)> accessSessionsChangedHandler;

  sdbus::MethodCall call(const char* method) {
    return proxy->createMethodCall(RCSSavedRecordingServiceInterfaceName, method);
  }

  // Sends `message`; `onReply` gets the reply or the error, exactly once.
  template <class OnReply>
  void send(sdbus::MethodCall& message, OnReply onReply, std::chrono::microseconds timeout = {}) {
    auto shared = std::make_shared<OnReply>(std::move(onReply));
    proxy->callMethod(
        message,
        [shared](sdbus::MethodReply& reply, const sdbus::Error* error) { (*shared)(reply, error); },
        static_cast<std::uint64_t>(timeout.count()));
  }

  void sendWithoutReply(sdbus::MethodCall& message) {
    message.dontExpectReply();
    proxy->callMethod(message);
  }

  void prepare(const char* method, sdbus::MethodCall message, AccessRequestHandler handler) {
    if (!handler) {
      sendWithoutReply(message);
      return;
    }
    send(
        message,
        [method, handler = std::move(handler)](sdbus::MethodReply& reply,
                                               const sdbus::Error* error) mutable {
          if (error) return handler(std::nullopt, errorFromReply(*error));
          TokenStruct wire;
          try {
            reply >> wire;
          } catch (const sdbus::Error& e) {
            return handler(std::nullopt, malformedReply(method, e.getMessage()));
          }
          const RCSSavedRecordingAccessToken::Tuple tuple{wire.get<0>(), wire.get<1>(),
                                                          wire.get<2>(), wire.get<3>()};
          // No token and no error: access was not granted (an export whose
          // recording could not be finalized).
          if (tuple == RCSSavedRecordingAccessToken::noTokenTuple())
            return handler(std::nullopt, std::nullopt);
          auto token = RCSSavedRecordingAccessToken::fromTuple(tuple);
          if (!token) return handler(std::nullopt, malformedReply(method, "not a token"));
          handler(std::move(token), std::nullopt);
        },
        kNoTimeout);
  }

  void complete(sdbus::MethodCall message, CompletionHandler handler) {
    if (!handler) {
      sendWithoutReply(message);
      return;
    }
    send(message,
         [handler = std::move(handler)](sdbus::MethodReply&, const sdbus::Error* error) mutable {
           if (error) return handler(errorFromReply(*error));
           handler(std::nullopt);
         });
  }
};

platform::Result<std::unique_ptr<SavedRecordingServiceClient>> SavedRecordingServiceClient::connect(
    const std::string& busAddress) {
  return connect(busAddress, Options());
}

platform::Result<std::unique_ptr<SavedRecordingServiceClient>> SavedRecordingServiceClient::connect(
    const std::string& busAddress, Options options) {
  try {
    auto connection = busAddress.empty() ? sdbus::createSessionBusConnection()
                                         : sdbus::createSessionBusConnectionWithAddress(busAddress);
    auto impl = std::make_unique<Impl>();
    impl->proxy = sdbus::createProxy(std::move(connection), RCSSavedRecordingServiceMachServiceName,
                                     RCSSavedRecordingServiceObjectPath);
    Impl* raw = impl.get();
    impl->proxy->registerSignalHandler(
        RCSSavedRecordingServiceInterfaceName,
        RCSavedRecordingServiceDidChangeExportingCompositionAVURLsDistributedNotification,
        [raw](sdbus::Signal&) {
          std::function<void()> handler;
          {
            std::lock_guard lock(raw->handlerMutex);
            handler = raw->exportingChangedHandler;
          }
          if (handler) handler();
        });
    if (options.watchAccessSessions) {
      impl->proxy->registerSignalHandler(RCSSavedRecordingServiceSessionsInterfaceName,
                                         RCSSignalAccessSessionsChanged,
                                         [raw](sdbus::Signal& signal) {
                                           std::string url;
                                           signal >> url;
                                           std::function<void(const std::string&)> handler;
                                           {
                                             std::lock_guard lock(raw->handlerMutex);
                                             handler = raw->accessSessionsChangedHandler;
                                           }
                                           if (handler) handler(url);
                                         });
    }
    impl->proxy->finishRegistration();
    return std::unique_ptr<SavedRecordingServiceClient>(
        new SavedRecordingServiceClient(std::move(impl)));
  } catch (const sdbus::Error& error) {
    return platform::fail(platform::Error(
        error.getName(), 0,
        fmt::format("cannot connect to {}: {}", busAddress.empty() ? "the session bus" : busAddress,
                    error.getMessage())));
  }
}

SavedRecordingServiceClient::SavedRecordingServiceClient(std::unique_ptr<Impl> impl)
    : impl_(std::move(impl)) {}

SavedRecordingServiceClient::~SavedRecordingServiceClient() = default;

void SavedRecordingServiceClient::prepareToCaptureToCompositionAVURL(const platform::URL& url,
                                                                     AccessRequestHandler handler) {
  auto message = impl_->call(RCSMethodPrepareToCapture);
  message << url.absoluteString();
  impl_->prepare(RCSMethodPrepareToCapture, std::move(message), std::move(handler));
}

void SavedRecordingServiceClient::prepareToPreviewCompositionAVURL(const platform::URL& url,
                                                                   AccessRequestHandler handler) {
  auto message = impl_->call(RCSMethodPrepareToPreview);
  message << url.absoluteString();
  impl_->prepare(RCSMethodPrepareToPreview, std::move(message), std::move(handler));
}

void SavedRecordingServiceClient::prepareToExportCompositionAVURL(const platform::URL& url,
                                                                  bool cacheWaveform,
                                                                  AccessRequestHandler handler) {
  auto message = impl_->call(RCSMethodPrepareToExport);
  message << url.absoluteString() << cacheWaveform;
  impl_->prepare(RCSMethodPrepareToExport, std::move(message), std::move(handler));
}

void SavedRecordingServiceClient::prepareToTrimCompositionAVURL(const platform::URL& url,
                                                                AccessRequestHandler handler) {
  auto message = impl_->call(RCSMethodPrepareToTrim);
  message << url.absoluteString();
  impl_->prepare(RCSMethodPrepareToTrim, std::move(message), std::move(handler));
}

void SavedRecordingServiceClient::endAccessSessionWithToken(
    const RCSSavedRecordingAccessToken& token) {
  auto message = impl_->call(RCSMethodEndAccessSession);
  auto [name, type, url, identifier] = token.toTuple();
  message << TokenStruct(name, type, url, identifier);
  impl_->sendWithoutReply(message);
}

void SavedRecordingServiceClient::disableOrphanedFragmentCleanupForCompositionAVURL(
    const platform::URL& url, CompletionHandler handler) {
  auto message = impl_->call(RCSMethodDisableOrphanedFragmentCleanup);
  message << url.absoluteString();
  impl_->complete(std::move(message), std::move(handler));
}

void SavedRecordingServiceClient::enableOrphanedFragmentCleanupForCompositionAVURL(
    const platform::URL& url) {
  auto message = impl_->call(RCSMethodEnableOrphanedFragmentCleanup);
  message << url.absoluteString();
  impl_->sendWithoutReply(message);
}

void SavedRecordingServiceClient::disableOrphanHandlingWithCompletionBlock(
    CompletionHandler handler) {
  impl_->complete(impl_->call(RCSMethodDisableOrphanHandling), std::move(handler));
}

void SavedRecordingServiceClient::enableOrphanHandlingWithCompletionBlock(
    CompletionHandler handler) {
  impl_->complete(impl_->call(RCSMethodEnableOrphanHandling), std::move(handler));
}

void SavedRecordingServiceClient::fetchExportingCompositionAVURLs(URLSetHandler handler) {
  auto message = impl_->call(RCSMethodFetchExportingCompositionAVURLs);
  if (!handler) {
    impl_->sendWithoutReply(message);
    return;
  }
  impl_->send(message, [handler = std::move(handler)](sdbus::MethodReply& reply,
                                                      const sdbus::Error* error) mutable {
    if (error) return handler(platform::fail(errorFromReply(*error)));
    std::vector<std::string> strings;
    try {
      reply >> strings;
    } catch (const sdbus::Error& e) {
      return handler(
          platform::fail(malformedReply(RCSMethodFetchExportingCompositionAVURLs, e.getMessage())));
    }
    std::vector<platform::URL> urls;
    for (const auto& string : strings) {
      auto url = platform::URL::fileURLFromString(string);
      if (!url) {
        return handler(platform::fail(
            malformedReply(RCSMethodFetchExportingCompositionAVURLs, "not a file URL: " + string)));
      }
      urls.push_back(std::move(*url));
    }
    handler(std::move(urls));
  });
}

namespace {

template <class Start>
platform::Result<RCSSavedRecordingAccessToken> waitForToken(Start start) {
  std::promise<platform::Result<RCSSavedRecordingAccessToken>> promise;
  auto future = promise.get_future();
  start([&promise](std::optional<RCSSavedRecordingAccessToken> token,
                   std::optional<platform::Error> error) {
    if (token) {
      promise.set_value(std::move(*token));
    } else {
      promise.set_value(platform::fail(error.value_or(platform::Error(
          RCSDBusErrorGeneric, 0, "no access was granted: the recording could not be finalized"))));
    }
  });
  return future.get();
}

template <class Start>
platform::Status waitForCompletion(Start start) {
  std::promise<platform::Status> promise;
  auto future = promise.get_future();
  start([&promise](std::optional<platform::Error> error) {
    if (error) {
      promise.set_value(platform::fail(std::move(*error)));
    } else {
      promise.set_value(platform::Status());
    }
  });
  return future.get();
}

}  // namespace

platform::Result<RCSSavedRecordingAccessToken> SavedRecordingServiceClient::prepareToCapture(
    const platform::URL& url) {
  return waitForToken(
      [&](AccessRequestHandler h) { prepareToCaptureToCompositionAVURL(url, std::move(h)); });
}

platform::Result<RCSSavedRecordingAccessToken> SavedRecordingServiceClient::prepareToPreview(
    const platform::URL& url) {
  return waitForToken(
      [&](AccessRequestHandler h) { prepareToPreviewCompositionAVURL(url, std::move(h)); });
}

platform::Result<RCSSavedRecordingAccessToken> SavedRecordingServiceClient::prepareToExport(
    const platform::URL& url, bool cacheWaveform) {
  return waitForToken([&](AccessRequestHandler h) {
    prepareToExportCompositionAVURL(url, cacheWaveform, std::move(h));
  });
}

platform::Result<RCSSavedRecordingAccessToken> SavedRecordingServiceClient::prepareToTrim(
    const platform::URL& url) {
  return waitForToken(
      [&](AccessRequestHandler h) { prepareToTrimCompositionAVURL(url, std::move(h)); });
}

platform::Status SavedRecordingServiceClient::disableOrphanedFragmentCleanup(
    const platform::URL& url) {
  return waitForCompletion([&](CompletionHandler h) {
    disableOrphanedFragmentCleanupForCompositionAVURL(url, std::move(h));
  });
}

platform::Status SavedRecordingServiceClient::disableOrphanHandling() {
  return waitForCompletion(
      [&](CompletionHandler h) { disableOrphanHandlingWithCompletionBlock(std::move(h)); });
}

platform::Status SavedRecordingServiceClient::enableOrphanHandling() {
  return waitForCompletion(
      [&](CompletionHandler h) { enableOrphanHandlingWithCompletionBlock(std::move(h)); });
}

platform::Result<std::vector<platform::URL>>
SavedRecordingServiceClient::fetchExportingCompositionAVURLs() {
  std::promise<platform::Result<std::vector<platform::URL>>> promise;
  auto future = promise.get_future();
  fetchExportingCompositionAVURLs([&promise](platform::Result<std::vector<platform::URL>> urls) {
    promise.set_value(std::move(urls));
  });
  return future.get();
}

void SavedRecordingServiceClient::setExportingCompositionAVURLsChangedHandler(
    std::function<void()> handler) {
  std::lock_guard lock(impl_->handlerMutex);
  impl_->exportingChangedHandler = std::move(handler);
}

void SavedRecordingServiceClient::setAccessSessionsChangedHandler(
    std::function<void(const std::string&)> handler) {
  std::lock_guard lock(impl_->handlerMutex);
  impl_->accessSessionsChangedHandler = std::move(handler);
}

namespace {

using SessionStruct =
    sdbus::Struct<std::string, std::int32_t, std::string, std::string, std::int64_t, std::string,
                  std::uint32_t, std::uint32_t, std::string>;
using RequestStruct = sdbus::Struct<std::string, std::int32_t, std::string, std::int64_t,
                                    std::string, std::uint32_t, std::uint32_t, std::string>;

std::chrono::system_clock::time_point fromMicroseconds(std::int64_t microseconds) {
  return std::chrono::system_clock::time_point(std::chrono::microseconds(microseconds));
}

// Calls a listing method and reads its array of `Wire` with `convert`.
template <class Wire, class Convert>
platform::Result<std::vector<SavedRecordingServiceClient::AccessHolder>> list(sdbus::IProxy& proxy,
                                                                              const char* method,
                                                                              Convert convert) {
  std::promise<platform::Result<std::vector<SavedRecordingServiceClient::AccessHolder>>> promise;
  auto future = promise.get_future();
  auto message = proxy.createMethodCall(RCSSavedRecordingServiceSessionsInterfaceName, method);
  proxy.callMethod(message, [&](sdbus::MethodReply& reply, const sdbus::Error* error) {
    if (error) return promise.set_value(platform::fail(errorFromReply(*error)));
    std::vector<Wire> wire;
    try {
      reply >> wire;
    } catch (const sdbus::Error& e) {
      return promise.set_value(platform::fail(malformedReply(method, e.getMessage())));
    }
    std::vector<SavedRecordingServiceClient::AccessHolder> holders;
    holders.reserve(wire.size());
    for (const Wire& entry : wire) holders.push_back(convert(entry));
    promise.set_value(std::move(holders));
  });
  return future.get();
}

}  // namespace

platform::Result<std::vector<SavedRecordingServiceClient::AccessHolder>>
SavedRecordingServiceClient::listAccessSessions() {
  return list<SessionStruct>(*impl_->proxy, RCSMethodListAccessSessions,
                             [](const SessionStruct& entry) {
                               return AccessHolder{.accessName = entry.get<0>(),
                                                   .accessType = entry.get<1>(),
                                                   .compositionAVURL = entry.get<2>(),
                                                   .state = entry.get<3>(),
                                                   .since = fromMicroseconds(entry.get<4>()),
                                                   .busName = entry.get<5>(),
                                                   .pid = entry.get<6>(),
                                                   .uid = entry.get<7>(),
                                                   .command = entry.get<8>()};
                             });
}

platform::Result<std::vector<SavedRecordingServiceClient::AccessHolder>>
SavedRecordingServiceClient::listDeferredRequests() {
  return list<RequestStruct>(*impl_->proxy, RCSMethodListDeferredRequests,
                             [](const RequestStruct& entry) {
                               return AccessHolder{.accessName = entry.get<0>(),
                                                   .accessType = entry.get<1>(),
                                                   .compositionAVURL = entry.get<2>(),
                                                   .state = "waiting",
                                                   .since = fromMicroseconds(entry.get<3>()),
                                                   .busName = entry.get<4>(),
                                                   .pid = entry.get<5>(),
                                                   .uid = entry.get<6>(),
                                                   .command = entry.get<7>()};
                             });
}

}  // namespace quorvel
