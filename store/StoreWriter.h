#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "base/Date.h"
#include "base/Error.h"
#include "store/StoreAgeing.h"
#include "store/StoreDatabase.h"
#include "store/StoreDurability.h"
#include "store/StoreHealth.h"
#include "store/StoreQueue.h"

namespace quarvel {

/// Commits: takes batches from the queue and writes them, retries after failures, opens and closes
/// the file, carries out erasures. `StoreDurability` and `StoreAgeing` do the rest on the same
/// thread.
///
/// Owned by the `TelemetryStore`, as long as it lives. Everything runs on the store's thread, but
/// for `problem` and `followDurableExtent`.
class StoreWriter {
 public:
  struct Options {
    StoreDatabase::Options database;
    std::chrono::milliseconds sync{1000};
    BackOff::Bounds backOff;
    std::chrono::days maximumAge{14};
    std::chrono::milliseconds ageing{std::chrono::hours{1}};
    std::function<Date()> clock;
  };

  /// `database` is null when the file could not be opened, for the reason `failure`, and has to be
  /// tried again. `queue` must outlive the writer.
  StoreWriter(Options options, std::unique_ptr<StoreDatabase> database,
              const std::optional<Error>& failure, StoreQueue& queue);

  /// Works until the queue is closed and empty, then closes the database.
  void run();

  /// See `StoreHealth::problem`. Any thread.
  [[nodiscard]] std::optional<std::string> problem() const { return health_.problem(); }
  /// See `TelemetryStore::followDurableExtent`. Any thread.
  void followDurableExtent(std::function<void(const DurableExtent&)> follower) {
    durability_.followDurableExtent(std::move(follower));
  }

 private:
  using Instant = StoreQueue::Instant;

  /// When work is due although no row comes.
  [[nodiscard]] std::optional<Instant> nextDeadline() const;
  void atDeadline();
  void pollSync();
  void waitForSync();

  void write(const StoreBatch& batch);
  /// Commits rows and retries until it succeeds. False when the store was closed before.
  bool writeRows(const StoreBatch& batch, std::size_t first, std::size_t last);
  [[nodiscard]] bool tryToWrite(const StoreBatch& batch, std::size_t first, std::size_t last);
  [[nodiscard]] bool needsFullCommit(const StoreBatch& batch, std::size_t last) const;
  void completeRows(const StoreBatch& batch, std::size_t first, std::size_t last,
                    const std::optional<Error>& error);
  void loseRows(const StoreBatch& batch, std::size_t first);

  /// One step of the first erasure.
  void erase();
  void endErasure(const Result<std::int64_t>& rows);

  /// Opens the file again.
  [[nodiscard]] bool reopen(bool isSuspect);
  void use(std::unique_ptr<StoreDatabase> database);
  /// After a failure: closes a file that turns out to be corrupt. The next opening sets it aside.
  void closeIfCorrupt();
  void close();
  /// Rows in a file that was removed or renamed would be lost with its last descriptor.
  void restoreFileIfGone();
  void finish();

  struct PendingErasure {
    ErasureRow wanted;
    StoreIDs through;
  };

  const Options options_;
  StoreQueue& queue_;
  StoreHealth health_;
  StoreDurability durability_;
  StoreAgeing ageing_;
  std::unique_ptr<StoreDatabase> database_;         // null while the file cannot be opened
  StoreIDs knownIDs_;                               // of a file that was closed
  std::optional<std::int64_t> lastEarlierSession_;  // before this store was opened
  bool isSuspect_ = false;                          // corruption was met in the file
  bool gaveUp_ = false;                             // the store was closed while it took no rows
  std::deque<PendingErasure> erasures_;             // the first one is being carried out
  std::unique_ptr<Erasure> erasure_;                // on the database; null before its first step
};

}  // namespace quarvel
