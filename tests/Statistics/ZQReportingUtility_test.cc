#include "Statistics/ZQReportingUtility.h"

#include <gmock/gmock.h>

#include "base/Mutex.h"
#include "platform/Condition.h"
#include "tests/platform/Simulation.h"

namespace quarvel {
namespace {

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;

TEST(Vocabulary, CategoriesAreComposedOfAComponentAndAKind) {
  const std::pair<std::uint32_t, const char*> kNames[] = {
      {0, "Undefined"},
      {1, "Generic"},
      {2, "Record"},
      {3, "Playback"},
      {4, "PlaybackAndRecord"},
      {5, "Setup"},
      {6, "ClientRequest"},
      {7, "RouteChange"},
      {8, "Error"},
      {9, "Tallixing"},
      {10, "Performance"},
      {11, "Volume"},
      {12, "Undefined"},
      {0x0000ffff, "Undefined"},
      {0x00010000, "_Undefined"},
      {0x00050001, "_Generic"},
      {0x08000007, "Session_RouteChange"},
      {0x10000003, "DSP_Playback"},
      {0x20000000, "HAL_Undefined"},
      {0x40000009, "Routing_Tallixing"},
      {0x80000008, "Toolbox_Error"},
      {0x18000001, "_Generic"},
      {0xfffffffe, "_Undefined"},
      {0xffffffff, "Undefined"},
  };
  for (const auto& [code, name] : kNames) {
    EXPECT_EQ(ZQReportingUtilityCategoryName(code), name) << std::hex << code;
  }
}

TEST(Vocabulary, TypesAndServiceTypes) {
  const std::pair<std::int64_t, const char*> kTypes[] = {
      {0, "Generic"},
      {1, "Start"},
      {2, "Stop"},
      {3, "Setup"},
      {4, "Error"},
      {5, "IssueDetector"},
      {6, "Undefined"},
      {65534, "Undefined"},
      {65535, "Unknown"},
      {65536, "Undefined"},
      {-1, "Undefined"},
      {0x100000001, "Start"},
      {0x10000ffff, "Unknown"},
  };
  for (const auto& [code, name] : kTypes) EXPECT_EQ(ZQReportingUtilityTypeName(code), name) << code;

  const std::pair<std::uint32_t, const char*> kServiceTypes[] = {
      {0, "generic"},
      {1, "kivo"},
      {2, "telephony"},
      {3, "haptics"},
      {4, "alarms"},
      {5, "standalone"},
      {6, "soundautoconfig"},
      {7, "longformaudio"},
      {8, "nonlongformaudio"},
      {9, "audiodeviceusage"},
      {10, "alerts"},
      {11, "test"},
      {12, ""},
      {65534, ""},
      {65535, "unknown"},
  };
  for (const auto& [code, name] : kServiceTypes) {
    EXPECT_EQ(ZQReportingUtilityServiceTypeName(code), name) << code;
  }
}

TEST(Vocabulary, TheHostApplicationIsWhateverValueThereIs) {
  const std::pair<Dictionary, Value> kCases[] = {
      {{}, "Unknown"},
      {{{"HostApplicationDisplayID", "Music"}}, "Music"},
      {{{"HostApplicationDisplayID", 7}}, 7},
  };
  for (const auto& [entries, application] : kCases) {
    SharedDictionary userInfo;
    userInfo.merge(entries);
    EXPECT_EQ(ZQReportingUtilityHostApplicationID(userInfo), application);
  }
}

// A wait of nine seconds, and somebody who touches its condition now and then.
struct Wait : Simulation {
  explicit Wait(std::uint64_t seed) : Simulation(seed) {
    spawn("waiter", [this] {
      result = ZQReportingUtilityWait(*condition, &done, "waiting", "too late", nullptr, 9.0);
      endedAt = elapsed();
    });
  }
  void touchAt(Scheduler::Duration at, bool set) {
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

TEST(Wait, EndsWhenTheFlagIsSetOrAFullPeriodAfterTheLastWakeUp) {
  struct Case {
    const char* name;
    std::vector<std::pair<Scheduler::Duration, bool>> touches;
    bool result;
    Scheduler::Duration endedAt;
    std::vector<std::string> lines;
  };
  const Case kCases[] = {
      {"nobody comes", {}, false, 9s, {kWaiting, kTooLate}},
      {"just in time", {{9s - 1us, true}}, true, 9s - 1us, {kWaiting, kContinuing}},
      {"just too late", {{9s + 1us, true}}, false, 9s, {kWaiting, kTooLate}},
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
      for (const auto& [at, set] : each.touches) wait.touchAt(at, set);
      wait.run();
      EXPECT_EQ(wait.result, each.result);
      EXPECT_EQ(wait.endedAt, each.endedAt);
      EXPECT_THAT(wait.log.texts(), ElementsAreArray(each.lines));
    }
  }
}

SEEDED_TEST(Wait, AFlagThatIsSetAlreadyNeedsNeitherTimeNorLog, Wait) {
  done = true;
  run();
  EXPECT_EQ(result, true);
  EXPECT_EQ(endedAt, 0s);
  EXPECT_THAT(log.texts(), IsEmpty());
}

SEEDED_TEST(Wait, WakeUpsForNothingDoNotEndItEarly, Wait) {
  spuriousWakeUps = true;
  run();
  EXPECT_EQ(result, false);
  const auto lines = log.texts();
  EXPECT_GE(endedAt, 9s);
  EXPECT_EQ(endedAt == 9s, lines.size() == 2);
  EXPECT_EQ(lines.back(), kTooLate);
}

}  // namespace
}  // namespace quarvel
