#include "queues/BlockingScope.h"

#include <cstddef>
#include <utility>
#include <vector>

#include "queues/Pool.h"

namespace quarvel {

namespace {

/// Other clients wait for the I/O thread meanwhile.
constexpr std::chrono::milliseconds kLongestRun(1);

struct ReadyQueue {
  std::shared_ptr<QueueState> queue;
  Pool* pool;
};

/// Kept from runner to runner for the vector's memory.
struct ThreadState {
  InlineRunner* runner = nullptr;
  std::vector<ReadyQueue> queues;
  std::size_t next = 0;
};
thread_local ThreadState threadState;

}  // namespace

BlockingScope::BlockingScope() {
  Pool::beginBlocking();
}

BlockingScope::~BlockingScope() {
  Pool::endBlocking();
}

bool BlockingScope::isAllowed() {
  InlineRunner* const runner = InlineRunner::current();
  if (runner == nullptr) return true;
  runner->exhaust();
  return false;
}

InlineRunner::InlineRunner() : end_(std::chrono::steady_clock::now() + kLongestRun) {
  threadState.runner = this;
}

InlineRunner::~InlineRunner() {
  exhaust();
  while (runOne()) {
  }
  threadState.queues.clear();
  threadState.next = 0;
  threadState.runner = nullptr;
}

bool InlineRunner::runOne() {
  if (threadState.next == threadState.queues.size()) return false;
  auto [queue, pool] = std::move(threadState.queues[threadState.next++]);
  if (isExhausted() || Pool::takeInlineTurn(*queue, *this)) pool->submit(std::move(queue));
  pool->pendingWork().remove();
  return true;
}

InlineRunner* InlineRunner::current() {
  return threadState.runner;
}

void InlineRunner::add(std::shared_ptr<QueueState> queue, Pool& pool) {
  pool.pendingWork().add();
  threadState.queues.push_back({std::move(queue), &pool});
}

bool InlineRunner::isExhausted() {
  // Asked before each block, which may take a microsecond: the clock costs too much for each.
  constexpr unsigned kChecksPerClockRead = 8;
  if (exhausted_ || ++checks_ % kChecksPerClockRead != 0) return exhausted_;
  exhausted_ = std::chrono::steady_clock::now() >= end_;
  return exhausted_;
}

}  // namespace quarvel
