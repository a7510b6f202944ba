#include "queues/InlineRunner.h"

#include <cstddef>
#include <utility>
#include <vector>

#include "queues/PendingWork.h"
#include "queues/Pool.h"

namespace quarvel {

namespace {

constexpr std::chrono::milliseconds kLongest(1);

struct Adopted {
  std::shared_ptr<QueueState> queue;
  Pool* pool;
};

/// One thread's, kept from scope to scope for its memory.
struct Helper {
  InlineRunner* scope = nullptr;
  std::vector<Adopted> adopted;
  std::size_t next = 0;
};
thread_local Helper helper;

}  // namespace

InlineRunner::InlineRunner() : end_(std::chrono::steady_clock::now() + kLongest) {
  helper.scope = this;
}

InlineRunner::~InlineRunner() {
  exhaust();
  while (runOne()) {
  }
  helper.adopted.clear();
  helper.next = 0;
  helper.scope = nullptr;
}

bool InlineRunner::runOne() {
  if (helper.next == helper.adopted.size()) return false;
  Adopted adopted = std::move(helper.adopted[helper.next++]);
  if (isExhausted() || Pool::takeTurnHere(*adopted.queue, *this)) {
    adopted.pool->submit(std::move(adopted.queue));
  }
  PendingWorkDone();
  return true;
}

InlineRunner* InlineRunner::current() {
  return helper.scope;
}

void InlineRunner::adopt(std::shared_ptr<QueueState> queue, Pool& pool) {
  PendingWorkAdded();
  helper.adopted.push_back({std::move(queue), &pool});
}

bool InlineRunner::isExhausted() {
  // Asked for each of blocks that take a microsecond: looking at the clock would be felt.
  constexpr unsigned kAsksPerLook = 8;
  if (exhausted_ || ++asked_ % kAsksPerLook != 0) return exhausted_;
  exhausted_ = std::chrono::steady_clock::now() >= end_;
  return exhausted_;
}

}  // namespace quarvel
