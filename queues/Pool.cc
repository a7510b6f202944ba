#include "queues/Pool.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <thread>
#include <vector>

#include "queues/PendingWork.h"
#include "queues/Thread.h"
#include "queues/TimerThread.h"

namespace quarvel {
namespace {

constexpr std::size_t kMostGathered = 1024;

struct Worker {
  Pool* pool = nullptr;
  const QueueState* queue = nullptr;
  unsigned blockingScopes = 0;
  // What the block under way has made ready, all of one pool.
  Pool* gatheredFor = nullptr;
  std::vector<std::shared_ptr<QueueState>> gathered;
};
thread_local Worker worker;

}  // namespace

Pool& Pool::of(QualityOfService qualityOfService) {
  // Never destroyed: their threads outlive the end of main. The first class serves one queue, and
  // the watchdog that looks whether that one moves. Many sessions may wait for their backends at
  // once; what is held back on the background queue all waits for the same, the store's room.
  static Pool& userInteractive = *new Pool("user-interactive", 0, 1, 8);
  static Pool& utility =
      *new Pool("utility", 5, std::max<std::size_t>(2, std::thread::hardware_concurrency()), 2048);
  static Pool& background = *new Pool("background", 10, 2, 8);
  switch (qualityOfService) {
    case QualityOfService::background:
      return background;
    case QualityOfService::utility:
      return utility;
    case QualityOfService::userInteractive:
      break;
  }
  return userInteractive;
}

Pool::Pool(std::string_view name, int nice, std::size_t width, std::size_t mostHeldBack)
    : name_(name), nice_(nice), width_(width), mostHeldBack_(mostHeldBack) {}

void Pool::submit(std::shared_ptr<QueueState> queue) {
  PendingWorkAdded();
  submit({&queue, 1});
}

void Pool::submit(std::span<std::shared_ptr<QueueState>> queues) {
  std::size_t begun = 0;
  Help help = Help::none;
  do {
    {
      const MutexLock lock(mutex_);
      for (; begun < queues.size(); ++begun) ready_.push_back(std::move(queues[begun]));
      help = helpNeeded();
    }
    call(help);
  } while (help != Help::none && queues.size() > 1);
}

void Pool::submitSoon(std::shared_ptr<QueueState> queue) {
  if (worker.pool == nullptr) return submit(std::move(queue));
  PendingWorkAdded();
  if (worker.gatheredFor != this) submitGathered();
  worker.gatheredFor = this;
  worker.gathered.push_back(std::move(queue));
  if (worker.gathered.size() == kMostGathered) submitGathered();
}

void Pool::submitGathered() {
  if (worker.gathered.empty()) return;
  worker.gatheredFor->submit(worker.gathered);
  worker.gathered.clear();
}

Pool::Help Pool::helpNeeded() {
  if (ready_.empty() || active_ >= width_) return Help::none;
  if (idle_ == 0 && blocked_ > mostHeldBack_) return Help::none;
  ++active_;
  if (idle_ == 0) return Help::startThread;
  --idle_;
  ++called_;
  return Help::wakeThread;
}

void Pool::call(Help help) {
  switch (help) {
    case Help::none:
      break;
    case Help::wakeThread:
      wake_.notifyOne();
      break;
    case Help::startThread:
      TimerThread::instance().startThread(*this);
      break;
  }
}

void Pool::startThread() {
  const int failure = StartThread(name_, nice_, [this] { work(); });
  if (failure == 0) return;
  // With another thread in the pool the work waits for that one; whoever next brings work or is
  // held back calls for a thread again.
  bool alone = false;
  {
    const MutexLock lock(mutex_);
    --active_;
    alone = active_ + blocked_ + idle_ == 0;
  }
  if (!alone) return;
  fmt::print(stderr, "quarvel: no thread for {} work: {}\n", name_, std::strerror(failure));
  std::abort();
}

const QueueState* Pool::currentQueue() {
  return worker.queue;
}

bool Pool::takeTurnHere(QueueState& queue, InlineRunner& help) {
  worker.queue = &queue;
  const bool wantsAnother = queue.takeBriefTurn(help);
  worker.queue = nullptr;
  return wantsAnother;
}

void Pool::work() {
  worker.pool = this;
  std::string_view shown = name_;
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
    PendingWorkDone();
  }
}

// Takes the calling thread's unfinished queue (or null) back and gives it the next one, waiting as
// long as there is none; null when the thread is to leave.
std::shared_ptr<QueueState> Pool::nextQueue(std::shared_ptr<QueueState> unfinished) {
  const MutexLock lock(mutex_);
  if (unfinished) ready_.push_back(std::move(unfinished));
  while (ready_.empty() || active_ > width_) {
    --active_;
    if (idle_ >= width_) return nullptr;
    ++idle_;
    while (called_ == 0) wake_.wait(mutex_);
    --called_;
  }
  std::shared_ptr<QueueState> next = std::move(ready_.front());
  ready_.pop_front();
  return next;
}

void Pool::beginBlocking() {
  Pool* const pool = worker.pool;
  if (pool == nullptr || worker.blockingScopes++ > 0) return;
  submitGathered();
  Help help = Help::none;
  {
    const MutexLock lock(pool->mutex_);
    --pool->active_;
    ++pool->blocked_;
    help = pool->helpNeeded();
  }
  pool->call(help);
}

void Pool::endBlocking() {
  Pool* const pool = worker.pool;
  if (pool == nullptr || --worker.blockingScopes > 0) return;
  const MutexLock lock(pool->mutex_);
  --pool->blocked_;
  ++pool->active_;
}

}  // namespace quarvel
