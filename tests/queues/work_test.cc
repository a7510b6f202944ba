#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <latch>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/Condition.h"
#include "platform/WorkQueue.h"
#include "queues/BlockingScope.h"
#include "queues/CallTracker.h"
#include "queues/Thread.h"
#include "queues/TimerThread.h"
#include "queues/Work.h"

namespace quarvel {
namespace {

using namespace std::chrono_literals;
using std::chrono::steady_clock;
using std::chrono::system_clock;

std::unique_ptr<WorkQueue> utilityQueue() {
  return CreateSerialQueue("tarnwick.quarvel.session.relmreporting", QualityOfService::utility);
}

std::unique_ptr<WorkQueue> serverQueue() {
  return CreateSerialQueue("tarnwick.quarvel.reporting.server", QualityOfService::userInteractive);
}

// Waits for everything queued so far.
void finish(WorkQueue& queue) {
  std::latch done(1);
  queue.async([&done] { done.count_down(); });
  done.wait();
}

std::ptrdiff_t threadCount() {
  return std::distance(std::filesystem::directory_iterator("/proc/self/task"), {});
}

Date wallClock(std::chrono::microseconds fromNow) {
  return std::chrono::time_point_cast<std::chrono::microseconds>(system_clock::now()) + fromNow;
}

TEST(SerialQueueTest, RunsOneBlockAtATimeInEachProducersOrder) {
  constexpr int kProducers = 8;
  constexpr int kBlocks = 20'000;
  const auto queue = serverQueue();
  std::vector<int> last(kProducers, -1);
  int outOfOrder = 0;
  int run = 0;
  std::vector<std::thread> producers;
  for (int producer = 0; producer < kProducers; ++producer) {
    producers.emplace_back([&, producer] {
      for (int i = 0; i < kBlocks; ++i) {
        queue->async([&, producer, i] {
          int& before = last[static_cast<std::size_t>(producer)];
          if (before != i - 1) ++outOfOrder;
          before = i;
          ++run;
        });
      }
    });
  }
  for (std::thread& producer : producers) producer.join();
  finish(*queue);
  EXPECT_EQ(run, kProducers * kBlocks);
  EXPECT_EQ(outOfOrder, 0);
}

TEST(SerialQueueTest, BlockIsGoneBeforeTheNextBegins) {
  const auto queue = serverQueue();
  const auto owned = std::make_shared<int>(0);
  std::latch queued(1);
  queue->async([&queued] { queued.wait(); });
  queue->async([copy = owned] {});
  long holders = 0;
  queue->async([&] { holders = owned.use_count(); });
  queued.count_down();
  finish(*queue);
  EXPECT_EQ(holders, 1);
}

TEST(SerialQueueTest, MayBeDestroyedFromItsOwnBlockWithBlocksWaiting) {
  auto queue = utilityQueue();
  std::latch queued(1);
  std::latch rest(101);
  queue->async([&] {
    queued.wait();
    queue.reset();
  });
  for (int i = 0; i < 100; ++i) queue->async([&rest] { rest.count_down(); });
  queue->after(1ms, [&rest] { rest.count_down(); });
  queued.count_down();
  rest.wait();
}

// Both share the one thread of their class.
TEST(SerialQueueTest, BusyQueueLeavesOthersTheirTurn) {
  const auto busy = serverQueue();
  const auto other = serverQueue();
  std::atomic<bool> otherRan{false};
  std::latch stopped(1);
  struct Again {
    WorkQueue& queue;
    std::atomic<bool>& stop;
    std::latch& stopped;
    void operator()() {
      if (stop) return stopped.count_down();
      queue.async(Again{queue, stop, stopped});
    }
  };
  busy->async(Again{*busy, otherRan, stopped});
  other->async([&otherRan] { otherRan = true; });
  stopped.wait();
}

TEST(BackgroundQueueTest, RunsBlocksSideBySide) {
  std::latch both(2);
  std::latch done(2);
  for (int i = 0; i < 2; ++i) {
    BackgroundQueue().async([&] {
      both.arrive_and_wait();
      done.count_down();
    });
  }
  done.wait();
}

TEST(LendingTest, ThousandWaitingBlocksHoldUpNobody) {
  constexpr int kWaiting = 1000;
  std::vector<std::unique_ptr<WorkQueue>> queues;
  std::latch together(kWaiting + 1);
  for (int i = 0; i < kWaiting; ++i) {
    queues.push_back(utilityQueue());
    queues.back()->async([&] {
      const BlockingScope blocking;
      const BlockingScope nested;
      together.arrive_and_wait();
    });
  }
  finish(*utilityQueue());
  together.arrive_and_wait();
  for (const auto& queue : queues) finish(*queue);
  const auto patience = steady_clock::now() + 60s;
  while (threadCount() > 50 && steady_clock::now() < patience) std::this_thread::yield();
  EXPECT_LE(threadCount(), 50) << "lent threads stay";
}

TEST(LendingTest, WhatABlockHasBroughtRunsWhileItIsHeldBack) {
  const auto server = serverQueue();
  std::vector<std::unique_ptr<WorkQueue>> sessions;
  for (int i = 0; i < 100; ++i) sessions.push_back(utilityQueue());
  std::latch all(100);
  std::latch done(1);
  server->async([&] {
    for (const auto& session : sessions) session->asyncBrief([&all] { all.count_down(); });
    {
      const BlockingScope blocking;
      all.wait();
    }
    done.count_down();
  });
  done.wait();
}

TEST(ConditionTest, WaitSaysWhetherTheDeadlinePassed) {
  const auto condition = CreateCondition();
  condition->lock();
  EXPECT_FALSE(condition->waitUntil(wallClock(-1us)));
  EXPECT_FALSE(condition->waitUntil(kEarliestDate));
  const Date deadline = wallClock(20ms);
  while (condition->waitUntil(deadline)) {
  }
  EXPECT_GE(system_clock::now(), deadline);

  for (const Date late : {wallClock(1h), kLatestDate}) {
    bool signalled = false;
    std::thread signaller([&] {
      condition->lock();
      signalled = true;
      condition->signal();
      condition->unlock();
    });
    bool inTime = true;
    while (!signalled && inTime) inTime = condition->waitUntil(late);
    EXPECT_TRUE(inTime);
    condition->unlock();
    signaller.join();
    condition->lock();
  }
  condition->unlock();
}

TEST(DelayTest, RunsNotBeforeItsTimeAndInDueOrder) {
  const auto queue = serverQueue();
  const auto start = steady_clock::now();
  std::vector<std::string> order;
  std::vector<std::chrono::milliseconds> early;
  std::latch done(4);
  const auto at = [&](std::chrono::milliseconds delay, std::string name) {
    queue->after(delay, [&, delay, name] {
      order.push_back(name);
      if (steady_clock::now() - start < delay) early.push_back(delay);
      done.count_down();
    });
  };
  std::latch allQueued(1);
  queue->async([&allQueued] { allQueued.wait(); });
  at(400ms, "last");
  at(40ms, "first");
  at(40ms, "second");
  at(-1ms, "at once");
  allQueued.count_down();
  done.wait();
  EXPECT_THAT(order, testing::ElementsAre("at once", "first", "second", "last"));
  EXPECT_THAT(early, testing::IsEmpty());
}

class RecordedVoucher final : public CallTracker {
 public:
  RecordedVoucher(std::size_t size, std::atomic<int>& completions)
      : size_(size), completions_(completions) {}
  [[nodiscard]] std::size_t bytes() const override { return size_; }

