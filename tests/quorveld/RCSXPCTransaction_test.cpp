// Keep-alive transactions and the root transaction they fold into.
#include <gtest/gtest.h>

#include <mutex>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "platform/Log.h"
#include "platform/MainQueue.h"
#include "platform/ProcessLifetime.h"
#include "quorveld/RCSXPCTransaction.h"
#include "quorveld/RCSXPCTransactionController.h"

namespace quorvel {
namespace {

class TransactionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    platform::setConsoleLogging(false);
    platform::setLogThreshold(platform::kLogLevelDebug);
    platform::setLogSinkForTesting([this](int, std::string_view text) {
      std::lock_guard lock(mutex_);
      lines_.emplace_back(text);
    });
    ASSERT_TRUE(RCSXPCTransaction::activeTransactions().empty());
  }
  void TearDown() override {
    platform::setLogSinkForTesting(nullptr);
    platform::setLogThreshold(platform::kLogLevelNotice);
    EXPECT_FALSE(controller().isInTransaction());
  }
  static RCSXPCTransactionController& controller() {
    return RCSXPCTransactionController::sharedInstance();
  }
  std::vector<std::string> takeLines() {
    std::lock_guard lock(mutex_);
    return std::exchange(lines_, {});
  }

  std::mutex mutex_;
  std::vector<std::string> lines_;
};

TEST_F(TransactionTest, FirstBeginTakesTheRootAndLastEndReleasesIt) {
  auto transaction = RCSXPCTransaction::initWithName("Keep-alive for tests");
  transaction->beginTransaction();
  EXPECT_TRUE(transaction->isActive());
  EXPECT_TRUE(controller().isInTransaction());
  EXPECT_TRUE(platform::ProcessLifetime::instance().isInTransaction());
  transaction->endTransaction();
  EXPECT_FALSE(platform::ProcessLifetime::instance().isInTransaction());

  std::string description = transaction->description();
  EXPECT_TRUE(std::regex_match(
      description, std::regex(R"(<RCSXPCTransaction 0x[0-9a-f]+, name = "Keep-alive for tests">)")))
      << description;
  EXPECT_EQ(takeLines(), (std::vector<std::string>{
                             "[RCSXPCTransaction] Activating XPC transaction: " + description,
                             "[RCSXPCTransaction] Root XPC transaction began.",
                             "[RCSXPCTransaction] Deactivating XPC transaction: " + description,
                             "[RCSXPCTransaction] No XPC transactions remain. Ending "
                             "root XPC transaction.",
                         }));
}

TEST_F(TransactionTest, SameNamedTransactionsAreTrackedSeparately) {
  auto first = RCSXPCTransaction::initWithName("same");
  auto second = RCSXPCTransaction::initWithName("same");
  first->beginTransaction();
  second->beginTransaction();
  first->endTransaction();
  EXPECT_FALSE(first->isActive());
  EXPECT_TRUE(second->isActive());
  EXPECT_TRUE(controller().isInTransaction());
  second->endTransaction();
}

TEST_F(TransactionTest, BeginTwiceEndOnceAndRedundantEndsAreQuiet) {
  auto transaction = RCSXPCTransaction::initWithName("twice");
  transaction->beginTransaction();
  transaction->beginTransaction();
  transaction->endTransaction();
  EXPECT_FALSE(transaction->isActive());
  EXPECT_FALSE(controller().isInTransaction());
  takeLines();

  transaction->endTransaction();
  RCSXPCTransaction::initWithName("never begun")->endTransaction();
  EXPECT_TRUE(takeLines().empty());
}

TEST_F(TransactionTest, ScheduledEndRunsOnTheMainQueueEvenAfterAnEarlierEnd) {
  auto transaction = RCSXPCTransaction::initWithName("scheduled");
  transaction->beginTransaction();
  transaction->endTransactionOnDate(platform::Date::dateWithTimeIntervalSinceNow(-1.0));
  EXPECT_TRUE(transaction->isActive());  // nothing ends before the main queue turns
  platform::mainQueue().runUntilIdle();
  EXPECT_FALSE(transaction->isActive());

  // Ended in the meantime: the scheduled end touches nothing and logs nothing.
  transaction->beginTransaction();
  transaction->endTransactionOnDate(platform::Date::dateWithTimeIntervalSinceNow(-1.0));
  transaction->endTransaction();
  takeLines();
  platform::mainQueue().runUntilIdle();
  EXPECT_TRUE(takeLines().empty());
}

TEST_F(TransactionTest, ScheduledEndTwoSecondsAheadRunsTwoSecondsLater) {
  platform::ManualClock clock;
  platform::MainQueue main(clock, "test main");
  platform::setMainQueueForTesting(&main);
  auto transaction = RCSXPCTransaction::initWithName("two seconds");
  transaction->beginTransaction();
  transaction->endTransactionOnDate(platform::Date::dateWithTimeIntervalSinceNow(2.0));
  clock.advance(std::chrono::milliseconds(1990));
  main.runUntilIdle();
  EXPECT_TRUE(transaction->isActive());
  clock.advance(std::chrono::milliseconds(10));
  main.runUntilIdle();
  EXPECT_FALSE(transaction->isActive());
  platform::setMainQueueForTesting(nullptr);
}

TEST_F(TransactionTest, ScheduledEndKeepsAnUnownedTransactionAlive) {
  auto transaction = RCSXPCTransaction::initWithName("kept by its end");
  std::weak_ptr<RCSXPCTransaction> weak = transaction;
  transaction->beginTransaction();
  transaction->endTransactionOnDate(platform::Date::dateWithTimeIntervalSinceNow(-1.0));
  transaction.reset();
  EXPECT_FALSE(weak.expired());
  EXPECT_TRUE(controller().isInTransaction());
  platform::mainQueue().runUntilIdle();
  EXPECT_TRUE(weak.expired());
}

TEST_F(TransactionTest, ConcurrentBeginsEndsAndDropsKeepTheRootConsistent) {
  platform::setLogThreshold(platform::kLogLevelNotice);
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([] {
      for (int i = 0; i < 2000; ++i) {
        auto transaction = RCSXPCTransaction::initWithName("stress");
        transaction->beginTransaction();
        if (i % 3 == 0) transaction->endTransaction();
        if (i % 5 == 0) (void)RCSXPCTransaction::activeTransactions();
      }  // the rest end in their destructors
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_TRUE(RCSXPCTransaction::activeTransactions().empty());
  EXPECT_FALSE(controller().isInTransaction());
  EXPECT_FALSE(platform::ProcessLifetime::instance().isInTransaction());
}

}  // namespace
}  // namespace quorvel
