#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <vector>

#include "base/Error.h"
#include "base/Mutex.h"
#include "store/StoreDatabase.h"
#include "store/StoreHealth.h"

namespace quarvel {

/// Makes commits durable: decides when to sync and to checkpoint, completes flushes after the sync
/// that covers them, and publishes the durable extent. A commit survives the end of the process; it
/// survives a power cut once a sync has covered it, at most `sync` after its rows were queued.
///
/// Owned by the `StoreWriter`, as long as it lives; the writer's thread, but for
/// `followDurableExtent`. Failures go to `StoreHealth`; the writer decides about the file.
class StoreDurability {
 public:
  using Instant = std::chrono::steady_clock::time_point;
  using FlushCompletion = std::function<void(const std::optional<Error>&)>;

  /// `sync` 0: each commit syncs by itself. `health` must outlive this.
  StoreDurability(std::chrono::milliseconds sync, BackOff::Bounds backOff, StoreHealth& health);

  /// The open database, or null when it is closed. Closing makes all commits durable, as far as the
  /// medium works; flushes that no sync has covered wait for the next file.
  void setDatabase(StoreDatabase* database);

  [[nodiscard]] bool everyCommitSyncs() const { return sync_.count() == 0; }
  /// Notes a commit that no sync covers yet, of rows queued at `since`.
  void noteUnsynced(Instant since = std::chrono::steady_clock::now());
  [[nodiscard]] bool hasUnsynced() const { return unsyncedSince_ || !flushes_.empty(); }
  /// Calls `completion` once everything committed so far is durable: at once when it is.
  void completeWhenDurable(const FlushCompletion& completion);

  /// When `beginSyncIfDue` has to be called although no row comes; none while nothing is unsynced,
  /// or a task is in flight, whose end wakes the writer.
  [[nodiscard]] std::optional<Instant> nextSync() const;
  /// Takes the result of a task that has ended: completes its flushes, or has the next sync cover
  /// them too.
  void takeSyncResult() QUARVEL_EXCLUDES(extentMutex_);
  /// Begins the checkpoint or sync that is due, unless a task is in flight.
  void beginSyncIfDue() QUARVEL_EXCLUDES(extentMutex_);
  /// Returns when no task is in flight, its result taken.
  void waitForSync() QUARVEL_EXCLUDES(extentMutex_);
  /// Syncs on this thread.
  void syncNow() QUARVEL_EXCLUDES(extentMutex_);
  /// Notes that the last commit, a full one, made all commits durable.
  void noteAllDurable() QUARVEL_EXCLUDES(extentMutex_);
  /// At the end of the store: completes the flushes that are left.
  void failFlushes(const Error& error) { complete(flushes_, error); }

  /// See `TelemetryStore::followDurableExtent`. Any thread.
  void followDurableExtent(std::function<void(const DurableExtent&)> follower)
      QUARVEL_EXCLUDES(extentMutex_);

 private:
  /// After a task that made nothing durable: its commits and flushes need another sync.
  void restoreUnsynced();
  void noteDurable(const StoreIDs& ids) QUARVEL_EXCLUDES(extentMutex_);
  static void complete(std::vector<FlushCompletion>& flushes, const std::optional<Error>& error);

  const std::chrono::milliseconds sync_;
  const std::chrono::milliseconds syncAfter_;
  StoreHealth& health_;
  StoreDatabase* database_ = nullptr;

  // Commits that no task covers, and their flushes.
  std::optional<Instant> unsyncedSince_;
  std::vector<FlushCompletion> flushes_;
  // The same for the task in flight.
  std::optional<Instant> coveredSince_;
  std::vector<FlushCompletion> coveredFlushes_;
  BackOff backOff_;
  Instant syncNotBefore_{};  // after a failure

  Mutex extentMutex_;
  DurableExtent extent_ QUARVEL_GUARDED_BY(extentMutex_);
  std::function<void(const DurableExtent&)> extentFollower_ QUARVEL_GUARDED_BY(extentMutex_);
};

}  // namespace quarvel
