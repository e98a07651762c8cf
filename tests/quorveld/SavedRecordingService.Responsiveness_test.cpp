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
#include "tests/support/HeldMediaEngine.h"
#include "tests/support/TestBus.h"

namespace quorvel {
namespace {

class ResponsivenessTest : public SessionTest {
 public:
  std::shared_ptr<platform::Listener> makeListener(const std::string& serviceName,
                                                   platform::InterfaceDescription i) override {
    return busListener_ = std::make_shared<platform::BusListener>(
               platform::BusListenerOptions{.busAddress = bus_.address(),
                                            .serviceName = serviceName,
                                            .objectPath = RCSSavedRecordingServiceObjectPath},
               std::move(i));
  }
  void TearDown() override {
    engine_->open();
    // The clients' disconnections reach the bus thread at some time after
    // the test body; stopping the listener first ends what they started, so
    // settling finds it all queued and no bus-thread block outlives the
    // service.
    if (busListener_) busListener_->stop();
    busListener_.reset();
    SessionTest::TearDown();
    RCUseInProcessMediaEngine();
  }

  // A preview whose answer (a token, or none) the test waits for.
  template <class T>
  static bool answered(std::future<T>& future) {
    return future.wait_for(platform::testing::kWait) == std::future_status::ready;
  }
  std::future<bool> preview(SavedRecordingServiceClient& client, const std::string& name,
                            std::optional<RCSSavedRecordingAccessToken>& token) {
    auto answer = std::make_shared<std::promise<bool>>();
    client.prepareToPreviewCompositionAVURL(
        platform::URL::fileURLWithPath((directory_ / name).string()),
        [answer, &token](auto granted, std::optional<platform::Error>) {
          token = std::move(granted);
          answer->set_value(token.has_value());
        });
    return answer->get_future();
  }

  platform::testing::TestBus bus_;
  std::shared_ptr<platform::BusListener> busListener_;
  std::shared_ptr<testing::HeldMediaEngine> engine_ = std::make_shared<testing::HeldMediaEngine>();
};

TEST_F(ResponsivenessTest, AStuckFragmentReadHoldsOnlyItsOwnRecording) {
  makeRecording("Stuck", {0.2, 0.2});
  makeRecording("Other", {0.2});
  engine_->holds = [](std::string_view job, const std::string& path) {
    return job == "probe" && path.find("/Stuck.composition/") != std::string::npos;
  };
  RCMediaEngine::setCurrent(engine_);
  auto first = SavedRecordingServiceClient::connect(bus_.address());
  auto second = SavedRecordingServiceClient::connect(bus_.address());
  ASSERT_TRUE(first && second);
  std::optional<RCSSavedRecordingAccessToken> stuckToken, otherToken;
  auto stuck = preview(**first, "Stuck.m4a", stuckToken);
  ASSERT_TRUE(engine_->waitForInside(1));

  // Another client is answered meanwhile, by the bus and by the service: a
  // ping, a preview of another recording read for the first time, and the
  // exporting set.
  auto bus = sdbus::createSessionBusConnectionWithAddress(bus_.address());
  auto proxy = sdbus::createProxy(*bus, RCSSavedRecordingServiceMachServiceName,
                                  RCSSavedRecordingServiceObjectPath);
  auto ping = proxy->createMethodCall("org.freedesktop.DBus.Peer", "Ping");
  EXPECT_NO_THROW(
      proxy->callMethod(ping, std::chrono::microseconds(platform::testing::kWait).count()));
  auto other = preview(**second, "Other.m4a", otherToken);
  ASSERT_TRUE(answered(other));
  ASSERT_TRUE(other.get());
  std::promise<bool> fetched;
  (*second)->fetchExportingCompositionAVURLs(
      [&](platform::Result<std::vector<platform::URL>> urls) { fetched.set_value(bool(urls)); });
  auto fetch = fetched.get_future();
  ASSERT_TRUE(answered(fetch));
  EXPECT_TRUE(fetch.get());
  EXPECT_EQ(stuck.wait_for(0s), std::future_status::timeout);

  engine_->open();
  ASSERT_TRUE(answered(stuck));
  ASSERT_TRUE(stuck.get());
  (*first)->endAccessSessionWithToken(*stuckToken);
  (*second)->endAccessSessionWithToken(*otherToken);
  ASSERT_TRUE(log_.waitForCount("Finally closing access session", 2));
  // Healthy fragments are read once each, and never reported unreadable.
  EXPECT_EQ(log_.count("cannot be read"), 0u);
}

}  // namespace
}  // namespace quorvel
