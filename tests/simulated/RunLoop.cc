#include "platform/RunLoop.h"

#include <algorithm>

#include "tests/simulated/Simulation.h"

// Timers wait in the scheduler, whose baton guards them.

namespace quarvel {
namespace {

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
