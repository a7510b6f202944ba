#include "store/StoreQueue.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>

#include "queues/BlockingScope.h"
#include "store/database/StoreError.h"

namespace quarvel {

void StoreQueue::Tally::add(const StoreRow& row) {
  ++rows;
  bytes += StoreBatch::bytes(row);
  if (StoreBatch::isCounted(row)) ++counted;
}

bool StoreQueue::hasRoom() const {
  return outstanding_.rows < depth_.rows() && outstanding_.bytes < maximumBytes_;
}

void StoreQueue::awaitRoom() {
  if (closed_ || hasRoom() || !BlockingScope::isAllowed()) return;
  const BlockingScope blocking;
  ++waitingSenders_;
  while (!closed_ && !hasRoom()) roomFree_.wait(mutex_);
  --waitingSenders_;
}

Error StoreQueue::refuse(std::uint64_t counted) {
  dropAccepted(StoreDrop::refused, counted);
  if (closed_) return StoreError(StoreErrorCode::closed, "The telemetry store is closed.");
  return StoreError(
      StoreErrorCode::tooLarge,
      fmt::format("A row of the telemetry store has at most {} MiB of texts and payload.",
                  kMostRowBytes >> 20));
}

void StoreQueue::dropAccepted(StoreDrop reason, std::uint64_t rows) {
  counters_.accepted += rows;
  counters_.dropped[reason] += rows;
}

void StoreQueue::countDropped(StoreDrop reason) {
  MutexLock lock(mutex_);
  dropAccepted(reason, 1);
  countQueued();
}

void StoreQueue::appended() {
  const StoreRow& row = waiting_.rows().back();
  outstanding_.add(row);
  if (StoreBatch::isCounted(row)) {
    ++counters_.accepted;
    ++counters_.waiting;
  }
  if (writerWaits_) hasRows_.notifyOne();
}

void StoreQueue::close() {
  MutexLock lock(mutex_);
  if (!closed_) {
    const std::int64_t unqueued = unqueued_.exchange(0);
    dropAccepted(StoreDrop::serviceEnded,
                 static_cast<std::uint64_t>(std::max(unqueued, std::int64_t{0})));
  }
  closed_ = true;
  hasRows_.notifyAll();
  roomFree_.notifyAll();
  closing_.notifyAll();
}

bool StoreQueue::isClosed() const {
  MutexLock lock(mutex_);
  return closed_;
}

StoreQueue::Take StoreQueue::take(StoreBatch& batch, std::optional<Instant> deadline) {
  MutexLock lock(mutex_);
  while (waiting_.rows().empty()) {
    if (closed_) return Take::closed;
    if (std::exchange(called_, false)) return Take::called;
    writerWaits_ = true;
    bool inTime = true;
    if (deadline) {
      inTime = hasRows_.waitUntil(mutex_, *deadline);
    } else {
      hasRows_.wait(mutex_);
    }
    writerWaits_ = false;
    if (!inTime && waiting_.rows().empty() && !closed_) return Take::deadline;
  }
  called_ = false;
  std::swap(waiting_, batch);
  batch.isLast = closed_;
  return Take::rows;
}

void StoreQueue::call() {
  MutexLock lock(mutex_);
  called_ = true;
  if (writerWaits_) hasRows_.notifyOne();
}

bool StoreQueue::waitForClose(Instant deadline) {
  MutexLock lock(mutex_);
  while (!closed_) {
    if (!closing_.waitUntil(mutex_, deadline)) break;
  }
  return closed_;
}

void StoreQueue::release(const Tally& tally) {
  outstanding_.rows -= tally.rows;
  outstanding_.bytes -= tally.bytes;
  outstanding_.counted -= tally.counted;
  counters_.waiting -= tally.counted;
  if (waitingSenders_ > 0 && hasRoom()) roomFree_.notifyAll();
}

void StoreQueue::committed(const Tally& tally, std::chrono::nanoseconds time) {
  MutexLock lock(mutex_);
  counters_.stored += tally.counted;
  depth_.committed(tally.rows, time);
  release(tally);
}

void StoreQueue::lost(const Tally& tally) {
  MutexLock lock(mutex_);
  counters_.dropped[StoreDrop::storeClosed] += tally.counted;
  release(tally);
}

void StoreQueue::restart(std::uint64_t stored, const StoreDrops& kept) {
  MutexLock lock(mutex_);
  counters_.stored = stored;
  for (const StoreDrop reason : kDropsFromStore) counters_.dropped[reason] = kept[reason];
  for (const StoreDrop reason : kDropsBeforeStore) {
    // A drop since the last commit is not recorded in the database yet.
    counters_.dropped[reason] = std::max(counters_.dropped[reason], kept[reason]);
  }
  counters_.accepted = stored + counters_.waiting + counters_.dropped.sum();
}

void StoreQueue::droppedFromStore(StoreDrop reason, std::uint64_t rows) {
  MutexLock lock(mutex_);
  counters_.stored -= rows;
  counters_.dropped[reason] += rows;
}

StoreCounters StoreQueue::counters() const {
  MutexLock lock(mutex_);
  StoreCounters counters = counters_;
  const auto unqueued = static_cast<std::uint64_t>(std::max(unqueued_.load(), std::int64_t{0}));
  counters.accepted += unqueued;
  counters.waiting += unqueued;
  return counters;
}

StoreQueue::Tally StoreQueue::outstanding() const {
  MutexLock lock(mutex_);
  return outstanding_;
}

}  // namespace quarvel
