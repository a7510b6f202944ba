// Queues, conditions, run loops and threads: all wait in the scheduler, whose baton guards them.
#include <algorithm>

#include "platform/Condition.h"
#include "platform/RunLoop.h"
#include "tests/simulated/Simulation.h"

namespace quarvel {
namespace {

class SimulatedWorkQueue final : public WorkQueue {
 public:
  explicit SimulatedWorkQueue(std::shared_ptr<Scheduler::Queue> queue) : queue_(std::move(queue)) {}
  [[nodiscard]] std::string_view label() const override { return queue_->name; }
  void async(Block block) override {
    TheScheduler().enqueue(queue_, std::move(block));
    TheScheduler().mayYield();
  }
  void asyncBrief(Block block) override {
    ++Simulation::current().briefBlocks;
    async(std::move(block));
  }
  void after(std::chrono::milliseconds delay, Block block) override {
    TheScheduler().after(delay, [queue = queue_, late = std::move(block)]() mutable {
      TheScheduler().enqueue(queue, std::move(late));
    });
  }
  [[nodiscard]] bool isCurrent() const override { return TheScheduler().isCurrent(*queue_); }

 private:
  const std::shared_ptr<Scheduler::Queue> queue_;
};

// The analysis does not know the baton.
class SimulatedCondition final : public Condition {
 public:
  void lock() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    while (owner_ != nullptr) {
      lockers_.push_back(TheScheduler().current());
      TheScheduler().park("a condition's lock");
    }
    owner_ = TheScheduler().current();
  }
  void unlock() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    release();
    TheScheduler().mayYield();
  }
  void signal() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    expectHeld("signalled");
    std::vector<Scheduler::Thread*> parked;
    std::ranges::copy_if(waiters_, std::back_inserter(parked), &Scheduler::isParked);
    if (parked.empty()) return;
    Scheduler::Thread* chosen = parked[TheScheduler().choose(parked.size())];
    std::erase(waiters_, chosen);
    TheScheduler().wake(*chosen);
  }
  bool waitUntil(Date deadline) override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    expectHeld("waited in");
    Scheduler::Thread* self = TheScheduler().current();
    waiters_.push_back(self);
    const auto left = deadline - TheScheduler().wallClock();
    Scheduler::WakeUp spurious;
    if (Simulation::current().spuriousWakeUps && left.count() > 0 && TheScheduler().choose(2) > 0) {
      const auto delay = TheScheduler().choose(static_cast<std::uint64_t>(left.count()));
      spurious = TheScheduler().wakeAfter(Scheduler::Duration(delay));
    }
    release();
    const bool woken = TheScheduler().park("a signal", deadline);
    spurious.reset();
    std::erase(waiters_, self);
    lock();
    return woken;
  }

 private:
  void release() {
    owner_ = nullptr;
    for (Scheduler::Thread* locker : std::exchange(lockers_, {})) TheScheduler().wake(*locker);
  }
  void expectHeld(const char* use) const {
    EXPECT_EQ(owner_, TheScheduler().current())
        << "a condition is " << use << " by a thread that does not hold its lock";
  }

  const Scheduler::Thread* owner_ = nullptr;
  std::vector<Scheduler::Thread*> lockers_;
  std::vector<Scheduler::Thread*> waiters_;
};

class SimulatedRunLoop;

class SimulatedTimer final : public RunLoopTimer {
 public:
  SimulatedTimer(Scheduler::Duration interval, Block body)
      : fireDate(TheScheduler().elapsed() + interval), block(std::move(body)) {}
  void fireAfter(std::chrono::microseconds delay) override;
  void invalidate() override;

  Scheduler::Duration fireDate;
  std::optional<Block> block;  // none: no longer valid
  SimulatedRunLoop* loop = nullptr;
};

