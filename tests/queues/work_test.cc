#include <gmock/gmock.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/RunLoop.h"
#include "queues/BlockingScope.h"
#include "queues/CallTracker.h"
#include "queues/Thread.h"
#include "queues/WorkQueues.h"
#include "tests/Gate.h"

namespace quarvel {
namespace {

using namespace std::chrono_literals;
using std::chrono::steady_clock;
using std::chrono::system_clock;
using ::testing::ElementsAre;
using testing::Gate;

std::ptrdiff_t threadCount() {
  return std::distance(std::filesystem::directory_iterator("/proc/self/task"), {});
}

/// Before the first test: a sanitizer may have a thread of its own.
const std::ptrdiff_t kFirstThreads = threadCount();

/// Waits until at most `most` threads are left; returns how many are.
std::ptrdiff_t threadsLeft(std::ptrdiff_t most) {
  const auto patience = steady_clock::now() + 30s;
  while (threadCount() > most && steady_clock::now() < patience) std::this_thread::yield();
  return threadCount();
}

Date wallClock(std::chrono::microseconds fromNow) {
  return std::chrono::time_point_cast<std::chrono::microseconds>(system_clock::now()) + fromNow;
}

class WorkTest : public ::testing::Test {
 protected:
  std::unique_ptr<WorkQueue> sessionQueue() {
    return queues.createSerialQueue("tarnwick.quarvel.session.relmreporting",
                                    QualityOfService::utility);
  }
  /// All queues of this class share one thread.
  std::unique_ptr<WorkQueue> serverQueue() {
    return queues.createSerialQueue("tarnwick.quarvel.reporting.server",
                                    QualityOfService::userInteractive);
  }
  /// Waits for all blocks queued so far.
  static void finish(WorkQueue& queue) {
    Gate done;
    queue.async([&done] { done.arrive(); });
    done.wait();
  }

  /// Ends all work; false when some does not end.
  bool drain() { return queues.drain(steady_clock::now() + 30s); }

