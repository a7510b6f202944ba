#include "Statistics/Service/ZQReportingBlockThrottle.h"

#include <gmock/gmock.h>

#include <cmath>

#include "tests/simulated/Simulation.h"

namespace quarvel {
namespace {

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;
using testing::SizeIs;

constexpr auto kInstant = std::chrono::microseconds(1);
/// The pause of the idle worker between two looks.
constexpr auto kPause = std::chrono::milliseconds(100);

const char* const kBlacklist = "_comparison_field_blacklist";
const char* const kSeconds = "_throttle_seconds";

Payload Delayed(Value seconds) {
  return Payload(Dictionary{{kSeconds, std::move(seconds)}});
}

/// A throttle whose blocks record their times.
struct Throttled : Simulation {
  using Simulation::Simulation;
  /// Adds a message whose block is called `name`; from a simulated thread or the test.
  void add(std::string name, const Payload& message = Payload()) {
    const auto token = std::make_shared<int>();
    blocks[name] = token;
    throttle->addMessageBlock([this, name, token] { ran.emplace_back(name, elapsed()); }, 7,
                              message, 3, 1);
  }
  /// Adds it at `time`, from a thread of its own.
  void addAt(Scheduler::Duration time, const std::string& name,
             const Payload& message = Payload()) {
    spawn("caller " + name, [this, time, name, message] {
      SleepThread(time - elapsed());
      add(name, message);
    });
  }
  void runUntil(Scheduler::Duration moment) { scheduler.runUntil(moment); }
  [[nodiscard]] bool isAlive(const std::string& name) { return !blocks[name].expired(); }
  [[nodiscard]] std::vector<std::string> names() const {
    std::vector<std::string> names;
    for (const auto& [name, time] : ran) names.push_back(name);
    return names;
  }
  /// A random moment relative to the worker's pauses.
  [[nodiscard]] Scheduler::Duration anyMoment() {
    return kPause + Scheduler::Duration(scheduler.choose(300'000));
  }

  /// Starts a thread that waits for completion; `completedAt` is then the time of its return.
  void awaitCompletion() {
    spawn("waiter", [this] {
      throttle->waitForCompletion();
      completedAt = elapsed();
    });
  }

  using Run = std::pair<std::string, Scheduler::Duration>;
  std::optional<Scheduler::Duration> completedAt;
  std::vector<Run> ran;
  std::map<std::string, std::weak_ptr<int>> blocks;
  std::shared_ptr<ZQReportingBlockThrottle> throttle = ZQReportingBlockThrottle::init();
};

TEST(MessageKey, HasSortedKeysAndTheTextsOfComparedValues) {
  const Dictionary inner = {{"z", 1.5}, {"b", List{true, nullptr}}, {12, "12"}};
  const struct {
    Dictionary payload;
    const char* key;
  } kRows[] = {
      {{}, ""},
      {{{"text", "as it |stands\""}, {"Upper", inner}, {9, -3}, {"list", List{"b", "a", Date{}}}},
       R"(9|-3|Upper|{"12":"12","b":[true,null],"z":1.5}|)"
       R"(list|["b","a","1970-01-01T00:00:00.000000Z"]|text|as it |stands"|)"},
      {{{"systemuptime_sec", 17},
        {"processuptime_ms", 1},
        {"zqreporting_timestamp", 1},
        {kSeconds, 1}},
       "_throttle_seconds|^|processuptime_ms|^|systemuptime_sec|^|zqreporting_timestamp|^|"},
      {{{"a", 1}, {"b", 2}, {4, 1}, {kBlacklist, List{"b", 4, nullptr}}},
       "4|^|_comparison_field_blacklist|^|a|1|b|^|"},
      {{{"b", 2}, {kBlacklist, "b"}}, "_comparison_field_blacklist|^|b|2|"},
      {{{"b", 2}, {kBlacklist, Dictionary{{"b", "b"}}}}, "_comparison_field_blacklist|^|b|2|"},
      {{{"Volume", 1}, {"VolumeOperationTime", nullptr}}, "Volume|^|VolumeOperationTime|^|"},
      {{{"Volume", 1}}, "Volume|1|"},
      {{{"VolumeOperationTime", 1}}, "VolumeOperationTime|1|"},
  };
  for (const auto& [payload, key] : kRows) {
    EXPECT_EQ(
        ZQReportingBlockThrottle::buildMessageKey(Payload(payload), -1, 0x1000'0003, 0xffff'ffff),
        std::string(key) + "reporterID|-1|DSP_Playback|Undefined");
  }
}

TEST(SleepTime, IsThePayloadsNumberBelowFiveSeconds) {
  const struct {
    Value asked;
    double seconds;
    const char* rejected;
  } kRows[] = {
      {4.9, 4.900000095367432, ""},  // single precision
      {-1, -1.0, ""},
      {true, 1.0, ""},
      {5, 0.5, "large throttle time. {time=5, max=5.000000}"},
      {UINT64_MAX, 0.5, "large throttle time. {time=18446744073709551615, max=5.000000}"},
      {"2", 0.5, "non XoNumber value of throttle time. {time=2}"},
      {nullptr, 0.5, "non XoNumber value of throttle time. {time=(null)}"},
  };
  const std::string line = "info zqrr +[ZQReportingBlockThrottle determineSleepTime:]: Rejecting ";
  for (const auto& [asked, seconds, rejected] : kRows) {
    Simulation simulation(1);
    EXPECT_EQ(ZQReportingBlockThrottle::determineSleepTime(Delayed(asked)), seconds);
    EXPECT_THAT(simulation.log.texts(),
                ElementsAreArray(std::vector(*rejected == '\0' ? 0 : 1, line + rejected)));
  }
}

// A delay is exact unless it ends before the idle worker's next look.
TEST(BlockThrottle, RunsAMessageAtTheEndOfItsDelay) {
  const std::pair<double, Scheduler::Duration> kRows[] = {
      {2, 2s}, {0.03, 30ms}, {std::nan(""), 0s}, {-1e300, 0s}, {6, 500ms}};
  for (const auto seed : Seeds()) {
    for (const auto& [asked, delay] : kRows) {
      Throttled throttled(seed);
      const auto added = throttled.anyMoment();
      throttled.runUntil(added);
      throttled.add("a", Delayed(asked));
      if (delay > 0s) throttled.runUntil(added + delay - kInstant);
      EXPECT_THAT(throttled.ran, IsEmpty());
      EXPECT_THAT(throttled.throttle->timersInFlight(), SizeIs(1));
      throttled.runUntil(added + std::max<Scheduler::Duration>(delay, kPause));
      EXPECT_THAT(throttled.names(), ElementsAre("a")) << delay.count();
      EXPECT_FALSE(throttled.isAlive("a"));
      EXPECT_THAT(throttled.throttle->timersInFlight(), IsEmpty());
      throttled.runFor(20s);
      EXPECT_THAT(throttled.ran, SizeIs(1));
    }
  }
}

SEEDED_TEST(BlockThrottle, ABurstRunsItsLastMessageOnceOneDelayLater, Throttled) {
  Scheduler::Duration last = anyMoment();
  addAt(last, "0");
  for (int i = 1; i <= 5; ++i) {
    last += Scheduler::Duration(1 + scheduler.choose(499'999));
    addAt(last, std::to_string(i));
  }
  runUntil(last + 500ms - kInstant);
  EXPECT_THAT(ran, IsEmpty());
  for (const char* older : {"0", "1", "2", "3", "4"}) EXPECT_FALSE(isAlive(older));
  EXPECT_THAT(throttle->timersInFlight(), SizeIs(1));
  runFor(kInstant);
  EXPECT_THAT(ran, ElementsAre(Throttled::Run("5", last + 500ms)));
  // After the burst an equal message is a new one.
  add("6");
  runFor(500ms);
  EXPECT_THAT(names(), ElementsAre("5", "6"));
}

SEEDED_TEST(BlockThrottle, ALaterMessageBringsItsOwnDelay, Throttled) {
  addAt(0s, "a", Delayed(4));
  addAt(1s, "b", Delayed(0.25));
  addAt(2s, "c", Delayed(0.25));
  addAt(2100ms, "d", Delayed(4));
  addAt(3s, "e", Delayed(-1));
  runUntil(10s);
  EXPECT_THAT(ran, ElementsAre(Throttled::Run("b", 1250ms), Throttled::Run("e", 3s)));
}

// The worker looks for new messages only when none is left on its run loop.
SEEDED_TEST(BlockThrottle, AMessageThatArrivesWhileOthersWaitIsScheduledAfterThem, Throttled) {
  add("long", Delayed(4.5));
  runUntil(1s);
  add("short", Payload(Dictionary{{"a", 1}}));
  EXPECT_THAT(throttle->unscheduledTimerKeys(), ElementsAre("a|1|reporterID|7|Playback|Start"));
  runUntil(4500ms + kPause - kInstant);
  EXPECT_THAT(names(), ElementsAre("long"));
  runUntil(4500ms + kPause);
  EXPECT_THAT(names(), ElementsAre("long", "short"));
}

SEEDED_TEST(BlockThrottle, ABlockMayAddItsMessageAgainAndMayBeEmpty, Throttled) {
  throttle->addMessageBlock([&] { add("again"); }, 7, Payload(), 3, 1);
  throttle->addMessageBlock(Block(), 9, Payload(), 3, 1);
  runUntil(2s);
  EXPECT_THAT(names(), ElementsAre("again"));
}

TEST(WaitForCompletion, ReturnsAtItsFirstLookThatFindsNothingPending) {
  // The delay of the pending message (0: none is pending), and the time of the return.
  const std::pair<double, Scheduler::Duration> kRows[] = {{0, 0s}, {0.7, 1s}, {4.75, 5s}};
  for (const auto seed : Seeds()) {
    for (const auto& [delay, completedAt] : kRows) {
      Throttled throttled(seed);
      if (delay > 0) throttled.add("a", Delayed(delay));
      throttled.awaitCompletion();
      throttled.runUntil(10s);
      EXPECT_EQ(throttled.completedAt, completedAt);
      EXPECT_THAT(throttled.log.texts("default"), IsEmpty());
    }
  }
}

SEEDED_TEST(WaitForCompletion, TimesOutAfterFiveSecondsAndKeepsPendingMessages, Throttled) {
  log.verbose = {"zqrr"};
  add("a", Delayed(4));
  runUntil(50ms);
  add("unscheduled", Payload(Dictionary{{"a", 1}}));
  addAt(3s, "b", Delayed(4));
  awaitCompletion();
  runUntil(5050ms - kInstant);
  EXPECT_EQ(completedAt, std::nullopt);
  runUntil(7s - kInstant);
  EXPECT_EQ(completedAt, 5050ms);
  EXPECT_THAT(ran, IsEmpty());
  runUntil(7150ms);
  EXPECT_THAT(names(), ElementsAre("b", "unscheduled"));
  EXPECT_THAT(
      log.messages(),
      ElementsAre("calling workingRunLoop run from inside thread block",
                  "waitForCompletion. timersInFlight=2 unscheduledTimerKeys=1",
                  "Waiting up to 5 seconds for blockThrottle queue to be empty.",
                  "Dropping duplicate message for _throttle_seconds|^|reporterID|7|Playback|Start",
                  "Giving up on waiting for completion after 5 seconds. timersInFlight=2",
                  "sleeping in thread", "calling workingRunLoop run from inside thread block",
                  "sleeping in thread"));
  EXPECT_THAT(log.texts("default zqrr -[ZQReportingBlockThrottle waitForCompletion]: "), SizeIs(1));
}

SEEDED_TEST(BlockThrottle, IsReleasedAfterItsWorkerHasEnded, Throttled) {
  add("scheduled", Delayed(2));
  runUntil(1s);
  add("too late", Payload(Dictionary{{"a", 1}}));
  throttle->setShouldKeepRunning(false);
  throttle->setQueueThread(nullptr);
  run();  // fails as endless while the worker goes on
  EXPECT_THAT(names(), ElementsAre("scheduled"));
  EXPECT_THAT(throttle->timersInFlight(), SizeIs(1));
  const std::weak_ptr released = throttle;
  throttle.reset();
  EXPECT_TRUE(released.expired());
  EXPECT_FALSE(isAlive("too late"));
}

SEEDED_TEST(BlockThrottle, AMessageRemovedFromTheMapNeverRuns, Throttled) {
  add("scheduled");
  runUntil(200ms);
  add("unscheduled", Payload(Dictionary{{"a", 1}}));
  throttle->setTimersInFlight({});
  EXPECT_FALSE(isAlive("unscheduled"));
  runUntil(1s);
  add("next");
  runUntil(1500ms);
  EXPECT_THAT(names(), ElementsAre("next"));
}

}  // namespace
}  // namespace quarvel
