#include <gmock/gmock.h>
#include <gtest/gtest-spi.h>

#include <set>

#include "platform/Clock.h"
#include "platform/Condition.h"
#include "platform/Process.h"
#include "tests/platform/Simulation.h"

namespace quarvel {
namespace {

using testing::ElementsAre;

// Three queues and a thread that hand work to one another: plenty of choices.
std::vector<std::string> Bustle(std::uint64_t seed) {
  Simulation simulation(seed);
  std::vector<std::unique_ptr<WorkQueue>> queues;
  for (const char* label : {"a", "b", "c"}) {
    queues.push_back(CreateSerialQueue(label, QualityOfService::utility));
  }
  for (int i = 0; i < 4; ++i) {
    for (const auto& queue : queues) {
      queue->async([&queues, i] { queues[static_cast<std::size_t>(i) % 3]->async([] {}); });
    }
  }
  simulation.run();
  return simulation.scheduler.choices();
}

TEST(Scheduler, ASeedIsAnInterleaving) {
  std::set<std::vector<std::string>> interleavings;
  for (const auto seed : Seeds()) {
    const auto choices = Bustle(seed);
    EXPECT_EQ(choices, Bustle(seed)) << "QUARVEL_SEED=" << seed;
    interleavings.insert(choices);
  }
  EXPECT_GT(interleavings.size() * 2, Seeds().size());
}

TEST(Scheduler, SerialQueuesKeepOrderWhileABlockWaitsAndOthersGoOn) {
  for (const auto seed : Seeds()) {
    Simulation simulation(seed);
    const auto queue = CreateSerialQueue("serial", QualityOfService::utility);
    const auto condition = CreateCondition();
    std::vector<int> order;
    std::set<int> concurrent;
    queue->async([&] {
      EXPECT_TRUE(queue->isCurrent());
      {
        const BasicMutexLock<Condition> lock(*condition);
        EXPECT_FALSE(condition->waitUntil(CurrentDate() + 9s));
      }
      EXPECT_TRUE(queue->isCurrent());
      EXPECT_EQ(concurrent.size(), 3U);
      order.push_back(0);
    });
    for (int i = 1; i < 5; ++i) queue->async([&order, i] { order.push_back(i); });
    for (int i = 0; i < 3; ++i) BackgroundQueue().async([&concurrent, i] { concurrent.insert(i); });
    simulation.run();
    EXPECT_THAT(order, ElementsAre(0, 1, 2, 3, 4));
    EXPECT_EQ(simulation.elapsed(), 9s);
  }
}

TEST(Scheduler, ABlockRunsAndIsDestroyedBeforeTheNextAndOutlivesItsQueue) {
  for (const auto seed : Seeds()) {
    Simulation simulation(seed);
    auto queue = CreateSerialQueue("serial", QualityOfService::utility);
    const auto token = std::make_shared<int>();
    queue->async([&queue, token] { queue.reset(); });
    bool second = false;
    queue->async([&second, &token] {
      second = true;
      EXPECT_EQ(token.use_count(), 1) << "the block before holds it still";
    });
    simulation.run();
    EXPECT_TRUE(second);
  }
}

TEST(Scheduler, TimeStandsOnBothSidesOfADeadline) {
  for (const auto seed : Seeds()) {
    Simulation simulation(seed);
    const Date began = CurrentDate();
    std::vector<std::string> happened;
    const auto queue = CreateSerialQueue("serial", QualityOfService::utility);
    queue->after(1s, [&] { happened.push_back("after"); });
    const auto condition = CreateCondition();
    simulation.spawn("waiter", [&] {
      const BasicMutexLock<Condition> lock(*condition);
      if (!condition->waitUntil(began + 2s)) happened.push_back("deadline");
    });
    const auto runTo = [&](Scheduler::Duration elapsed) {
      simulation.scheduler.runUntil(elapsed);
      EXPECT_EQ(CurrentDate(), began + elapsed);
      return std::exchange(happened, {});
    };
    EXPECT_THAT(runTo(1s - 1us), ElementsAre());
    EXPECT_THAT(runTo(1s), ElementsAre("after"));
    EXPECT_THAT(runTo(2s - 1us), ElementsAre());
    EXPECT_THAT(runTo(2s), ElementsAre("deadline"));
  }
}

TEST(Scheduler, ASignalWakesOneWaiterAndStepsOfTheWallClockMoveDeadlines) {
  for (const auto seed : Seeds()) {
    Simulation simulation(seed);
    const auto condition = CreateCondition();
    std::vector<bool> woken;
    for (int i = 0; i < 2; ++i) {
      simulation.spawn("waiter", [&, deadline = CurrentDate() + 10s] {
        const BasicMutexLock<Condition> lock(*condition);
        woken.push_back(condition->waitUntil(deadline));
      });
    }
    simulation.runFor(1s);
    simulation.spawn("signaller", [&] {
      const BasicMutexLock<Condition> lock(*condition);
      condition->signal();
    });
    simulation.runFor(1s);
    EXPECT_THAT(woken, ElementsAre(true));

    simulation.scheduler.setWallClock(CurrentDate() - 1h);
    simulation.runFor(30min);
    EXPECT_THAT(woken, ElementsAre(true));
    simulation.scheduler.setWallClock(CurrentDate() + 2h);
    simulation.runFor(0s);
    EXPECT_THAT(woken, ElementsAre(true, false));
  }
}

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

TEST(Scheduler, NothingRunsOrIsRecordedAfterTheProcessHasExited) {
  for (const auto seed : Seeds()) {
    Simulation simulation(seed);
    const auto queue = CreateSerialQueue("serial", QualityOfService::utility);
    queue->async([] { ExitProcess(2); });
    queue->async([] { ADD_FAILURE() << "ran after the exit"; });
    simulation.run();
    simulation.note("afterwards");
    EXPECT_EQ(simulation.process.exitStatus, 2);
    EXPECT_THAT(simulation.journal.lines(), ElementsAre("exit 2"));
  }
}

}  // namespace
}  // namespace quarvel
