#include "tests/simulated/Scheduler.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>

namespace quarvel {

namespace {
constexpr Date kBeginning{std::chrono::seconds{1'769'866'000}};
constexpr std::size_t kMostChoices = 1'000'000;
// Real time for one run. Reached only when a thread blocks outside the simulated platform.
constexpr std::chrono::seconds kHung{300};
}  // namespace

Scheduler::Scheduler(std::uint64_t seed)
    : seed_(seed),
      random_(seed),
      wallOffset_(kBeginning - Date{}),
      test_(std::make_unique<Thread>()) {}

Scheduler::~Scheduler() {
  stopped_ = true;
  for (const auto& thread : threads_) {
    if (!thread->finished) {
      handOver(*thread);
      awaitTurn(*test_);
    }
    thread->thread.join();
  }
  // Destroying a block may queue another.
  timers_.clear();
  while (!ready_.empty()) std::exchange(ready_, {}).clear();
  for (std::size_t i = 0; i < queues_.size(); ++i) {
    if (const auto queue = queues_[i].lock()) {
      while (!queue->blocks.empty()) queue->blocks.pop_front();
      queue->busy = false;
    }
  }
}

void Scheduler::runFromTest(std::optional<Duration> until) {
  if (stopped_) return;
  until_ = until;
  Thread& first = next(nullptr);
  if (&first != test_.get()) {
    handOver(first);
    awaitTurn(*test_);
  }
  if (endless_) ADD_FAILURE() << "no end after " << choices_ << " choices";
  if (stopped_) return;
  if (until) {
    elapsed_ = std::max(elapsed_, *until);
    return;
  }
  for (const auto& thread : threads_) {
    if (thread->parkedFor == nullptr) continue;
    ADD_FAILURE() << "deadlock: " << thread->job.name << " waits for " << thread->parkedFor;
  }
}

std::shared_ptr<Scheduler::Queue> Scheduler::makeQueue(std::string name, bool serial) {
  auto queue = std::make_shared<Queue>(std::move(name), serial);
  queues_.push_back(queue);
  queue->number = queues_.size();
  return queue;
}

void Scheduler::enqueue(const std::shared_ptr<Queue>& queue, Block block) {
  if (queue->serial && queue->busy) {
    queue->blocks.push_back(std::move(block));
  } else {
    queue->busy = true;
    ready_.push_back({nullptr, queue->name, queue, std::move(block)});
  }
}

void Scheduler::mayYield() {
  if (currentThread == nullptr || stopped_ || ready_.empty() || choose(2) == 0) return;
  ready_.push_back({currentThread, currentThread->job.name, nullptr, {}});
  Thread& self = *currentThread;
  Thread& chosen = next(nullptr);
  if (&chosen == &self) return;
  handOver(chosen);
  awaitTurn(self);
}

bool Scheduler::park(const char* reason, std::optional<Date> deadline) {
  if (currentThread == nullptr) {
    throw std::logic_error(
        fmt::format("the test itself cannot wait for {}: spawn a thread", reason));
  }
  if (stopped_) throw ThreadEnded{};
  Thread& self = *currentThread;
  self.parkedFor = reason;
  self.deadline = deadline;
  self.timedOut = false;
  Thread& chosen = next(nullptr);
  if (&chosen != &self) {
    handOver(chosen);
    awaitTurn(self);
  }
  self.parkedFor = nullptr;
  if (stopped_) throw ThreadEnded{};
  return !self.timedOut;
}

void Scheduler::wake(Thread& thread) {
  if (thread.parkedFor == nullptr) return;
  thread.parkedFor = nullptr;
  ready_.push_back({&thread, thread.job.name, nullptr, {}});
}

Scheduler::WakeUp Scheduler::wakeAfter(Duration delay) {
  auto wakeUp = std::make_shared<bool>();
  after(delay, [this, thread = currentThread, alive = std::weak_ptr(wakeUp)] {
    if (!alive.expired()) wake(*thread);
  });
  return wakeUp;
}

void Scheduler::sleep(Duration duration) {
  const Duration end = elapsed_ + duration;
  const WakeUp wakeUp = wakeAfter(duration);
  do {
    park("its sleep to end");
  } while (elapsed_ < end);
}

void Scheduler::wakeOverdue() {
  for (const auto& thread : threads_) {
    if (thread->parkedFor != nullptr && thread->deadline && *thread->deadline <= wallClock()) {
      thread->timedOut = true;
      wake(*thread);
    }
  }
  while (!timers_.empty() && timers_.begin()->first <= elapsed_) {
    timers_.extract(timers_.begin()).mapped()();
  }
}

// Moves the clock to the next deadline; false when this run has none.
bool Scheduler::advanceTime() {
  std::optional<Duration> earliest;
  if (!timers_.empty()) earliest = timers_.begin()->first;
  for (const auto& thread : threads_) {
    if (thread->parkedFor == nullptr || !thread->deadline) continue;
    const Duration due = *thread->deadline - Date{} - wallOffset_;
    earliest = std::min(earliest.value_or(due), due);
  }
  if (!earliest || (until_ && *earliest > *until_)) return false;
  elapsed_ = std::max(elapsed_, *earliest);
  return true;
}

// Chooses the next thread. A block that begins is given to `idle`, or else to a thread of the pool.
// The test goes on when nothing is left.
Scheduler::Thread& Scheduler::next(Thread* idle) {
  endless_ = choices_++ >= kMostChoices;
  stopped_ = stopped_ || endless_;
  do {
    if (stopped_) return *test_;
    wakeOverdue();
  } while (ready_.empty() && advanceTime());
  if (ready_.empty()) return *test_;

  const auto chosen = ready_.begin() + static_cast<std::ptrdiff_t>(choose(ready_.size()));
  Ready ready = std::move(*chosen);
  ready_.erase(chosen);
  if (ready.thread != nullptr) return *ready.thread;

  if (idle == nullptr) {
    if (idle_.empty()) {
      Thread& thread = *threads_.emplace_back(std::make_unique<Thread>());
      thread.thread = std::thread([this, &thread] { live(thread); });
      idle_.push_back(&thread);
    }
    idle = idle_.back();
    idle_.pop_back();
  }
  idle->job = std::move(ready);
  return *idle;
}

void Scheduler::live(Thread& thread) {
  const testing::ScopedTrace trace(__FILE__, __LINE__, fmt::format("QUARVEL_SEED={}", seed_));
  currentThread = &thread;
  awaitTurn(thread);
  while (!stopped_) {
    runJob(thread);
    if (stopped_) break;
    Thread& chosen = next(&thread);
    if (&chosen == &thread) continue;
    idle_.push_back(&thread);
    handOver(chosen);
    awaitTurn(thread);
  }
  thread.finished = true;
  handOver(*test_);
}

void Scheduler::runJob(Thread& thread) {
  try {
    thread.job.block();
  } catch (const ThreadEnded&) {
  } catch (const std::exception& unexpected) {
    ADD_FAILURE() << thread.job.name << " threw: " << unexpected.what();
  }
  thread.job.block = Block();
  const auto queue = std::exchange(thread.job.queue, nullptr);
  if (queue == nullptr || !queue->serial) return;
  if (queue->blocks.empty()) {
    queue->busy = false;
    return;
  }
  ready_.push_back({nullptr, queue->name, queue, std::move(queue->blocks.front())});
  queue->blocks.pop_front();
}

void Scheduler::handOver(Thread& to) {
  const MutexLock lock(baton_);
  to.hasBaton = true;
  to.turn.notifyOne();
}

void Scheduler::awaitTurn(Thread& thread) {
  const MutexLock lock(baton_);
  while (!thread.hasBaton) {
    if (&thread != test_.get()) {
      thread.turn.wait(baton_);
    } else if (!thread.turn.waitUntil(baton_, std::chrono::steady_clock::now() + kHung)) {
      std::fprintf(stderr, "QUARVEL_SEED=%llu: a thread blocks outside the simulated platform\n",
                   static_cast<unsigned long long>(seed_));
      std::abort();
    }
  }
  thread.hasBaton = false;
}

}  // namespace quarvel