  std::atomic<int> carriedOutTimes{0};

 private:
  void blockRan(std::chrono::nanoseconds /*time*/) override { EXPECT_EQ(carriedOutTimes, 0); }
  void callExecuted() override { ++carriedOutTimes; }
  void callCompleted() override {
    EXPECT_EQ(carriedOutTimes, 1);
    ++completions_;
    completions_.notify_all();
  }

  const std::size_t size_;
  std::atomic<int>& completions_;
};

std::shared_ptr<RecordedVoucher> voucherOf(std::size_t size, std::atomic<int>& completions) {
  return std::make_shared<RecordedVoucher>(size, completions);
}

TEST(VoucherTest, CompletesOnceAfterTheLastBlockThatCameOfIt) {
  std::atomic<int> completions{0};
  const auto server = serverQueue();
  const auto session = utilityQueue();
  std::atomic<int> afterwards{0};
  std::latch last(1);
  const auto tracker = voucherOf(1, completions);
  {
    const CallRef hold(tracker);
    const CallScope scope(CallScope::Of::call, hold);
    server->async([&] {
      for (int i = 0; i < 100; ++i) {
        session->async([&] { BackgroundQueue().async([&] { afterwards += completions; }); });
      }
      session->async([&] {
        last.wait();
        afterwards += completions;
      });
    });
  }
  finish(*server);
  EXPECT_EQ(tracker->carriedOutTimes, 1) << "what the call queued itself has run";
  EXPECT_EQ(completions, 0) << "what came of that has not";
  last.count_down();
  completions.wait(0);
  finish(*session);
  EXPECT_EQ(completions, 1);
  EXPECT_EQ(afterwards, 0);

  // What is queued outside the scope belongs to no call.
  server->async([&] { afterwards += CallRef::current() ? 1 : 0; });
  finish(*server);
  EXPECT_EQ(afterwards, 0);
}

TEST(VoucherTest, DelayedBlockLetsItsCallCompleteAndRunsUnderItAgain) {
  std::atomic<int> completions{0};
  const auto queue = serverQueue();
  const auto tracker = voucherOf(1000, completions);
  std::latch ran(1);
  {
    const CallRef hold(tracker);
    const CallScope scope(CallScope::Of::call, hold);
    queue->after(300ms, [&] {
      EXPECT_EQ(completions, 1);
      EXPECT_EQ(CallRef::current().tracker(), tracker);
      queue->async([&] { ran.count_down(); });
    });
  }
  EXPECT_EQ(completions, 1);
  ran.wait();
  finish(*queue);
  EXPECT_EQ(completions, 1);
}

TEST(VoucherTest, DelayedBlocksBeyondTheBoundHoldTheirCalls) {
  std::atomic<int> within{0};
  std::atomic<int> beyond{0};
  const auto queue = serverQueue();
  const auto delay = [&](std::chrono::milliseconds time, std::shared_ptr<CallTracker> tracker) {
    const CallRef hold(std::move(tracker));
    const CallScope scope(CallScope::Of::call, hold);
    queue->after(time, [] {});
  };
  delay(300ms, voucherOf(TimerThread::kUnheldBytes, within));
  delay(300ms, voucherOf(1, within));
  EXPECT_EQ(within, 2);
  delay(300ms, voucherOf(1, beyond));
  EXPECT_EQ(beyond, 0);
  beyond.wait(0);
  EXPECT_EQ(beyond, 1);

  delay(300ms, voucherOf(1, within));
  EXPECT_EQ(within, 3) << "the bound stays used up after the blocks have run";
}

TEST(ThreadTest, ShowsTheLastComponentsOfALabelThatFit) {
  const std::pair<std::string_view, std::string_view> cases[] = {
      {"tarnwick.quarvel.reporting.server", "server"},
      {"tarnwick.quarvel.session.relmreporting", "relmreporting"},
      {"a.b.seventeen.letter", "letter"},
      {"a.b.fifteenletter", "b.fifteenletter"},
      {"quarvel.store", "quarvel.store"},
      {"background", "background"},
      {"one.componentthatislong", "componentthatis"},
      {"", ""},
  };
  for (const auto& [label, name] : cases) EXPECT_EQ(ThreadName(label), name);
}

// Each of these needs a process of its own: classes start afresh, draining is for good.
class ProcessWideDeathTest : public testing::Test {
 protected:
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

void expect(bool held, const char* what) {
  if (held) return;
  fputs(what, stderr);
  std::_Exit(1);
}

TEST_F(ProcessWideDeathTest, ClassesKeepTheirNiceValuesWhoeverWakesThem) {
  if (getpriority(PRIO_PROCESS, 0) != 0) GTEST_SKIP() << "runs at another nice value";
  EXPECT_EXIT(
      {
        struct Seen {
          int nice = -1;
          std::string name;
        };
        const auto look = [](Seen& seen) {
          seen.nice = getpriority(PRIO_PROCESS, static_cast<id_t>(gettid()));
          std::getline(std::ifstream("/proc/thread-self/comm"), seen.name);
        };
        Seen background;
        Seen utility;
        Seen interactive;
        std::latch done(1);
        const auto session = utilityQueue();
        const auto server = serverQueue();
        // From the lowest class up: none may inherit from the one that starts it.
        BackgroundQueue().async([&] {
          look(background);
          session->async([&] {
            look(utility);
            server->async([&] {
              look(interactive);
              done.count_down();
            });
          });
        });
        done.wait();
        expect(background.nice == 10 && background.name == "background", "background");
        expect(utility.nice == 5 && utility.name == "relmreporting", "utility");
        expect(interactive.nice == 0 && interactive.name == "server", "user-interactive");
        std::_Exit(0);
      },
      testing::ExitedWithCode(0), "");
}

TEST_F(ProcessWideDeathTest, DrainRunsDelayedBlocksInOrderAndEndsWaits) {
  EXPECT_EXIT(
      {
        const auto queue = serverQueue();
        const auto session = utilityQueue();
        const auto condition = CreateCondition();
        std::string order;
        bool waitEnded = false;
        std::latch waiting(1);
        queue->after(2h, [&] { order += 'b'; });
        queue->after(1h, [&] {
          order += 'a';
          queue->after(1h, [&] { order += 'c'; });
        });
        session->async([&] {
          condition->lock();
          waiting.count_down();
          waitEnded = !condition->waitUntil(wallClock(1h));
          waitEnded = waitEnded && !condition->waitUntil(wallClock(1h));
          condition->unlock();
        });
        waiting.wait();
        expect(DrainWork(steady_clock::now() + 60s), "not drained");
        expect(order == "abc" || order == "acb", "delayed blocks");
        expect(waitEnded, "wait went on");
        std::_Exit(0);
      },
      testing::ExitedWithCode(0), "");
}

TEST_F(ProcessWideDeathTest, DrainSaysWhenABlockDoesNotEnd) {
  EXPECT_EXIT(
      {
        std::latch release(1);
        const auto queue = serverQueue();
        queue->async([&] { release.wait(); });
        expect(!DrainWork(steady_clock::now() + 20ms), "drained too early");
        release.count_down();
        expect(DrainWork(steady_clock::now() + 60s), "not drained");
        std::_Exit(0);
      },
      testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace quarvel
