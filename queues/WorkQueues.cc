#include "queues/WorkQueues.h"

#include <algorithm>
#include <deque>
#include <thread>
#include <utility>
#include <vector>

#include "base/Mutex.h"
#include "queues/BlockingScope.h"
#include "queues/QueueState.h"

namespace quarvel {
namespace {

/// One block at a time, in order. A block added to an idle queue makes the queue ready; until a
/// thread has found it empty, further blocks cost its lock alone.
class SerialQueueState final : public QueueState {
 public:
  using QueueState::QueueState;

  void add(WorkItem&& item) override {
    const bool isBrief = item.isBrief;
    {
      const MutexLock lock(mutex_);
      if (waiting_.capacity() == 0) waiting_.reserve(kFirstCapacity);
      waiting_.push_back(std::move(item));
      if (std::exchange(ready_, true)) return;
    }
    if (!isBrief) {
      pool().submit(shared_from_this());
    } else if (InlineRunner* const runner = InlineRunner::current()) {
      runner->add(shared_from_this(), pool());
    } else {
      pool().submitDeferred(shared_from_this());
    }
  }

  bool takeTurn() override {
    for (int blocks = 0; blocks < kBlocksPerTurn; ++blocks) {
      if (next_ == batch_.size() && !takeBatch()) return false;
      batch_[next_++].run();
      Pool::flushDeferred();
    }
    return true;
  }

  bool takeInlineTurn(InlineRunner& runner) override {
    for (;;) {
      if (next_ == batch_.size() && !takeBatch()) return false;
      if (!batch_[next_].isBrief || runner.isExhausted()) return true;
      batch_[next_++].run();
    }
  }

 private:
  static constexpr std::size_t kFirstCapacity = 4;
  static constexpr int kBlocksPerTurn = 128;

  /// Takes the waiting blocks. Without any the queue becomes idle and keeps no memory: many queues
  /// are idle and few at work.
  bool takeBatch() {
    batch_.clear();
    next_ = 0;
    std::vector<WorkItem> freed;
    const MutexLock lock(mutex_);
    std::swap(batch_, waiting_);
    if (!batch_.empty()) return true;
    ready_ = false;
    return false;
  }

  Mutex mutex_;
  std::vector<WorkItem> waiting_ QUARVEL_GUARDED_BY(mutex_);
  bool ready_ QUARVEL_GUARDED_BY(mutex_) = false;  // queued in the pool, or taking its turn

  // The turn's thread's.
  std::vector<WorkItem> batch_;
  std::size_t next_ = 0;
};

/// Blocks in any order, several at once: every block is a turn.
class ConcurrentQueueState final : public QueueState {
 public:
  using QueueState::QueueState;

  void add(WorkItem&& item) override {
    {
      const MutexLock lock(mutex_);
      waiting_.push_back(std::move(item));
    }
    pool().submit(shared_from_this());
  }

  bool takeTurn() override {
    next().run();
    Pool::flushDeferred();
    return false;
  }
  bool takeInlineTurn(InlineRunner& /*runner*/) override { return takeTurn(); }

 private:
  WorkItem next() {
    const MutexLock lock(mutex_);
    WorkItem item = std::move(waiting_.front());
    waiting_.pop_front();
    return item;
  }

  Mutex mutex_;
  std::deque<WorkItem> waiting_ QUARVEL_GUARDED_BY(mutex_);
};

class PooledQueue final : public WorkQueue {
 public:
  explicit PooledQueue(std::shared_ptr<QueueState> queue) : state_(std::move(queue)) {}

  [[nodiscard]] std::string_view label() const override { return state_->label(); }
  void async(Block block) override { state_->add({CallRef::current(), std::move(block)}); }
  void asyncBrief(Block block) override {
    state_->add({CallRef::current(), std::move(block), true});
  }
  void after(std::chrono::milliseconds delay, Block block) override {
    state_->pool().timers().after(delay, state_, std::move(block));
  }
  [[nodiscard]] bool isCurrent() const override { return Pool::currentQueue() == state_.get(); }

 private:
  const std::shared_ptr<QueueState> state_;
};

}  // namespace

// The user-interactive class serves one queue, and the watchdog that checks whether that one moves.
// A thousand sessions may wait for their backends at once. Blocks of the background class all block
// for the same thing, room in the store.
WorkQueues::WorkQueues()
    : userInteractivePool_({"user-interactive", 0, 1, 8}, timers_, pendingWork_),
      utilityPool_(
          {"utility", 5, std::max<std::size_t>(2, std::thread::hardware_concurrency()), 2048},
          timers_, pendingWork_),
      backgroundPool_({"background", 10, 2, 8}, timers_, pendingWork_),
      timers_(pendingWork_),
      background_(std::make_unique<PooledQueue>(
          std::make_shared<ConcurrentQueueState>("background", backgroundPool_))) {}

WorkQueues::~WorkQueues() {
  static_cast<void>(drain(std::chrono::steady_clock::time_point::max()));
}

Pool& WorkQueues::poolOf(QualityOfService qualityOfService) {
  switch (qualityOfService) {
    case QualityOfService::background:
      return backgroundPool_;
    case QualityOfService::utility:
      return utilityPool_;
    case QualityOfService::userInteractive:
      break;
  }
  return userInteractivePool_;
}

std::unique_ptr<WorkQueue> WorkQueues::createSerialQueue(std::string_view label,
                                                         QualityOfService qualityOfService) {
  return std::make_unique<PooledQueue>(
      std::make_shared<SerialQueueState>(label, poolOf(qualityOfService)));
}

bool WorkQueues::drain(std::chrono::steady_clock::time_point deadline) {
  // A signal that a block waits for comes at once as a rule, so the work behind it is still done.
  constexpr std::chrono::seconds kWaitsMayTake{2};
  conditions_.endWaits(
      std::chrono::time_point_cast<Date::duration>(std::chrono::system_clock::now()) +
      kWaitsMayTake);
  timers_.endDelays();
  return pendingWork_.waitUntilIdle(deadline);
}

}  // namespace quarvel
