// The service keeps answering on the real bus while media work is stuck: a
// fragment cleanup whose reading of a fragment hangs holds neither the bus
// thread nor the service queue. Run through a BusListener on a private bus,
// since only it runs queued service work on its own thread (the in-process
// listener never does), with clients that are real bus connections.
#include <gtest/gtest.h>
#include <sdbus-c++/sdbus-c++.h>

#include <future>

#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "Quorvel/service/SavedRecordingServiceClient.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
#include "platform/dbus/BusListener.h"
#include "tests/quorveld/ServiceFixture.h"
#include "tests/support/DelegatingMediaEngine.h"
#include "tests/support/TestBus.h"

namespace quorvel {
namespace {

// Once armed, holds every read of a fragment of the recording "Stuck" until
// released.
class StuckProbeEngine final : public testing::DelegatingMediaEngine {
 public:
  platform::Result<RCMediaProbe> probe(const platform::URL& url) override {
    bool hold = false;
    gate.update([&] {
      hold = armed && url.path().find("/Stuck.composition/") != std::string::npos;
      held += hold;
    });
    if (hold) gate.waitUntil([&] { return released; });
    return DelegatingMediaEngine::probe(url);
  }
  platform::testing::Gate gate;
  bool armed = false;     // guarded by gate
  int held = 0;           // guarded by gate
  bool released = false;  // guarded by gate
};

class ResponsivenessTest : public SessionTest {
 protected:
  std::shared_ptr<platform::Listener> makeListener(
      const std::string& serviceName, platform::InterfaceDescription interface) override {
    busListener_ = std::make_shared<platform::BusListener>(
        platform::BusListenerOptions{.busAddress = bus_.address(),
                                     .serviceName = serviceName,
                                     .objectPath = RCSSavedRecordingServiceObjectPath},
        std::move(interface));
    return busListener_;
  }
  void TearDown() override {
    engine_->gate.update([&] { engine_->released = true; });
    // The clients' disconnections reach the bus thread at some time after
    // the test body; stopping the listener first ends what they started, so
    // settling finds it all queued and no bus-thread block outlives the
    // service.
    if (busListener_) busListener_->stop();
    busListener_.reset();
    SessionTest::TearDown();
    RCUseInProcessMediaEngine();
  }

  using Token = std::optional<RCSSavedRecordingAccessToken>;
  // A preview request whose answer the test waits for.
  static std::future<Token> preview(SavedRecordingServiceClient& client, const platform::URL& url) {
    auto answer = std::make_shared<std::promise<Token>>();
    client.prepareToPreviewCompositionAVURL(url,
                                            [answer](Token token, std::optional<platform::Error>) {
                                              answer->set_value(std::move(token));
                                            });
    return answer->get_future();
  }
  template <class T>
  static bool answered(std::future<T>& future) {
    return future.wait_for(platform::testing::kWait) == std::future_status::ready;
  }
  platform::URL recording(const std::string& name) const {
    return platform::URL::fileURLWithPath((directory_ / name).string());
  }

  platform::testing::TestBus bus_;
  std::shared_ptr<platform::BusListener> busListener_;
  std::shared_ptr<StuckProbeEngine> engine_ = [] {
    auto engine = std::make_shared<StuckProbeEngine>();
    RCMediaEngine::setCurrent(engine);
    return engine;
  }();
};

TEST_F(ResponsivenessTest, AStuckFragmentReadHoldsOnlyItsOwnRecording) {
  ASSERT_TRUE(makeRecording("Stuck", {0.2, 0.2}));
  ASSERT_TRUE(makeRecording("Other", {0.2}));
  auto first = SavedRecordingServiceClient::connect(bus_.address());
  auto second = SavedRecordingServiceClient::connect(bus_.address());
  ASSERT_TRUE(first && second);
  engine_->gate.update([&] { engine_->armed = true; });
  auto stuck = preview(**first, recording("Stuck.m4a"));
  ASSERT_TRUE(engine_->gate.waitUntil([&] { return engine_->held > 0; }));

  // Another client is answered meanwhile, by the bus and by the service: a
  // ping, a preview of another recording read for the first time, and the
  // exporting set.
  auto bus = sdbus::createSessionBusConnectionWithAddress(bus_.address());
  auto proxy = sdbus::createProxy(*bus, RCSSavedRecordingServiceMachServiceName,
                                  RCSSavedRecordingServiceObjectPath);
  auto ping = proxy->createMethodCall("org.freedesktop.DBus.Peer", "Ping");
  EXPECT_NO_THROW(
      proxy->callMethod(ping, std::chrono::microseconds(platform::testing::kWait).count()));
  auto other = preview(**second, recording("Other.m4a"));
  ASSERT_TRUE(answered(other)) << [&] {
    std::string all;
    for (auto& line : lines()) all += line.text + "\n";
    return all;
  }();
  Token otherToken = other.get();
  ASSERT_TRUE(otherToken);
  std::promise<bool> fetched;
  (*second)->fetchExportingCompositionAVURLs(
      [&](platform::Result<std::vector<platform::URL>> urls) { fetched.set_value(bool(urls)); });
  auto fetch = fetched.get_future();
  ASSERT_TRUE(answered(fetch));
  EXPECT_TRUE(fetch.get());
  EXPECT_EQ(stuck.wait_for(std::chrono::seconds(0)), std::future_status::timeout);

  engine_->gate.update([&] { engine_->released = true; });
  ASSERT_TRUE(answered(stuck));
  Token stuckToken = stuck.get();
  ASSERT_TRUE(stuckToken);
  (*first)->endAccessSessionWithToken(*stuckToken);
  (*second)->endAccessSessionWithToken(*otherToken);
  ASSERT_TRUE(waitForLines("Finally closing access session", 2));
  // Healthy fragments are read once each, and never reported unreadable.
  EXPECT_TRUE(linesContaining("cannot be read").empty());
}

}  // namespace
}  // namespace quorvel
