#include "Statistics/ZQReportingUtility.h"

#include <gmock/gmock.h>

#include "base/Mutex.h"
#include "platform/Condition.h"
#include "tests/simulated/Simulation.h"

namespace quarvel {
namespace {

using testing::ElementsAreArray;

// A wait of nine seconds, and threads that signal its condition.
struct Wait : Simulation {
  explicit Wait(std::uint64_t seed) : Simulation(seed) {
    spawn("waiter", [this] {
      result = ZQReportingUtilityWait(*condition, &done, "waiting", "too late", nullptr, 9.0);
      endedAt = elapsed();
    });
  }
  void signalAt(Scheduler::Duration at, bool set) {
    spawn("setter", [this, at, set] {
      scheduler.sleep(at);
      const BasicMutexLock<Condition> lock(*condition);
      done = done || set;
      condition->signal();
    });
  }

  std::shared_ptr<Condition> condition = CreateCondition();
  bool done = false;
  std::optional<bool> result;
  Scheduler::Duration endedAt{0};
};

const std::string kWaiting = "default [default] ZQReportingUtilityWait: waiting";
const std::string kContinuing = "default [default] ZQReportingUtilityWait: continuing";
const std::string kTooLate = "error [default] ZQReportingUtilityWait: too late";

TEST(Wait, EndsWhenTheFlagIsSetOrAPeriodAfterTheLastWakeUp) {
  struct Case {
    const char* name;
    std::vector<std::pair<Scheduler::Duration, bool>> signals;  // none: set before the wait
    bool result;
    Scheduler::Duration endedAt;
    std::vector<std::string> lines;
  };
  const Case kCases[] = {
      {"set already", {}, true, 0s, {}},
      {"signalled without the flag",
       {{5s, false}},
       false,
       14s,
       {kWaiting, kContinuing, kWaiting, kTooLate}},
      {"prolonged, then set",
       {{8s, false}, {16s, false}, {24s, true}},
       true,
       24s,
       {kWaiting, kContinuing, kWaiting, kContinuing, kWaiting, kContinuing}},
  };
  for (const Case& each : kCases) {
    for (const auto seed : Seeds()) {
      SCOPED_TRACE(each.name);
      Wait wait(seed);
      wait.done = each.signals.empty();
      for (const auto& [at, set] : each.signals) wait.signalAt(at, set);
      wait.run();
      EXPECT_EQ(wait.result, each.result);
      EXPECT_EQ(wait.endedAt, each.endedAt);
      EXPECT_THAT(wait.log.texts(), ElementsAreArray(each.lines));
    }
  }
}

}  // namespace
}  // namespace quarvel
