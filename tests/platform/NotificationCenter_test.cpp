// In-process notifications: matching, payload, synchronous delivery, and
// changes to the observer list from observers and from other threads.
#include "platform/NotificationCenter.h"

#include <gtest/gtest.h>

#include <memory>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

namespace platform {
namespace {

TEST(NotificationCenterTest, DeliversMatchingNotificationsSynchronouslyWithTheirPayload) {
  NotificationCenter center;
  std::vector<std::string> seen;
  std::thread::id deliveredOn;
  center.addObserver("org.quorvel.event.a", [&](const Notification& n) {
    deliveredOn = std::this_thread::get_id();
    seen.push_back("a:" + n.name + ":" + std::any_cast<std::string>(n.object) + ":" +
                   std::to_string(std::any_cast<int>(n.userInfo.at("count"))));
  });
  center.addObserver("", [&](const Notification& n) {
    seen.push_back("all:" + n.name + (n.object.has_value() ? ":object" : ""));
  });
  center.postNotificationName("org.quorvel.event.a", std::string("sender"), {{"count", 3}});
  center.postNotificationName("org.quorvel.event.b");
  EXPECT_EQ(seen, (std::vector<std::string>{"a:org.quorvel.event.a:sender:3",
                                            "all:org.quorvel.event.a:object",
                                            "all:org.quorvel.event.b"}));
  EXPECT_EQ(deliveredOn, std::this_thread::get_id());
}

TEST(NotificationCenterTest, ObserversMayChangeTheListAndPostDuringAPost) {
  NotificationCenter center;
  std::vector<std::string> seen;
  NotificationCenter::ObserverToken second = 0;
  NotificationCenter::ObserverToken first = center.addObserver("n", [&](const Notification& n) {
    seen.push_back("first:" + n.name);
    center.removeObserver(second);  // the later observer misses this post
    center.addObserver("n", [&](const Notification&) { seen.push_back("added"); });
    center.removeObserver(first);  // removing itself is fine
    center.postNotificationName("nested");
  });
  second = center.addObserver("n", [&](const Notification&) { seen.push_back("second"); });
  center.addObserver("nested", [&](const Notification&) { seen.push_back("nested"); });
  center.postNotificationName("n");
  EXPECT_EQ(seen, (std::vector<std::string>{"first:n", "nested"}));
  seen.clear();
  center.postNotificationName("n");
  EXPECT_EQ(seen, (std::vector<std::string>{"added"}));
  center.removeObserver(first);  // unknown now: ignored
  center.removeObserver(999999);
}

TEST(NotificationCenterStressTest, ConcurrentPostsAddsAndRemoves) {
  NotificationCenter center;
  std::atomic<int> steady{0};
  center.addObserver("tick", [&](const Notification&) { ++steady; });
  constexpr int kThreads = 4;
  constexpr int kPosts = 2000;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      // Shared with the observer: a post running on another thread may
      // still call it after it was removed.
      auto mine = std::make_shared<std::atomic<int>>(0);
      for (int i = 0; i < kPosts; ++i) {
        auto token = center.addObserver("tick", [mine](const Notification&) { ++*mine; });
        center.postNotificationName("tick");
        center.removeObserver(token);
      }
      // Our own observer saw at least each of our own posts.
      EXPECT_GE(mine->load(), kPosts);
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(steady.load(), kThreads * kPosts);
}

}  // namespace
}  // namespace platform
