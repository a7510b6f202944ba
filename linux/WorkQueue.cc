#include <deque>
#include <memory>
#include <utility>
#include <vector>

#include "base/Mutex.h"
#include "platform/WorkQueue.h"
#include "queues/InlineRunner.h"
#include "queues/Pool.h"
#include "queues/QueueState.h"
#include "queues/TimerThread.h"

namespace quarvel {
namespace {

/// One block at a time, in order. Whoever adds to a queue that is at rest makes it ready; from then
/// on adding costs its lock alone, until a thread has found nothing left.
class SerialQueueState final : public QueueState {
 public:
  SerialQueueState(std::string_view label, Pool& pool) : QueueState(label), pool_(pool) {}

  void add(WorkItem&& item) override {
    const bool isBrief = item.isBrief;
    {
      const MutexLock lock(mutex_);
      if (waiting_.capacity() == 0) waiting_.reserve(kFirstCapacity);
      waiting_.push_back(std::move(item));
      if (std::exchange(ready_, true)) return;
    }
    if (!isBrief) {
      pool_.submit(shared_from_this());
    } else if (InlineRunner* const help = InlineRunner::current()) {
      help->adopt(shared_from_this(), pool_);
    } else {
      pool_.submitSoon(shared_from_this());
    }
  }

  bool takeTurn() override {
    for (int blocks = 0; blocks < kBlocksPerTurn; ++blocks) {
      if (next_ == batch_.size() && !takeBatch()) return false;
      batch_[next_++].run();
      Pool::submitGathered();
    }
    return true;
  }

  bool takeBriefTurn(InlineRunner& help) override {
    for (;;) {
      if (next_ == batch_.size() && !takeBatch()) return false;
      if (!batch_[next_].isBrief || help.isExhausted()) return true;
      batch_[next_++].run();
    }
  }

 private:
  static constexpr std::size_t kFirstCapacity = 4;
  static constexpr int kBlocksPerTurn = 128;

  /// Takes what is waiting. When that is nothing the queue comes to rest, keeping no memory: there
  /// are many at rest, and few at work.
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

  Pool& pool_;
  Mutex mutex_;
  std::vector<WorkItem> waiting_ QUARVEL_GUARDED_BY(mutex_);
  bool ready_ QUARVEL_GUARDED_BY(mutex_) = false;  // in the pool's line, or having its turn

  // Of the thread that has the turn.
  std::vector<WorkItem> batch_;
  std::size_t next_ = 0;
};

/// Blocks in any order, several at once: every block is a turn.
class ConcurrentQueueState final : public QueueState {
 public:
  ConcurrentQueueState(std::string_view label, Pool& pool) : QueueState(label), pool_(pool) {}

  void add(WorkItem&& item) override {
    {
      const MutexLock lock(mutex_);
      waiting_.push_back(std::move(item));
    }
    pool_.submit(shared_from_this());
  }

  bool takeTurn() override {
    next().run();
    Pool::submitGathered();
    return false;
  }
  bool takeBriefTurn(InlineRunner& /*help*/) override { return takeTurn(); }

 private:
  WorkItem next() {
    const MutexLock lock(mutex_);
    WorkItem item = std::move(waiting_.front());
    waiting_.pop_front();
    return item;
  }

  Pool& pool_;
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
    TimerThread::instance().after(delay, state_, std::move(block));
  }
  [[nodiscard]] bool isCurrent() const override { return Pool::currentQueue() == state_.get(); }

 private:
  const std::shared_ptr<QueueState> state_;
};

}  // namespace

std::unique_ptr<WorkQueue> CreateSerialQueue(std::string_view label,
                                             QualityOfService qualityOfService) {
  return std::make_unique<PooledQueue>(
      std::make_shared<SerialQueueState>(label, Pool::of(qualityOfService)));
}

WorkQueue& BackgroundQueue() {
  static WorkQueue& queue = *new PooledQueue(
      std::make_shared<ConcurrentQueueState>("background", Pool::of(QualityOfService::background)));
  return queue;
}

}  // namespace quarvel
