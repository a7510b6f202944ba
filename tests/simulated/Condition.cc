#include "platform/Condition.h"

#include <algorithm>

#include "tests/simulated/Simulation.h"

namespace quarvel {
namespace {

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

}  // namespace

std::shared_ptr<Condition> CreateCondition() {
  return std::make_shared<SimulatedCondition>();
}

}  // namespace quarvel
