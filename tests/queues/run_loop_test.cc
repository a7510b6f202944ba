#include "platform/RunLoop.h"

#include <gmock/gmock.h>
#include <pthread.h>
#include <sys/resource.h>

#include <atomic>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "platform/WorkQueue.h"

namespace quarvel {
namespace {

using namespace std::chrono_literals;  // NOLINT(google-build-using-namespace): durations in tests
using testing::ElementsAre;
using Clock = std::chrono::steady_clock;

/// Longer than any of these tests takes on the slowest machine.
constexpr auto kNever = 1h;

/// A worker thread and when its body has ended.
class Worker {
 public:
  explicit Worker(Block body) {
    auto thread = CreateWorkerThread("tarnwick.test.worker",
                                     [body = std::move(body), ended = std::move(ended_)]() mutable {
                                       body();
                                       ended.set_value();
                                     });
    thread->start();
    // The handle goes; the thread runs on.
  }
  ~Worker() { await(); }
  Worker(const Worker&) = delete;
  Worker& operator=(const Worker&) = delete;

  void await() {
    if (done_.valid()) done_.get();
  }

 private:
  std::promise<void> ended_;
  std::future<void> done_ = ended_.get_future();
};

std::shared_ptr<RunLoopTimer> AddTimer(std::chrono::microseconds interval, Block block) {
  auto timer = CreateRunLoopTimer(interval, std::move(block));
  RunLoop::current().addTimer(timer);
  return timer;
}

TEST(RunLoop, FiresTimersInTheOrderOfTheirDatesAndReturnsWhenNoneIsLeft) {
  std::vector<std::string> fired;
  const auto early = CreateRunLoopTimer(-1s, [&] { fired.push_back("overdue"); });
  Worker([&] {
    const auto begun = Clock::now();
    const auto note = [&fired, begun](const char* name, std::chrono::milliseconds date) {
      return [&fired, begun, name, date] {
        fired.push_back(name);
        EXPECT_GE(Clock::now() - begun, date);
      };
    };
    AddTimer(600ms, note("600", 600ms));
    const auto moved = AddTimer(100ms, note("100, moved to 800", 800ms));
    AddTimer(200ms, note("200", 200ms));
    moved->fireAfter(800ms);
    AddTimer(400ms, [&] {
      fired.push_back("400");
      AddTimer(0ms, note("added by 400", 400ms));
    });
    RunLoop::current().addTimer(early);
    RunLoop::current().addTimer(early);
    RunLoop::current().run();
    EXPECT_THAT(fired,
                ElementsAre("overdue", "200", "400", "added by 400", "600", "100, moved to 800"));
    RunLoop::current().addTimer(early);  // no longer valid
    early->fireAfter(0s);
    RunLoop::current().run();
  }).await();
  EXPECT_EQ(fired.size(), 6U);
}

// Each of these would take an hour if the waiting run loop did not notice.
TEST(RunLoop, NoticesWhatAnotherThreadDoesToItsTimers) {
  std::promise<std::shared_ptr<RunLoopTimer>> first;
  std::promise<std::shared_ptr<RunLoopTimer>> second;
  std::vector<std::string> fired;
  const auto token = std::make_shared<int>();
  Worker worker([&] {
    first.set_value(AddTimer(kNever, [&] { fired.push_back("moved ahead"); }));
    RunLoop::current().run();
    fired.push_back("first run over");
    second.set_value(AddTimer(kNever, [&, token] { fired.push_back("invalidated"); }));
    RunLoop::current().run();
    fired.push_back("second run over");
  });
  const auto moved = first.get_future().get();
  std::this_thread::sleep_for(20ms);
  moved->fireAfter(0s);
  const auto invalidated = second.get_future().get();
  std::this_thread::sleep_for(20ms);
  invalidated->invalidate();
  EXPECT_EQ(token.use_count(), 1) << "the block is destroyed by then";
  worker.await();
  EXPECT_THAT(fired, ElementsAre("moved ahead", "first run over", "second run over"));
}

TEST(RunLoop, WaitsWithoutWakingUp) {
  Worker([] {
    const auto switches = [] {
      rusage usage{};
      getrusage(RUSAGE_THREAD, &usage);
      return usage.ru_nvcsw;
    };
    AddTimer(300ms, [] {});
    const long before = switches();
    RunLoop::current().run();
    EXPECT_LE(switches() - before, 3);
  });
}

TEST(RunLoop, WhatIsStillOnItWhenItsThreadEndsNeverFires) {
  std::shared_ptr<RunLoopTimer> kept;
  auto token = std::make_shared<int>();
  const std::weak_ptr<int> dropped = token;
  Worker([&] {
    kept = AddTimer(0s, [] { ADD_FAILURE(); });
    AddTimer(0s, [token = std::move(token)] { ADD_FAILURE() << *token; });
  }).await();
  while (!dropped.expired()) std::this_thread::sleep_for(1ms);
  kept->fireAfter(0s);
  kept->invalidate();
}

TEST(WorkerThread, ShowsItsNameAndDestroysItsBody) {
  std::promise<std::string> shown;
  auto token = std::make_shared<int>();
  const std::weak_ptr<int> bodies = token;
  static_cast<void>(CreateWorkerThread("unstarted", [token] { ADD_FAILURE() << *token; }));
  CreateWorkerThread("tarnwick.test.worker", [&shown, token = std::move(token)] {
    char name[16] = "";
    pthread_getname_np(pthread_self(), name, sizeof(name));
    shown.set_value(name);
  })->start();
  EXPECT_EQ(shown.get_future().get(), "test.worker");
  while (!bodies.expired()) std::this_thread::sleep_for(1ms);
}

// The class of the server queue runs one block at a time, yet a sleeper lends its place.
TEST(SleepThread, OfAQueuesBlockHoldsUpNoOtherQueue) {
  const auto sleepers = CreateSerialQueue("sleepers", QualityOfService::userInteractive);
  const auto others = CreateSerialQueue("others", QualityOfService::userInteractive);
  std::atomic<bool> awake = false;
  std::promise<void> asleep;
  std::promise<bool> otherRan;
  std::promise<void> over;
  sleepers->async([&] {
    asleep.set_value();
    SleepThread(2s);
    awake = true;
    over.set_value();
  });
  asleep.get_future().get();
  others->async([&] { otherRan.set_value(!awake); });
  EXPECT_TRUE(otherRan.get_future().get());
  over.get_future().get();
}

}  // namespace
}  // namespace quarvel