class SimulatedRunLoop final : public RunLoop {
 public:
  ~SimulatedRunLoop() {
    for (const auto& timer : timers_) timer->loop = nullptr;
  }
  void addTimer(const std::shared_ptr<RunLoopTimer>& timer) override {
    const auto added = std::static_pointer_cast<SimulatedTimer>(timer);
    if (!added->block || added->loop != nullptr) return;
    added->loop = this;
    timers_.push_back(added);
  }
  void run() override {
    while (!timers_.empty()) {
      const auto due = earliest();
      if (due->fireDate > TheScheduler().elapsed()) {
        waiter_ = TheScheduler().current();
        const auto wakeUp = TheScheduler().wakeAfter(due->fireDate - TheScheduler().elapsed());
        TheScheduler().park("its timers");
        waiter_ = nullptr;
        continue;
      }
      std::optional<Block> block = std::exchange(due->block, std::nullopt);
      remove(*due);
      TheScheduler().mayYield();
      (*block)();
    }
  }
  void remove(SimulatedTimer& timer) {
    timer.loop = nullptr;
    std::erase_if(timers_, [&timer](const auto& held) { return held.get() == &timer; });
  }
  /// Makes `run` look at its timers again.
  void changed() {
    if (waiter_ != nullptr) TheScheduler().wake(*waiter_);
  }

 private:
  /// The seed chooses among timers with the same date.
  [[nodiscard]] std::shared_ptr<SimulatedTimer> earliest() const {
    const auto date = [](const auto& timer) { return timer->fireDate; };
    const auto first = date(std::ranges::min(timers_, {}, date));
    std::vector<std::shared_ptr<SimulatedTimer>> candidates;
    std::ranges::copy_if(timers_, std::back_inserter(candidates),
                         [&](const auto& timer) { return timer->fireDate == first; });
    return candidates[TheScheduler().choose(candidates.size())];
  }

  std::vector<std::shared_ptr<SimulatedTimer>> timers_;
  Scheduler::Thread* waiter_ = nullptr;
};

// Another thread may run before or after the change.
void SimulatedTimer::fireAfter(std::chrono::microseconds delay) {
  TheScheduler().mayYield();
  fireDate = TheScheduler().elapsed() + std::max(delay, Scheduler::Duration::zero());
  if (loop != nullptr) loop->changed();
}
void SimulatedTimer::invalidate() {
  block.reset();
  if (SimulatedRunLoop* const held = std::exchange(loop, nullptr)) {
    held->remove(*this);
    held->changed();
  }
}

class SimulatedWorkerThread final : public WorkerThread {
 public:
  SimulatedWorkerThread(std::string_view label, Block body)
      : label_(label), body_(std::move(body)) {}
  void start() override {
    TheScheduler().spawn(label_, std::move(body_));
    TheScheduler().mayYield();
  }

 private:
  const std::string label_;
  Block body_;
};

}  // namespace

std::unique_ptr<WorkQueue> CreateSerialQueue(std::string_view label, QualityOfService) {
  auto queue = TheScheduler().makeQueue(std::string(label), true);
  Simulation::current().queues.emplace_back(label, queue->number);
  return std::make_unique<SimulatedWorkQueue>(std::move(queue));
}
std::unique_ptr<WorkQueue>& ProcessServerQueue() {
  return Simulation::current().serverQueue;
}
WorkQueue& BackgroundQueue() {
  static SimulatedWorkQueue queue(std::make_shared<Scheduler::Queue>("background", false));
  return queue;
}

std::shared_ptr<Condition> CreateCondition() {
  return std::make_shared<SimulatedCondition>();
}

RunLoop& RunLoop::current() {
  static thread_local SimulatedRunLoop loop;
  return loop;
}
std::shared_ptr<RunLoopTimer> CreateRunLoopTimer(std::chrono::microseconds interval, Block block) {
  return std::make_shared<SimulatedTimer>(interval, std::move(block));
}
std::unique_ptr<WorkerThread> CreateWorkerThread(std::string_view label, Block body) {
  return std::make_unique<SimulatedWorkerThread>(label, std::move(body));
}
void SleepThread(std::chrono::microseconds duration) {
  TheScheduler().sleep(duration);
}

}  // namespace quarvel
