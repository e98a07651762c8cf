// Root transaction bookkeeping and idle exit, on a main queue driven by a
// manual clock.
#include "platform/ProcessLifetime.h"

#include <gtest/gtest.h>

#include "platform/Clock.h"
#include "platform/MainQueue.h"

namespace platform {
namespace {

using namespace std::chrono_literals;

struct Lifetime {
  ManualClock clock;
  MainQueue queue{clock};
  ProcessLifetime lifetime{queue};
  int idleExits = 0;
  Lifetime() {
    lifetime.setIdleHandler([this] {
      EXPECT_TRUE(queue.isCurrent());
      ++idleExits;
    });
  }
};

// Each step acts, then moves the clock on by `advance` and runs what became
// due, then expects `exits` idle exits so far. A Period step sets the idle
// period to `advance` instead, and the clock stays.
enum class Do { Nothing, Begin, End, Enable, Period };
struct Step {
  Do action;
  Duration advance;
  int exits;
};

TEST(ProcessLifetimeTest, TheIdleHandlerRunsOnceAfterAFullIdlePeriodWithoutATransaction) {
  const struct {
    const char* name;
    std::vector<Step> steps;
  } timelines[] = {
      // clang-format off
      {"never before enabling, nor with a zero period",
       {{Do::Begin, 0s, 0}, {Do::End, 3600s, 0}, {Do::Period, 0s, 0}, {Do::Enable, 0s, 0},
        {Do::Begin, 0s, 0}, {Do::End, 86400s, 0}}},
      {"the default 30 s after enabling, once",
       {{Do::Enable, 30s - 1ms, 0}, {Do::Nothing, 1ms, 1}, {Do::Nothing, 300s, 1}}},
      {"counted from the last end; a begin just before the deadline cancels it",
       {{Do::Period, 10s, 0}, {Do::Enable, 0s, 0}, {Do::Begin, 100s, 0}, {Do::End, 9s, 0},
        {Do::Begin, 5s, 0}, {Do::End, 9s, 0}, {Do::Nothing, 1s, 1}}},
      {"a begin and end inside the period restart it",
       {{Do::Period, 10s, 0}, {Do::Enable, 6s, 0}, {Do::Begin, 0s, 0}, {Do::End, 6s, 0},
        {Do::Nothing, 4s, 1}}},
      {"a new period while idle restarts the countdown",
       {{Do::Enable, 20s, 0}, {Do::Period, 5s, 0}, {Do::Nothing, 4s, 0}, {Do::Nothing, 1s, 1}}},
      // clang-format on
  };
  for (const auto& timeline : timelines) {
    SCOPED_TRACE(timeline.name);
    Lifetime t;
    bool held = false;
    for (std::size_t i = 0; i < timeline.steps.size(); ++i) {
      const Step& step = timeline.steps[i];
      if (step.action == Do::Begin) t.lifetime.beginTransaction();
      if (step.action == Do::End) t.lifetime.endTransaction();
      if (step.action == Do::Enable) t.lifetime.enableTransactions();
      if (step.action == Do::Period) t.lifetime.setIdleExitAfter(step.advance);
      held = step.action == Do::Begin || (held && step.action != Do::End);
      if (step.action != Do::Period) t.clock.advance(step.advance);
      t.queue.runUntilIdle();
      EXPECT_EQ(t.idleExits, step.exits) << "step " << i;
      EXPECT_EQ(t.lifetime.isInTransaction(), held) << "step " << i;
    }
  }
}

TEST(ProcessLifetimeTest, AHandlerMayBeginAgainAndWaitersForNoTransactionRunOnce) {
  Lifetime t;
  t.lifetime.setIdleExitAfter(1s);
  t.lifetime.setIdleHandler([&] { t.lifetime.beginTransaction(); });
  t.lifetime.enableTransactions();
  t.clock.advance(1s);
  t.queue.runUntilIdle();
  EXPECT_TRUE(t.lifetime.isInTransaction());

  int ran = 0;
  t.lifetime.whenNoTransaction([&] {
    EXPECT_FALSE(t.lifetime.isInTransaction());
    ++ran;
  });
  EXPECT_EQ(ran, 0);
  t.lifetime.endTransaction();
  EXPECT_EQ(ran, 1);
  t.lifetime.beginTransaction();
  t.lifetime.endTransaction();
  EXPECT_EQ(ran, 1);
  t.lifetime.whenNoTransaction([&] { ++ran; });  // none held: at once
  EXPECT_EQ(ran, 2);
}

}  // namespace
}  // namespace platform
