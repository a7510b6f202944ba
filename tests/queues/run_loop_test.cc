#include "platform/RunLoop.h"

#include <gmock/gmock.h>
#include <sys/resource.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "queues/WorkQueues.h"
#include "tests/Gate.h"

namespace quarvel {
namespace {

using namespace std::chrono_literals;  // NOLINT(google-build-using-namespace): durations in tests
using ::testing::ElementsAre;
using testing::Gate;
using Clock = std::chrono::steady_clock;

/// Longer than any of these tests takes on the slowest machine.
constexpr auto kNever = 1h;

/// A worker thread, until its body has ended.
class Worker {
 public:
  explicit Worker(Block body) : body_(std::move(body)) {
    CreateWorkerThread("tarnwick.test.worker", [this] { body_(), ended_.arrive(); })->start();
  }
  ~Worker() { ended_.wait(); }
  Worker(const Worker&) = delete;
  Worker& operator=(const Worker&) = delete;

 private:
  Block body_;
  Gate ended_;
};

std::shared_ptr<RunLoopTimer> AddTimer(std::chrono::microseconds interval, Block block) {
  auto timer = CreateRunLoopTimer(interval, std::move(block));
  RunLoop::current().addTimer(timer);
  return timer;
}

TEST(RunLoop, FiresTimersInTheOrderOfTheirDatesAndReturnsWhenNoneIsLeft) {
  const Worker worker([] {
    std::vector<std::string> fired;
    const auto early = CreateRunLoopTimer(-1s, [&] { fired.push_back("overdue"); });
    const auto begun = Clock::now();
    const auto note = [&fired, begun](const char* name, std::chrono::milliseconds date) {
      return [&fired, begun, name, date] {
        fired.push_back(name);
        EXPECT_GE(Clock::now() - begun, date);
      };
    };
    AddTimer(150ms, note("150", 150ms));
    const auto moved = AddTimer(25ms, note("25, moved to 200", 200ms));
    AddTimer(50ms, note("50", 50ms));
    moved->fireAfter(200ms);
    AddTimer(100ms, [&] {
      fired.push_back("100");
      AddTimer(0ms, note("added by 100", 100ms));
    });
    RunLoop& loop = RunLoop::current();
    loop.addTimer(early);
    loop.addTimer(early);
    loop.run();
    loop.addTimer(early);  // no longer valid
    early->fireAfter(0s);
    loop.run();
    EXPECT_THAT(fired,
                ElementsAre("overdue", "50", "100", "added by 100", "150", "25, moved to 200"));
  });
}

// Each of these would take an hour if the waiting run loop did not notice.
TEST(RunLoop, NoticesAnotherThreadsChangesToItsTimers) {
  std::vector<std::string> fired;
  std::shared_ptr<RunLoopTimer> moved, invalidated;
  Gate first, second;
  const auto token = std::make_shared<int>();
  {
    const Worker worker([&] {
      moved = AddTimer(kNever, [&] { fired.push_back("moved ahead"); });
      first.arrive();
      RunLoop::current().run();
      fired.push_back("first run over");
      invalidated = AddTimer(kNever, [&, token] { fired.push_back("invalidated"); });
      second.arrive();
      RunLoop::current().run();
      fired.push_back("second run over");
    });
    first.wait();
    moved->fireAfter(0s);
    second.wait();
    invalidated->invalidate();
    EXPECT_EQ(token.use_count(), 1) << "the block is destroyed by then";
  }
  EXPECT_THAT(fired, ElementsAre("moved ahead", "first run over", "second run over"));
}

TEST(RunLoop, WaitsWithoutWakingUp) {
  const Worker worker([] {
    AddTimer(100ms, [] {});
    rusage before{}, after{};
    getrusage(RUSAGE_THREAD, &before);
    RunLoop::current().run();
    getrusage(RUSAGE_THREAD, &after);
    EXPECT_LE(after.ru_nvcsw - before.ru_nvcsw, 3);
  });
}

TEST(RunLoop, TimersThatOutliveItsThreadNeverFire) {
  std::shared_ptr<RunLoopTimer> kept;
  Gate dropped;
  {
    const Worker worker([&] {
      kept = AddTimer(0s, [] { ADD_FAILURE(); });
      const std::shared_ptr<void> atEnd(nullptr, [&](void*) { dropped.arrive(); });
      AddTimer(0s, [atEnd] { ADD_FAILURE(); });
    });
  }
  dropped.wait();
  kept->fireAfter(0s);
  kept->invalidate();
}

// The class of the server queue runs one block at a time.
TEST(SleepThread, DelaysItsOwnQueueAlone) {
  WorkQueues queues;
  const auto sleepers = queues.createSerialQueue("sleepers", QualityOfService::userInteractive);
  const auto others = queues.createSerialQueue("others", QualityOfService::userInteractive);
  std::atomic<bool> isAwake = false, ranMeanwhile = false;
  Gate asleep;
  sleepers->async([&] {
    asleep.arrive();
    SleepThread(500ms);
    isAwake = true;
  });
  asleep.wait();
  others->async([&] { ranMeanwhile = !isAwake; });
  EXPECT_TRUE(queues.drain(Clock::now() + 30s));
  EXPECT_TRUE(ranMeanwhile);
}

}  // namespace
}  // namespace quarvel
