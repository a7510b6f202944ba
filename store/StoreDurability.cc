#include "store/StoreDurability.h"

#include <algorithm>
#include <iterator>
#include <utility>

namespace quarvel {

namespace {

using std::chrono::steady_clock;

/// Leaves time for the sync itself: a quarter of the interval, at most 100 ms.
std::chrono::milliseconds SyncAfter(std::chrono::milliseconds sync) {
  return sync - std::min(sync / 4, std::chrono::milliseconds{100});
}

}  // namespace

StoreDurability::StoreDurability(std::chrono::milliseconds sync, BackOff::Bounds backOff,
                                 StoreHealth& health)
    : sync_(sync), syncAfter_(SyncAfter(sync)), health_(health), backOff_(backOff) {}

void StoreDurability::setDatabase(StoreDatabase* database) {
  database_ = database;
  if (database != nullptr) return;
  restoreUnsynced();
  unsyncedSince_.reset();
}

void StoreDurability::noteUnsynced(Instant since) {
  if (!unsyncedSince_) unsyncedSince_ = since;
}

void StoreDurability::completeWhenDurable(const FlushCompletion& completion) {
  if (unsyncedSince_) {
    flushes_.push_back(completion);
  } else {
    completion(std::nullopt);
  }
}

std::optional<StoreDurability::Instant> StoreDurability::nextSync() const {
  if (database_ == nullptr || database_->taskInFlight()) return std::nullopt;
  if (!flushes_.empty()) return syncNotBefore_;
  if (unsyncedSince_) return std::max(*unsyncedSince_ + syncAfter_, syncNotBefore_);
  return std::nullopt;
}

void StoreDurability::beginSyncIfDue() {
  if (database_ == nullptr || database_->taskInFlight()) return;
  if (!database_->beginCheckpointIfDue()) {
    const Instant now = steady_clock::now();
    const bool isDue = !flushes_.empty() || (unsyncedSince_ && now >= *unsyncedSince_ + syncAfter_);
    if (!isDue || now < syncNotBefore_) return;
    database_->beginSync();
  }
  coveredSince_ = std::exchange(unsyncedSince_, std::nullopt);
  coveredFlushes_ = std::exchange(flushes_, {});
  takeSyncResult();
}

void StoreDurability::takeSyncResult() {
  const auto result = database_ != nullptr ? database_->takeSyncResult() : std::nullopt;
  if (!result) return;
  if (result->durable) {
    if (backOff_.reset()) health_.succeeded();
    return noteDurable(result->ids);
  }
  restoreUnsynced();
  if (!result->syncFailed) return;
  syncNotBefore_ = steady_clock::now() + backOff_.next();
  health_.failed(database_->error());
}

void StoreDurability::restoreUnsynced() {
  if (coveredSince_) unsyncedSince_ = std::exchange(coveredSince_, std::nullopt);
  std::swap(flushes_, coveredFlushes_);
  std::ranges::move(coveredFlushes_, std::back_inserter(flushes_));
  coveredFlushes_.clear();
}

void StoreDurability::waitForSync() {
  if (database_ == nullptr) return;
  database_->waitForSync();
  takeSyncResult();
}

void StoreDurability::syncNow() {
  if (database_ == nullptr) return;
  if (database_->sync()) {
    health_.succeeded();
    return noteAllDurable();
  }
  health_.failed(database_->error());
  unsyncedSince_ = steady_clock::now();
}

void StoreDurability::noteAllDurable() {
  unsyncedSince_.reset();
  complete(flushes_, std::nullopt);
  noteDurable(database_->lastIDs());
}

void StoreDurability::noteDurable(const StoreIDs& ids) {
  coveredSince_.reset();
  complete(coveredFlushes_, std::nullopt);
  MutexLock lock(extentMutex_);
  DurableExtent extent{database_->storeID(), ids};
  if (extent == extent_) return;
  extent_ = std::move(extent);
  if (extentFollower_) extentFollower_(extent_);
}

void StoreDurability::complete(std::vector<FlushCompletion>& flushes,
                               const std::optional<Error>& error) {
  for (const FlushCompletion& completion : std::exchange(flushes, {})) completion(error);
}

void StoreDurability::followDurableExtent(std::function<void(const DurableExtent&)> follower) {
  MutexLock lock(extentMutex_);
  extentFollower_ = std::move(follower);
  if (extentFollower_) extentFollower_(extent_);
}

}  // namespace quarvel
