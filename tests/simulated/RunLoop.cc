#include "platform/RunLoop.h"

#include <algorithm>
#include <optional>
#include <vector>

#include "tests/simulated/Simulation.h"

namespace quarvel {

namespace {

Scheduler& TheScheduler() {
  return Simulation::current().scheduler;
}

class SimulatedRunLoop;

// Timers and run loops are guarded by the scheduler's baton.

class SimulatedTimer final : public RunLoopTimer {
 public:
  SimulatedTimer(Scheduler::Duration interval, Block block)
      : fireDate_(TheScheduler().elapsed() + interval), block_(std::move(block)) {}

  void fireAfter(std::chrono::microseconds delay) override;
  void invalidate() override;

 private:
  friend class SimulatedRunLoop;

  Scheduler::Duration fireDate_;
  std::optional<Block> block_;  // none: no longer valid
  SimulatedRunLoop* loop_ = nullptr;
};

class SimulatedRunLoop final : public RunLoop {
 public:
  SimulatedRunLoop() = default;
  SimulatedRunLoop(const SimulatedRunLoop&) = delete;
  SimulatedRunLoop& operator=(const SimulatedRunLoop&) = delete;
  ~SimulatedRunLoop() {
    for (const auto& timer : timers_) timer->loop_ = nullptr;
  }

  void addTimer(const std::shared_ptr<RunLoopTimer>& timer) override {
    const auto added = std::static_pointer_cast<SimulatedTimer>(timer);
    if (!added->block_ || added->loop_ != nullptr) return;
    added->loop_ = this;
    timers_.push_back(added);
  }

  void run() override {
    while (!timers_.empty()) {
      const auto due = earliest();
      if (due->fireDate_ > TheScheduler().elapsed()) {
        await(due->fireDate_);
        continue;
      }
      std::optional<Block> block = std::exchange(due->block_, std::nullopt);
      remove(*due);
      TheScheduler().mayYield();
      (*block)();
    }
  }

  void remove(SimulatedTimer& timer) {
    timer.loop_ = nullptr;
    std::erase_if(timers_, [&timer](const auto& held) { return held.get() == &timer; });
  }

  /// Makes `run` look at its timers again.
  void changed() {
    if (waiter_ != nullptr) TheScheduler().wake(*waiter_);
  }

 private:
  /// The seed chooses among timers with the same date.
  [[nodiscard]] std::shared_ptr<SimulatedTimer> earliest() const {
    const auto first = std::ranges::min(timers_, {}, &dateOf)->fireDate_;
    std::vector<std::shared_ptr<SimulatedTimer>> candidates;
    std::ranges::copy_if(timers_, std::back_inserter(candidates),
                         [first](const auto& timer) { return timer->fireDate_ == first; });
    return candidates[TheScheduler().choose(candidates.size())];
  }

  static Scheduler::Duration dateOf(const std::shared_ptr<SimulatedTimer>& timer) {
    return timer->fireDate_;
  }

  void await(Scheduler::Duration date) {
    waiter_ = TheScheduler().current();
    const auto waiting = std::make_shared<bool>(true);
    TheScheduler().after(date - TheScheduler().elapsed(), [thread = waiter_, waiting] {
      if (*waiting) TheScheduler().wake(*thread);
    });
    TheScheduler().park("its timers");
    *waiting = false;
    waiter_ = nullptr;
  }

  std::vector<std::shared_ptr<SimulatedTimer>> timers_;
  Scheduler::Thread* waiter_ = nullptr;
};

// Another thread may run before or after the change.
void SimulatedTimer::fireAfter(std::chrono::microseconds delay) {
  TheScheduler().mayYield();
  fireDate_ = TheScheduler().elapsed() + std::max(delay, Scheduler::Duration::zero());
  if (loop_ != nullptr) loop_->changed();
}

void SimulatedTimer::invalidate() {
  block_.reset();
  if (SimulatedRunLoop* const loop = std::exchange(loop_, nullptr)) {
    loop->remove(*this);
    loop->changed();
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
