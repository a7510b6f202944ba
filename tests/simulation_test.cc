#include <gmock/gmock.h>
#include <gtest/gtest-spi.h>

#include "platform/Clock.h"
#include "platform/Condition.h"
#include "platform/Process.h"
#include "tests/platform/Simulation.h"

namespace quarvel {
namespace {

using testing::ElementsAre;

TEST(Scheduler, WaitersWakeUpForNothingOnlyWhenToldTo) {
  std::size_t spurious = 0;
  for (const auto seed : Seeds()) {
    for (const bool allowed : {false, true}) {
      Simulation simulation(seed);
      simulation.spuriousWakeUps = allowed;
      const auto condition = CreateCondition();
      simulation.spawn("waiter", [&] {
        const BasicMutexLock<Condition> lock(*condition);
        const bool woken = condition->waitUntil(CurrentDate() + 10s);
        EXPECT_TRUE(allowed || !woken);
        EXPECT_EQ(woken, simulation.elapsed() < 10s);
        spurious += woken ? 1 : 0;
      });
      simulation.run();
    }
  }
  EXPECT_TRUE(spurious > 0 || Seeds().size() < 20);
}

TEST(Scheduler, ADeadlockIsAFailureThatNamesTheSeedAndWhoWaits) {
  Simulation simulation(7);
  const auto condition = CreateCondition();
  const auto queue = CreateSerialQueue("the queue", QualityOfService::utility);
  queue->async([condition]() QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    condition->lock();
    condition->lock();
  });
  EXPECT_NONFATAL_FAILURE(simulation.run(), "the queue for a condition's lock");
  EXPECT_NONFATAL_FAILURE(simulation.run(), "QUARVEL_SEED=7");
}

TEST(Scheduler, TheEndReleasesWhatWaitsAndWhatNeverRan) {
  for (const auto seed : Seeds()) {
    const auto held = std::make_shared<int>();
    {
      Simulation simulation(seed);
      const auto condition = CreateCondition();
      const auto queue = CreateSerialQueue("serial", QualityOfService::utility);
      queue->async([condition, held] {
        const BasicMutexLock<Condition> lock(*condition);
        (void)condition->waitUntil(CurrentDate() + 9s);
        ADD_FAILURE() << "went on after the end";
      });
      queue->async([held] {});
      queue->after(1h, [held] {});
      simulation.runFor(5s);
      EXPECT_EQ(held.use_count(), 4);
    }
    EXPECT_EQ(held.use_count(), 1);
  }
}

SEEDED_TEST(Scheduler, NothingRunsOrIsRecordedAfterTheProcessHasExited, Simulation) {
  const auto queue = CreateSerialQueue("serial", QualityOfService::utility);
  queue->async([] { ExitProcess(2); });
  queue->async([] { ADD_FAILURE() << "ran after the exit"; });
  run();
  note("afterwards");
  EXPECT_EQ(process.exitStatus, 2);
  EXPECT_THAT(journal.lines(), ElementsAre("exit 2"));
}

}  // namespace
}  // namespace quarvel
