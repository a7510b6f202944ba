#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Date.h"
#include "base/Error.h"
#include "base/Mutex.h"
#include "store/StoreDatabase.h"
#include "store/StoreQueue.h"

namespace quarvel {

/// The store's one writer: takes batches from the queue and commits them, has synced beside that
/// what would wait for a sync too long, keeps the file within its bounds. Owned by the store;
/// everything runs on the store's thread.
class StoreWriter {
 public:
  struct Options {
    StoreDatabase::Options database;
    std::chrono::milliseconds sync{1000};
    std::chrono::milliseconds firstBackOff{50};
    std::chrono::days maximumAge{14};
    std::chrono::milliseconds ageing{std::chrono::hours{1}};
    std::function<Date()> clock;
  };

  /// `database` is null when the file could not be opened, for the reason `failure`, and is to be
  /// tried again. `queue` must outlive the writer.
  StoreWriter(Options options, std::unique_ptr<StoreDatabase> database,
              const std::optional<Error>& failure, StoreQueue& queue);

  /// Works until the queue is closed and empty, then closes the database.
  void run();

  /// Why the store takes no rows now, or cannot make them safe; none while all is well. Any thread.
  [[nodiscard]] std::optional<std::string> problem() const QUARVEL_EXCLUDES(problemMutex_);

  /// As `TelemetryStore::followDurableExtent`.
  void followDurableExtent(std::function<void(const DurableExtent&)> follower)
      QUARVEL_EXCLUDES(following_);

 private:
  using Instant = StoreQueue::Instant;
  using Flush = std::function<void(const std::optional<Error>&)>;

  /// At most one line a minute.
  class Minutely {
   public:
    bool due();

   private:
    std::optional<Instant> last_;
  };

  /// What is next to do if no rows come.
  [[nodiscard]] std::optional<Instant> nextDeadline() const;
  void atDeadline();
  void write(const StoreBatch& batch);
  /// Commits rows, however long that takes; false when the store was closed before it could.
  bool writeRows(const StoreBatch& batch, std::size_t first, std::size_t last);
  [[nodiscard]] bool tryToWrite(const StoreBatch& batch, std::size_t first, std::size_t last);
  [[nodiscard]] bool needsFullCommit(const StoreBatch& batch, std::size_t last) const;
  void complete(const StoreBatch& batch, std::size_t first, std::size_t last,
                const std::optional<Error>& error);
  void lose(const StoreBatch& batch, std::size_t first);
  /// Sees to what the medium has answered, and begins what is due.
  void attendMedium();
  void takeSafe();
  void uncover();
  /// Waits for what is under way at the medium.
  void settle();
  /// Everything up to these ids is on the medium now.
  void isSafe(const StoreIDs& ids) QUARVEL_EXCLUDES(following_);
  void allIsSafe() QUARVEL_EXCLUDES(following_);
  void completeFlushes(std::vector<Flush>& flushes, const std::optional<Error>& error);
  void erase();
  void endErasure(const Result<std::int64_t>& rows);
  void syncHere();
  void makeRoom(const StoreQueue::Tally& incoming);
  /// Finds out whether the clock was set.
  void watchClock(Date now);
  /// Has rows past their age removed, unless the clock was set since that was last done: who sets
  /// it forward by years must not empty the store.
  void beginAgeing(Date now);
  /// One step of retention. False when there is nothing more to do.
  bool retain(std::uint64_t incomingBytes, const std::optional<Retention::Expiry>& expired);
  void reportRemoved(bool now);
  /// A file that was taken away still takes rows, but nobody would find them.
  void putBackIfTakenAway();
  [[nodiscard]] Error databaseError() const;
  /// Reports, and closes a file that turns out to be corrupt: opening it again deals with that.
  void failed(Error error);
  void succeeded();
  void setProblem(std::optional<std::string> problem) QUARVEL_EXCLUDES(problemMutex_);
  void close();
  void adopt(std::unique_ptr<StoreDatabase> database);
  [[nodiscard]] bool reopen(bool isSuspect);
  void finish();

  const Options options_;
  const std::chrono::milliseconds syncAfter_;
  StoreQueue& queue_;
  struct PendingErasure {
    ErasureRow wanted;
    StoreIDs through;
  };
  std::deque<PendingErasure> erasures_;                    // the first one is under way
  std::unique_ptr<StoreDatabase> database_;         // null while the file cannot be opened
  std::unique_ptr<Erasure> erasure_;                // on the database; null before its first step
  StoreIDs knownIDs_;                               // of a file that was closed
  bool isSuspect_ = false;                          // the file has been found to be corrupt
  std::optional<std::int64_t> lastEarlierSession_;  // of before this store was opened
  Error failure_;                                   // of the last attempt
  bool failing_ = false;
  Minutely failureLine_;
  bool gaveUp_ = false;  // the store was closed while it took no rows
  // What a power cut would take, and no sync that is under way covers: since when, and who waits.
  std::optional<Instant> unsyncedSince_;
  std::vector<Flush> flushes_;
  // The same of what is under way.
  std::optional<Instant> coveredSince_;
  std::vector<Flush> coveredFlushes_;
  std::chrono::milliseconds syncBackOff_{0};  // after a failure
  Instant syncNotBefore_{};
  bool clockWasSet_ = false;                  // since rows were last looked at for their age
  bool clockMarkIsDue_ = false;               // the store does not know yet that it was
  bool retaining_ = true;                     // there may be rows to remove
  std::optional<Retention::Expiry> expired_;  // ... these, by a clock that has run on
  Instant agedAt_;                            // when rows were last looked at for their age
  std::chrono::nanoseconds clockSeenAt_;      // since boot
  Date clockSeen_;                            // ... by the clock
  std::uint64_t removedNotExported_ = 0;      // and not yet reported
  Minutely removedLine_;

  mutable Mutex problemMutex_;
  std::optional<std::string> problem_ QUARVEL_GUARDED_BY(problemMutex_);

  Mutex following_;
  DurableExtent extent_ QUARVEL_GUARDED_BY(following_);
  std::function<void(const DurableExtent&)> extentFollower_ QUARVEL_GUARDED_BY(following_);
};

}  // namespace quarvel
