#include "quotas/FlowControl.h"

#include <utility>

namespace quarvel {

CallFlow::CallFlow(std::size_t calls, std::size_t bytes)
    : callsLimit_(calls),
      bytesLimit_(bytes),
      callTime_(flow::kCallTurn.count() / static_cast<std::int64_t>(flow::kFirstCallTurn)),
      turn_(std::min(flow::kFirstCallTurn, calls)),
      unstoredLimit_(flow::kUnstoredCalls) {}

void CallFlow::callBegun(std::size_t bytes) {
  begun_.fetch_add(1);
  executing_.fetch_add(1);
  bytes_.fetch_add(bytes);
}

void CallFlow::blockRan(std::chrono::nanoseconds time) {
  // Blocks that end at the same time on two threads may overwrite each other's value: it is an
  // estimate.
  const std::int64_t known = callTime_.load(std::memory_order_relaxed);
  const std::int64_t callTime = std::max({known + (time.count() - known) / flow::kCallTimeShare,
                                          time.count() / flow::kHeavyCallShare, std::int64_t{1}});
  callTime_.store(callTime, std::memory_order_relaxed);
  turn_ = std::clamp(static_cast<std::size_t>(flow::kCallTurn.count() / callTime), std::size_t{1},
                     callsLimit_);
}

bool CallFlow::callExecuted() {
  executing_.fetch_sub(1);
  return wakeIfHalfIsFree();
}

bool CallFlow::callCompleted(std::size_t bytes) {
  completed_.fetch_add(1);
  bytes_.fetch_sub(bytes);
  return wakeIfHalfIsFree();
}

bool CallFlow::wakeIfHalfIsFree() {
  return waiting_ && halfIsFree() && waiting_.exchange(false);
}

bool CallFlow::mustWait(FlowClock clock) {
  if (waiting_ || isFull()) {
    if (isFullOfUnstored() && !fullOfUnstoredSince_) fullOfUnstoredSince_ = clock();
    // Set before the second look: a call that ends in between is either seen here or sees the flag.
    waiting_ = true;
    if (!halfIsFree()) return true;
    waiting_ = false;
  }
  if (fullOfUnstoredSince_) {
    adaptUnstoredLimit(clock() - *std::exchange(fullOfUnstoredSince_, std::nullopt));
  }
  return false;
}

void CallFlow::adaptUnstoredLimit(std::chrono::nanoseconds took) {
  if (took > flow::kSlowToStore) {
    unstoredLimit_ = std::max<std::size_t>(unstoredLimit_ / 2, 1);
  } else if (took < flow::kFastToStore) {
    unstoredLimit_ = std::min(unstoredLimit_ * 2, flow::kUnstoredCalls);
  }
}

void CallFlow::exemptSlowCalls(std::size_t completedBefore) {
  if (completed_ != completedBefore) return;
  exempt_ = unstored();
  fullOfUnstoredSince_.reset();
}

bool CallFlow::isFull() const {
  return executing_ >= turn_ || bytes_ >= bytesLimit_ || isFullOfUnstored();
}

bool CallFlow::halfIsFree() const {
  return executing_ <= turn_ / 2 && bytes_ <= bytesLimit_ / 2 &&
         unstored() <= exempt_ + unstoredLimit_ / 2;
}

bool ChurnLimit::mustWait() {
  if (changes_ < flow::kConnectionChanges) return false;
  // Set before the second look: a change that ends in between is either seen here or sees the flag.
  waiting_ = true;
  if (changes_ > flow::kConnectionChanges / 2) return true;
  waiting_ = false;
  return false;
}

void StoreDepth::committed(std::size_t rows, std::chrono::nanoseconds time) {
  if (rows < flow::kFewestRows) return;
  // A commit that took seconds (a full disk) says nothing about the next: no row counts for more
  // than its share of the smallest depth.
  constexpr std::int64_t kLongest =
      flow::kCommitTime.count() / static_cast<std::int64_t>(flow::kFewestRows);
  const std::int64_t rowTime =
      std::clamp(time.count() / static_cast<std::int64_t>(rows), std::int64_t{1}, kLongest);
  rowTime_ = rowTime_ == 0 ? rowTime
                           : ((flow::kRowTimeShare - 1) * rowTime_ + rowTime) / flow::kRowTimeShare;
  learnedRows_ = static_cast<std::size_t>(flow::kCommitTime.count() / rowTime_);
}

}  // namespace quarvel
