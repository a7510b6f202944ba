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
  /// See `TelemetryStore::Options`.
  struct Options {
    StoreDatabase::Options database;
    std::chrono::milliseconds sync{1000};
    BackOff::Bounds backOff;  // between attempts
    std::chrono::days maximumAge{14};
    std::chrono::milliseconds ageing{std::chrono::hours{1}};
    std::function<Date()> clock;  // never empty
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
  /// Begins a new file in place of a corrupt one; one step of erasure and one of removal.
  void atDeadline();
  /// Takes the result of a task that has ended and begins the sync or checkpoint that is due.
  void pollSync();
  void waitForSync();

  /// Commits a batch, one transaction for each 1,024 rows; an erasure ends its transaction.
  void write(const StoreBatch& batch);
  /// Commits rows and retries until it succeeds. False when the store was closed before.
  bool writeRows(const StoreBatch& batch, std::size_t first, std::size_t last);
  /// One attempt; false when it failed, with nothing written.
  [[nodiscard]] bool tryToWrite(const StoreBatch& batch, std::size_t first, std::size_t last);
  /// Whether the commit has to be durable by itself, instead of by a later sync.
  [[nodiscard]] bool needsFullCommit(const StoreBatch& batch, std::size_t last) const;
  /// Calls the completions of rows that are committed, or lost with `error`.
  void completeRows(const StoreBatch& batch, std::size_t first, std::size_t last,
                    const std::optional<Error>& error);
  /// The store was closed before rows `first` and later were committed: counts them as lost.
  void loseRows(const StoreBatch& batch, std::size_t first);

  /// One step of the first erasure.
  void erase();
  /// Calls the first erasure's completion; the next one becomes the first.
  void endErasure(const Result<std::int64_t>& rows);

  /// Opens the file again.
  [[nodiscard]] bool reopen(bool isSuspect);
  /// Has durability and ageing work on an opened file, and the queue take over its counts.
  void use(std::unique_ptr<StoreDatabase> database);
  /// After a failure: closes a file that turns out to be corrupt. The next opening sets it aside.
  void closeIfCorrupt();
  /// Closes the file; keeps the ids and drops that the next opening has to know.
  void close();
  /// Rows in a file that was removed or renamed would be lost with its last descriptor.
  void restoreFileIfGone();
  /// The end: refuses erasures, syncs, completes the flushes and closes the file.
  void finish();

  struct PendingErasure {
    ErasureRow wanted;
    StoreIDs through;  // rows that were added later stay
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
