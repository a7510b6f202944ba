#include "queues/Pool.h"

#include <fmt/format.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <utility>
#include <vector>

#include "queues/Thread.h"
#include "queues/TimerThread.h"

namespace quarvel {
namespace {

constexpr std::size_t kMostDeferred = 1024;

struct Worker {
  Pool* pool = nullptr;
  const QueueState* queue = nullptr;
  unsigned blockingScopes = 0;
  // Queues that the running block has made ready, all of one pool.
  Pool* deferredFor = nullptr;
  std::vector<std::shared_ptr<QueueState>> deferred;
};
thread_local Worker worker;

}  // namespace

// The count changes before `waiters_` is read, and a waiter shows itself before it reads the count:
// one of the two sees the other.
void PendingWork::remove() {
  if (count_.fetch_sub(1) != 1 || waiters_.load() == 0) return;
  const MutexLock lock(mutex_);
  idle_.notifyAll();
}

bool PendingWork::waitUntilIdle(std::chrono::steady_clock::time_point deadline) {
  waiters_.fetch_add(1);
  bool inTime = true;
  {
    const MutexLock lock(mutex_);
    while (inTime && count_.load() != 0) inTime = idle_.waitUntil(mutex_, deadline);
  }
  waiters_.fetch_sub(1);
  return count_.load() == 0;
}

Pool::Pool(const Options& options, TimerThread& timers, PendingWork& pendingWork)
    : options_(options), timers_(timers), pendingWork_(pendingWork) {}

Pool::~Pool() {
  const MutexLock lock(mutex_);
  ending_ = true;
  wake_.notifyAll();
  while (running_ > 0) threadLeft_.wait(mutex_);
}

void Pool::submit(std::shared_ptr<QueueState> queue) {
  pendingWork_.add();
  submit({&queue, 1});
}

void Pool::submit(std::span<std::shared_ptr<QueueState>> queues) {
  std::size_t begun = 0;
  ThreadNeed need = ThreadNeed::none;
  do {
    {
      const MutexLock lock(mutex_);
      for (; begun < queues.size(); ++begun) ready_.push_back(std::move(queues[begun]));
      need = countNeededThread();
    }
    provide(need);
  } while (need != ThreadNeed::none && queues.size() > 1);
}

void Pool::submitDeferred(std::shared_ptr<QueueState> queue) {
  if (worker.pool == nullptr) return submit(std::move(queue));
  pendingWork_.add();
  if (worker.deferredFor != this) flushDeferred();
  worker.deferredFor = this;
  worker.deferred.push_back(std::move(queue));
  if (worker.deferred.size() == kMostDeferred) flushDeferred();
}

void Pool::flushDeferred() {
  if (worker.deferred.empty()) return;
  worker.deferredFor->submit(worker.deferred);
  worker.deferred.clear();
}

Pool::ThreadNeed Pool::countNeededThread() {
  if (ready_.empty() || active_ >= options_.width) return ThreadNeed::none;
  if (idle_ == 0 && blocked_ > options_.maximumBlocked) return ThreadNeed::none;
  ++active_;
  if (idle_ == 0) return ThreadNeed::newThread;
  --idle_;
  ++waking_;
  return ThreadNeed::idleThread;
}

void Pool::provide(ThreadNeed need) {
  switch (need) {
    case ThreadNeed::none:
      break;
    case ThreadNeed::idleThread:
      wake_.notifyOne();
      break;
    case ThreadNeed::newThread:
      timers_.startThread(*this);
      break;
  }
}

void Pool::startThread() {
  {
    const MutexLock lock(mutex_);
    ++running_;
  }
  const int failure = StartThread(options_.name, options_.nice, [this] { work(); });
  if (failure == 0) return;
  // With another thread in the pool the work waits for that one; the next submission or blocked
  // thread asks for a thread again.
  bool alone = false;
  {
    const MutexLock lock(mutex_);
    --running_;
    --active_;
    alone = active_ + blocked_ + idle_ == 0;
  }
  if (!alone) return;
  fmt::print(stderr, "quarvel: no thread for {} work: {}\n", options_.name, std::strerror(failure));
  std::abort();
}

const QueueState* Pool::currentQueue() {
  return worker.queue;
}

bool Pool::takeInlineTurn(QueueState& queue, InlineRunner& runner) {
  worker.queue = &queue;
  const bool wantsAnother = queue.takeInlineTurn(runner);
  worker.queue = nullptr;
  return wantsAnother;
}

void Pool::work() {
  worker.pool = this;
  std::string_view shown = options_.name;
  std::shared_ptr<QueueState> queue;
  while ((queue = nextQueue(std::move(queue)))) {
    if (shown.data() != queue->label().data()) {
      shown = queue->label();
      NameThisThread(shown);
    }
    worker.queue = queue.get();
    const bool wantsAnother = queue->takeTurn();
    worker.queue = nullptr;
    if (wantsAnother) continue;
    queue.reset();
    pendingWork_.remove();
  }
  const MutexLock lock(mutex_);
  --running_;
  threadLeft_.notifyAll();
}

// Takes the calling thread's unfinished queue (or null) back and gives it the next one, waiting as
// long as there is none; null when the thread is to leave.
std::shared_ptr<QueueState> Pool::nextQueue(std::shared_ptr<QueueState> unfinished) {
  const MutexLock lock(mutex_);
  if (unfinished) ready_.push_back(std::move(unfinished));
  while (ready_.empty() || active_ > options_.width) {
    --active_;
    if (ending_ || idle_ >= options_.width) return nullptr;
    ++idle_;
    while (waking_ == 0 && !ending_) wake_.wait(mutex_);
    if (ending_) return nullptr;
    --waking_;
  }
  std::shared_ptr<QueueState> next = std::move(ready_.front());
  ready_.pop_front();
  return next;
}

void Pool::beginBlocking() {
  Pool* const pool = worker.pool;
  if (pool == nullptr || worker.blockingScopes++ > 0) return;
  flushDeferred();
  ThreadNeed need = ThreadNeed::none;
  {
    const MutexLock lock(pool->mutex_);
    --pool->active_;
    ++pool->blocked_;
    need = pool->countNeededThread();
  }
  pool->provide(need);
}

void Pool::endBlocking() {
  Pool* const pool = worker.pool;
  if (pool == nullptr || --worker.blockingScopes > 0) return;
  const MutexLock lock(pool->mutex_);
  --pool->blocked_;
  ++pool->active_;
}

}  // namespace quarvel
