#pragma once

#include <chrono>
#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <random>
#include <thread>
#include <vector>

#include "base/Block.h"
#include "base/Date.h"
#include "base/Mutex.h"

namespace quarvel {

/// Thrown in a simulated thread that must end: the process exited, or the simulation ends.
struct ThreadEnded {};

/// Runs simulated threads one at a time in virtual time. Each has a real thread from a pool, and
/// exactly one of them, or the test, holds the baton. A thread that has to wait hands the baton to
/// another one that is ready; the seed chooses it. Time moves only when no thread is ready, and
/// then straight to the next deadline.
///
/// Owned by the `Simulation`. Everything but the baton itself is guarded by the baton.
class Scheduler {
 public:
  using Duration = std::chrono::microseconds;

  /// Queue of blocks. Outlives its handle while it has blocks to run.
  struct Queue {
    Queue(std::string label, bool isSerial) : name(std::move(label)), serial(isSerial) {}
    std::string name;
    std::size_t number = 0;  // in the order of creation
    bool serial;
    bool busy = false;         // serial: a block is ready or running
    std::deque<Block> blocks;  // serial: those behind it
  };

  /// A thread that can go on, or a block that can begin (on a queue or by itself).
  struct Thread;
  struct Ready {
    Thread* thread = nullptr;
    std::string name;
    std::shared_ptr<Queue> queue;
    Block block;
  };
  struct Thread {
    ConditionVariable turn;
    bool hasBaton = false;  // guarded by `baton_`
    Ready job;
    const char* parkedFor = nullptr;
    std::optional<Date> deadline;
    bool timedOut = false;
    bool finished = false;
    std::thread thread;
  };

  explicit Scheduler(std::uint64_t seed);
  /// Ends every simulated thread where it waits, and destroys blocks that have not run.
  ~Scheduler();
  Scheduler(const Scheduler&) = delete;
  Scheduler& operator=(const Scheduler&) = delete;

  // For the test, outside simulated threads.
  /// Runs until no thread is ready and none waits for a time. A thread that still waits for a
  /// signal then is a deadlock, which fails the test; so does a simulation without an end.
  void run() { runFromTest(std::nullopt); }
  /// Runs for that long and leaves the clock there, even when there is nothing left to do. Waiting
  /// for a signal at its end is no failure.
  void runFor(Duration duration) { runFromTest(elapsed_ + duration); }
  void runUntil(Duration elapsed) { runFromTest(elapsed); }

  // From anywhere.
  /// Virtual time since the simulation began.
  [[nodiscard]] Duration elapsed() const { return elapsed_; }
  [[nodiscard]] Date wallClock() const { return Date{} + elapsed_ + wallOffset_; }
  void setWallClock(Date date) { wallOffset_ = date - Date{} - elapsed_; }
  /// A number below `bound`, from the seed.
  [[nodiscard]] std::uint64_t choose(std::uint64_t bound) { return random_() % bound; }

  /// Starts a simulated thread.
  void spawn(std::string name, Block body) {
    ready_.push_back({nullptr, std::move(name), nullptr, std::move(body)});
  }
  [[nodiscard]] std::shared_ptr<Queue> makeQueue(std::string name, bool serial);
  void enqueue(const std::shared_ptr<Queue>& queue, Block block);
  /// Runs `action` once the time has come and no thread is ready. It must not wait.
  void after(Duration delay, Block action) { timers_.emplace(elapsed_ + delay, std::move(action)); }
  [[nodiscard]] bool isCurrent(const Queue& queue) const {
    return current()->job.queue.get() == &queue;
  }
  /// The number of the queue whose block is running; 0 when none is.
  [[nodiscard]] std::size_t currentQueue() const {
    return current()->job.queue == nullptr ? 0 : current()->job.queue->number;
  }
  /// Lets another thread go on instead of this one, if the seed says so. Never while a `Mutex` is
  /// held.
  void mayYield();
  /// Whether the process has exited or the simulation is ending: no simulated thread runs any more.
  [[nodiscard]] bool stopped() const { return stopped_; }
  /// Stops everything, as the end of the process does.
  void stop() { stopped_ = true; }

  // For the objects on which simulated threads wait.
  /// The running simulated thread, or one that stands for the test.
  [[nodiscard]] Thread* current() const {
    return currentThread == nullptr ? test_.get() : currentThread;
  }
  /// Gives up the baton until `wake`, or until the wall clock reads `deadline`; false for the
  /// latter. A deadlock's failure prints `reason`. In a simulated thread only.
  bool park(const char* reason, std::optional<Date> deadline = std::nullopt);
  /// Makes a parked thread ready; does nothing to one that is not parked.
  void wake(Thread& thread);
  /// Wakes this thread after `delay`, unless the result is destroyed before.
  using WakeUp = std::shared_ptr<void>;
  [[nodiscard]] WakeUp wakeAfter(Duration delay);
  [[nodiscard]] static bool isParked(const Thread* thread) { return thread->parkedFor != nullptr; }
  void sleep(Duration duration);

 private:
  Thread& next(Thread* idle);
  bool advanceTime();
  void wakeOverdue();
  void runJob(Thread& thread);
  void live(Thread& thread);
  void handOver(Thread& to) QUARVEL_EXCLUDES(baton_);
  void awaitTurn(Thread& thread) QUARVEL_EXCLUDES(baton_);
  void runFromTest(std::optional<Duration> until);

  const std::uint64_t seed_;  // constant after construction
  std::mt19937_64 random_;
  Duration elapsed_{0};
  Duration wallOffset_;
  std::optional<Duration> until_;  // of the current run
  bool stopped_ = false;
  bool endless_ = false;
  std::vector<Ready> ready_;
  std::multimap<Duration, Block> timers_;
  std::vector<std::unique_ptr<Thread>> threads_;
  std::vector<Thread*> idle_;
  std::unique_ptr<Thread> test_;
  std::vector<std::weak_ptr<Queue>> queues_;
  std::size_t choices_ = 0;
  static inline thread_local Thread* currentThread = nullptr;
  Mutex baton_;
};

}  // namespace quarvel
