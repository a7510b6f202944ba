#include "platform/Condition.h"

#include <algorithm>
#include <vector>

#include "tests/simulated/Simulation.h"

namespace quarvel {

namespace {

Scheduler& TheScheduler() {
  return Simulation::current().scheduler;
}

// Guarded by the scheduler's baton, so the analysis has nothing to see in here.
class SimulatedCondition final : public Condition {
 public:
  void lock() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    while (held_) {
      lockers_.push_back(TheScheduler().current());
      TheScheduler().park("a condition's lock");
    }
    held_ = true;
    owner_ = TheScheduler().current();
  }

  void unlock() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    release();
    TheScheduler().mayYield();
  }

  void signal() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    expectHeld("signalled");
    std::vector<Scheduler::Thread*> parked;
    std::ranges::copy_if(waiters_, std::back_inserter(parked),
                         [](const auto* waiter) { return Scheduler::isParked(*waiter); });
    if (parked.empty()) return;
    Scheduler::Thread* chosen = parked[TheScheduler().choose(parked.size())];
    std::erase(waiters_, chosen);
    TheScheduler().wake(*chosen);
  }

  bool waitUntil(Date deadline) override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    expectHeld("waited in");
    Scheduler::Thread* self = TheScheduler().current();
    waiters_.push_back(self);
    const auto waiting = std::make_shared<bool>(true);
    if (Simulation::current().spuriousWakeUps) perhapsWakeUp(self, deadline, waiting);
    release();
    const bool woken = TheScheduler().park("a signal", deadline);
    *waiting = false;
    std::erase(waiters_, self);
    lock();
    return woken;
  }

 private:
  void release() {
    held_ = false;
    for (Scheduler::Thread* locker : std::exchange(lockers_, {})) TheScheduler().wake(*locker);
  }

  void expectHeld(const char* what) const {
    EXPECT_TRUE(held_ && owner_ == TheScheduler().current())
        << "a condition is " << what << " by a thread that does not hold its lock";
  }

  static void perhapsWakeUp(Scheduler::Thread* self, Date deadline,
                            std::shared_ptr<const bool> waiting) {
    const auto left = deadline - TheScheduler().wallClock();
    if (left.count() <= 0 || TheScheduler().choose(2) == 0) return;
    const Scheduler::Duration delay(
        TheScheduler().choose(static_cast<std::uint64_t>(left.count())));
    TheScheduler().after(delay, [self, waiting = std::move(waiting)] {
      if (*waiting) TheScheduler().wake(*self);
    });
  }

  bool held_ = false;
  const Scheduler::Thread* owner_ = nullptr;
  std::vector<Scheduler::Thread*> lockers_;
  std::vector<Scheduler::Thread*> waiters_;
};

}  // namespace

std::shared_ptr<Condition> CreateCondition() {
  return std::make_shared<SimulatedCondition>();
}

}  // namespace quarvel