  WorkQueues queues;
};
using SerialQueueTest = WorkTest;
using BlockingTest = WorkTest;
using DrainTest = WorkTest;

TEST_F(SerialQueueTest, RunsOneBlockAtATimeInEachProducersOrder) {
  constexpr std::size_t kBlocks = 20'000;
  const auto queue = serverQueue();
  std::vector<std::size_t> inOrder(8);  // one for each producer
  std::size_t run = 0;
  std::vector<std::thread> producers;
  for (std::size_t& mine : inOrder) {
    producers.emplace_back([&] {
      for (std::size_t i = 0; i < kBlocks; ++i) {
        queue->async([&, i] {
          if (mine == i) ++mine;
          ++run;
        });
      }
    });
  }
  for (std::thread& producer : producers) producer.join();
  finish(*queue);
  EXPECT_EQ(run, inOrder.size() * kBlocks);
  EXPECT_THAT(inOrder, ::testing::Each(kBlocks));
}

TEST_F(SerialQueueTest, BlockIsGoneBeforeTheNextBegins) {
  const auto queue = serverQueue();
  const auto owned = std::make_shared<int>(0);
  Gate queued;
  queue->async([&queued] { queued.wait(); });
  queue->async([copy = owned] {});
  long holders = 0;
  queue->async([&] { holders = owned.use_count(); });
  queued.arrive();
  finish(*queue);
  EXPECT_EQ(holders, 1);
}

TEST_F(SerialQueueTest, MayBeDestroyedFromItsOwnBlockWithBlocksWaiting) {
  auto queue = sessionQueue();
  Gate queued, rest(101);
  queue->async([&] {
    queued.wait();
    queue.reset();
  });
  for (int i = 0; i < 100; ++i) queue->async([&rest] { rest.arrive(); });
  queue->after(1ms, [&rest] { rest.arrive(); });
  queued.arrive();
  rest.wait();
}

TEST_F(SerialQueueTest, BusyQueueLeavesOthersTheirTurn) {
  const auto busy = serverQueue();
  const auto other = serverQueue();
  std::atomic<bool> otherRan{false};
  Gate stopped;
  const std::function<void()> again = [&] {
    if (otherRan) return stopped.arrive();
    busy->async(again);
  };
  busy->async(again);
  other->async([&otherRan] { otherRan = true; });
  stopped.wait();
}

TEST_F(BlockingTest, ThousandBlockedQueuesDelayNoOther) {
  constexpr int kBlocked = 1000;
  std::vector<std::unique_ptr<WorkQueue>> blocked;
  Gate together(kBlocked + 1);
  for (int i = 0; i < kBlocked; ++i) {
    blocked.push_back(sessionQueue());
    blocked.back()->async([&] {
      const BlockingScope blocking;
      const BlockingScope nested;
      together.arriveAndWait();
    });
  }
  finish(*sessionQueue());
  together.arriveAndWait();
  for (const auto& queue : blocked) finish(*queue);
  EXPECT_LE(threadsLeft(50), 50) << "lent threads stay";
}

TEST_F(BlockingTest, PoolReplacesNoMoreBlockedThreadsThanItsBound) {
  constexpr int kBound = 8;                            // of the class, which is one thread wide
  const auto before = threadsLeft(kFirstThreads + 1);  // with the timer thread
  std::atomic<int> entered{0};
  Gate queued, full(kBound + 1), release;
  std::vector<std::unique_ptr<WorkQueue>> blocked;
  for (int i = 0; i < 3 * kBound; ++i) {
    blocked.push_back(serverQueue());
    blocked.back()->async([&] {
      queued.wait();
      const BlockingScope blocking;
      ++entered;
      full.arrive();
      release.wait();
    });
  }
  queued.arrive();
  full.wait();
  // The timer thread starts threads before it delivers delayed blocks.
  const auto session = sessionQueue();
  Gate delivered;
  session->after(1ms, [&delivered] { delivered.arrive(); });
  delivered.wait();
  EXPECT_EQ(entered, kBound + 1);
  EXPECT_EQ(threadCount() - before, kBound + 1 + 1) << "and the session queue's thread";
  release.arrive();
  EXPECT_TRUE(drain());
  EXPECT_EQ(entered, 3 * kBound);
}

TEST_F(BlockingTest, DeferredQueuesRunWhileTheirBlockIsBlocked) {
  const auto server = serverQueue();
  std::vector<std::unique_ptr<WorkQueue>> sessions;
  for (int i = 0; i < 100; ++i) sessions.push_back(sessionQueue());
  Gate all(100);
  server->async([&] {
    for (const auto& session : sessions) session->asyncBrief([&all] { all.arrive(); });
    const BlockingScope blocking;
    all.wait();
  });
  finish(*server);
}

// An inline block that blocked would stop the I/O thread, and with it every other client. Each step
// has a queue of its own: one that has just run may not be idle yet.
TEST_F(BlockingTest, InlineRunnerRunsBriefBlocksAloneAndNoneBlocks) {
  std::vector<std::string> inlineBlocks, pooledBlocks;
  const auto self = std::this_thread::get_id();
  const auto note = [&](const char* name) {
    return [&, name] {
      (std::this_thread::get_id() == self ? inlineBlocks : pooledBlocks).emplace_back(name);
    };
  };
  const auto step = [&](bool runs, auto queueBlocks) {
    const auto queue = serverQueue();
    {
      InlineRunner runner;
      queueBlocks(*queue);
      EXPECT_EQ(runner.runOne(), runs);
    }
    finish(*queue);
  };
  step(false, [&](WorkQueue& queue) { queue.async(note("of any length")); });
  step(true, [&](WorkQueue& queue) {
    queue.asyncBrief(note("brief"));
    queue.async(note("behind a brief one"));
  });
  bool mayBlock = true;
  const auto other = serverQueue();
  step(true, [&](WorkQueue& queue) {
    queue.asyncBrief([&mayBlock] { mayBlock = BlockingScope::isAllowed(); });
    queue.asyncBrief(note("after one that wanted to block"));
    other->asyncBrief(note("in another queue"));
  });
  EXPECT_FALSE(mayBlock);
  finish(*other);
  EXPECT_THAT(inlineBlocks, ElementsAre("brief"));
  EXPECT_THAT(pooledBlocks, ElementsAre("of any length", "behind a brief one",
                                        "after one that wanted to block", "in another queue"));
  other->async([&mayBlock] { mayBlock = BlockingScope::isAllowed(); });
  finish(*other);
  EXPECT_TRUE(mayBlock) << "on a pool's thread";
}

TEST_F(WorkTest, ConditionWaitSaysWhetherTheDeadlinePassed) {
  const auto condition = queues.createCondition();
  condition->lock();
  EXPECT_FALSE(condition->waitUntil(wallClock(-1us)));
  EXPECT_FALSE(condition->waitUntil(kEarliestDate));
  const Date deadline = wallClock(20ms);
  while (condition->waitUntil(deadline)) continue;
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

TEST_F(WorkTest, DelayedBlocksRunNotBeforeTheirTimeAndInDueOrder) {
  const auto queue = serverQueue();
  const auto start = steady_clock::now();
  std::vector<std::string> order;
  Gate allQueued, done(4);
  const auto at = [&](std::chrono::milliseconds delay, std::string name) {
    queue->after(delay, [&, delay, name] {
      order.push_back(name);
      EXPECT_GE(steady_clock::now() - start, delay);
      done.arrive();
    });
  };
  queue->async([&allQueued] { allQueued.wait(); });
  at(100ms, "last");
  at(10ms, "first");
  at(10ms, "second");
  at(-1ms, "at once");
  allQueued.arrive();
  done.wait();
  EXPECT_THAT(order, ElementsAre("at once", "first", "second", "last"));
}

class RecordingTracker final : public CallTracker {
 public:
  RecordingTracker(std::size_t size, std::atomic<int>& completions)
      : size_(size), completions_(completions) {}
  [[nodiscard]] std::size_t bytes() const override { return size_; }

  std::atomic<int> carriedOutTimes{0};

 private:
  void blockRan(std::chrono::nanoseconds /*time*/) override { EXPECT_EQ(carriedOutTimes, 0); }
  void callExecuted() override { ++carriedOutTimes; }
  void callCompleted() override {
    EXPECT_EQ(carriedOutTimes, 1);
    ++completions_;
  }
  const std::size_t size_;
  std::atomic<int>& completions_;
};

class CallTrackerTest : public WorkTest {
 protected:
  std::shared_ptr<RecordingTracker> trackerOf(std::size_t size) {
    return std::make_shared<RecordingTracker>(size, completions);
  }
  static void callUnder(std::shared_ptr<CallTracker> tracker, const std::function<void()>& call) {
    const CallRef hold(std::move(tracker));
    const CallScope scope(CallScope::Of::call, hold);
    call();
  }
  std::atomic<int> completions{0};
};

TEST_F(CallTrackerTest, CompletesOnceAfterTheLastBlockThatCameOfTheCall) {
  const auto server = serverQueue();
  const auto session = sessionQueue();
  std::atomic<int> afterwards{0};
  Gate last;
  const auto tracker = trackerOf(1);
  const auto look = [&] { afterwards += completions; };
  callUnder(tracker, [&] {
    server->async([&] {
      for (int i = 0; i < 100; ++i) session->async([&] { queues.background().async(look); });
      session->async([&] { last.wait(), look(); });
    });
  });
  finish(*server);
  EXPECT_EQ(tracker->carriedOutTimes, 1) << "the call's own blocks have run";
  EXPECT_EQ(completions, 0) << "the blocks that these queued have not";
  last.arrive();
  // A block outside the scope belongs to no call.
  server->async([&] { afterwards += CallRef::current() ? 1 : 0; });
  EXPECT_TRUE(drain());
  EXPECT_EQ(completions, 1);
  EXPECT_EQ(afterwards, 0);
}

TEST_F(CallTrackerTest, DelayedBlocksLetTheirCallsCompleteUpToABound) {
  const auto queue = serverQueue();
  const auto tracker = trackerOf(TimerThread::kUnheldBytes);
  bool ranUnderIt = false;
  Gate ran;
  callUnder(tracker, [&] {
    queue->after(10ms, [&] {
      ranUnderIt = CallRef::current().tracker() == tracker;
      queue->async([&ran] { ran.arrive(); });
    });
  });
  EXPECT_EQ(completions, 1);
  ran.wait();
  EXPECT_TRUE(ranUnderIt);
  // The bound is free again, and one call may pass it.
  const auto delay = [&] { queue->after(1h, [] {}); };
  callUnder(trackerOf(TimerThread::kUnheldBytes), delay);
  callUnder(trackerOf(1), delay);
  EXPECT_EQ(completions, 3);
  callUnder(trackerOf(1), delay);
  EXPECT_EQ(completions, 3) << "a call beyond the bound is held";
  EXPECT_TRUE(drain());
  EXPECT_EQ(completions, 4);
}

TEST(ThreadTest, ShowsTheLastComponentsOfALabelThatFit) {
  const std::pair<std::string_view, std::string_view> cases[] = {
      {"tarnwick.quarvel.reporting.server", "server"},
      {"tarnwick.quarvel.session.relmreporting", "relmreporting"},
      {"a.b.fifteenletter", "b.fifteenletter"},
      {"quarvel.store", "quarvel.store"},
      {"one.componentthatislong", "componentthatis"},
      {"", ""}};
  for (const auto& [label, name] : cases) EXPECT_EQ(ThreadName(label), name);
}

TEST_F(WorkTest, ClassesKeepTheirNiceValuesWhicheverThreadWakesThem) {
  if (getpriority(PRIO_PROCESS, 0) != 0) GTEST_SKIP() << "runs at another nice value";
  std::vector<std::string> seen;
  const auto look = [&seen] {
    std::getline(std::ifstream("/proc/thread-self/comm"), seen.emplace_back());
    seen.back() += " " + std::to_string(getpriority(PRIO_PROCESS, static_cast<id_t>(gettid())));
  };
  const auto session = sessionQueue();
  const auto server = serverQueue();
  // From the lowest class up: none may inherit from the one that starts it.
  queues.background().async([&] {
    look();
    session->async([&] {
      look();
      server->async(look);
    });
  });
  EXPECT_TRUE(drain());
  EXPECT_THAT(seen, ElementsAre("background 10", "relmreporting 5", "server 0"));
}

TEST_F(DrainTest, RunsDelayedBlocksInOrderEndsWaitsAndJoinsTheThreads) {
  const auto before = threadsLeft(kFirstThreads + 1);
  {
    WorkQueues ending;
    const auto queue = ending.createSerialQueue("queue", QualityOfService::userInteractive);
    const auto session = ending.createSerialQueue("session", QualityOfService::utility);
    const auto condition = ending.createCondition();
    std::string order;
    Gate waiting;
    queue->after(2h, [&] { order += 'b'; });
    queue->after(1h, [&] {
      order += 'a';
      queue->after(1h, [&] { order += 'c'; });
    });
    session->async([&] {
      condition->lock();
      waiting.arrive();
      EXPECT_FALSE(condition->waitUntil(wallClock(1h)));
      EXPECT_FALSE(condition->waitUntil(wallClock(1h)));
      condition->unlock();
    });
    waiting.wait();
    EXPECT_TRUE(ending.drain(steady_clock::now() + 30s));
    EXPECT_THAT(order, ::testing::AnyOf("abc", "acb"));
  }
  EXPECT_EQ(threadsLeft(before), before);
}

TEST_F(DrainTest, SaysWhenABlockDoesNotEnd) {
  Gate release;
  const auto queue = serverQueue();
  queue->async([&] { release.wait(); });
  EXPECT_FALSE(queues.drain(steady_clock::now() + 20ms));
  release.arrive();
  EXPECT_TRUE(drain());
}

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
    const auto begun = steady_clock::now();
    const auto note = [&fired, begun](const char* name, std::chrono::milliseconds date) {
      return [&fired, begun, name, date] {
        fired.push_back(name);
        EXPECT_GE(steady_clock::now() - begun, date);
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
  EXPECT_TRUE(queues.drain(steady_clock::now() + 30s));
  EXPECT_TRUE(ranMeanwhile);
}

}  // namespace
}  // namespace quarvel
