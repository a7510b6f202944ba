#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string_view>
#include <utility>

#include "base/Error.h"
#include "base/Mutex.h"
#include "base/StoreCounters.h"
#include "store/StoreBatch.h"

namespace quarvel {

/// Between any number of senders and the store's writer: bounded, first come, first served. A row
/// counts against the bounds until it is committed or lost. There may be as many rows as are
/// committed in a few milliseconds, however slow the machine, so that what is here is soon safe
/// from the end of the process.
class StoreQueue {
 public:
  using Instant = StoreBatch::Instant;

  StoreQueue(std::size_t maximumRows, std::size_t maximumBytes)
      : maximumRows_(maximumRows), maximumBytes_(maximumBytes), rowsInTime_(maximumRows) {}

  /// Any thread. Holds the caller back while either bound is reached, so that the bound on bytes
  /// may be passed by one row; but lets one pass that must not wait (`BlockingScope`). Errors: the
  /// queue is closed, also while the caller was held back; the row is larger than any may be.
  template <class Row>
  Outcome push(Row&& row, std::initializer_list<std::string_view> texts) QUARVEL_EXCLUDES(mutex_) {
    const bool tooLarge = IsTooLarge(row, texts);
    MutexLock lock(mutex_);
    if (!tooLarge) awaitRoom();
    if (closed_ || tooLarge) return refuse(1);
    append(std::forward<Row>(row), texts);
    return Success();
  }

  /// As `push`, but where that would hold the caller back it does nothing and returns false. True
  /// also when the row is refused.
  template <class Row>
  [[nodiscard]] bool pushIfRoom(Row&& row, std::initializer_list<std::string_view> texts)
      QUARVEL_EXCLUDES(mutex_) {
    const bool tooLarge = IsTooLarge(row, texts);
    MutexLock lock(mutex_);
    if (closed_ || tooLarge) {
      (void)refuse(1);
    } else if (hasRoom()) {
      append(std::forward<Row>(row), texts);
    } else {
      return false;
    }
    return true;
  }

  /// As `push`, but never holds the caller back: for the few rows that everything else rests on.
  template <class Row>
  Outcome pushAtOnce(Row&& row, std::initializer_list<std::string_view> texts)
      QUARVEL_EXCLUDES(mutex_) {
    const bool tooLarge = IsTooLarge(row, texts);
    MutexLock lock(mutex_);
    if (closed_ || tooLarge) return refuse(0);
    append(std::forward<Row>(row), texts);
    return Success();
  }

  // What never was a row. Any thread; never holds the caller back.

  /// Counts a message that is on its way to the queue, until it has `arrived`: pushed, or refused.
  void countAccepted() { ++onTheirWay_; }
  void countQueued() { --onTheirWay_; }
  /// It will not arrive.
  void countDropped(StoreDrop reason) QUARVEL_EXCLUDES(mutex_);

  /// Takes no more rows and wakes everybody; what is still on its way is counted as dropped. Any
  /// thread.
  void close() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool isClosed() const QUARVEL_EXCLUDES(mutex_);

  // The rest is the writer's.

  enum class Take : std::uint8_t { rows, called, deadline, closed };
  /// Exchanges the rows that wait for the empty `batch`. Waits for rows until `deadline`, if there
  /// is one, or somebody calls; `closed` once the queue is closed and empty.
  Take take(StoreBatch& batch, std::optional<Instant> deadline) QUARVEL_EXCLUDES(mutex_);
  /// Has the writer look up, although no rows have come. Any thread.
  void call() QUARVEL_EXCLUDES(mutex_);
  /// Waits until `deadline`, whatever is queued meanwhile; returns early, and true, when closed.
  [[nodiscard]] bool waitForClose(Instant deadline) QUARVEL_EXCLUDES(mutex_);

  struct Tally {
    std::size_t rows = 0;
    std::size_t bytes = 0;
    std::size_t counted = 0;

    void add(const StoreRow& row);
  };
  // Makes room: rows that were taken are now in the database, which took so long, or lost.
  void committed(const Tally& tally, std::chrono::nanoseconds time) QUARVEL_EXCLUDES(mutex_);
  void lost(const Tally& tally) QUARVEL_EXCLUDES(mutex_);

  /// Counts from what the opened database holds, and from the drops that it keeps.
  void restart(std::uint64_t stored, const StoreDrops& kept) QUARVEL_EXCLUDES(mutex_);
  void droppedFromStore(StoreDrop reason, std::uint64_t rows) QUARVEL_EXCLUDES(mutex_);

  [[nodiscard]] StoreCounters counters() const QUARVEL_EXCLUDES(mutex_);
  /// What counts against the bounds now.
  [[nodiscard]] Tally outstanding() const QUARVEL_EXCLUDES(mutex_);

 private:
  [[nodiscard]] bool hasRoom() const QUARVEL_REQUIRES(mutex_);
  void awaitRoom() QUARVEL_REQUIRES(mutex_);
  Error refuse(std::uint64_t counted) QUARVEL_REQUIRES(mutex_);
  void dropAccepted(StoreDrop reason, std::uint64_t rows) QUARVEL_REQUIRES(mutex_);
  void release(const Tally& tally) QUARVEL_REQUIRES(mutex_);
  void learn(std::size_t rows, std::chrono::nanoseconds time) QUARVEL_REQUIRES(mutex_);

  template <class Row>
  void append(Row&& row, std::initializer_list<std::string_view> texts) QUARVEL_REQUIRES(mutex_) {
    if (waiting_.rows().empty()) waiting_.queuedAt = std::chrono::steady_clock::now();
    waiting_.append(std::forward<Row>(row), texts);
    appended();
  }
  void appended() QUARVEL_REQUIRES(mutex_);

  const std::size_t maximumRows_;
  const std::size_t maximumBytes_;

  std::atomic<std::int64_t> onTheirWay_ = 0;

  mutable Mutex mutex_;
  ConditionVariable rowsCame_;  // for the writer
  ConditionVariable roomCame_;  // for senders
  ConditionVariable closing_;   // for the writer while it waits for room on the disk
  bool closed_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool writerWaits_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool called_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::size_t heldBack_ QUARVEL_GUARDED_BY(mutex_) = 0;
  StoreBatch waiting_ QUARVEL_GUARDED_BY(mutex_);
  Tally outstanding_ QUARVEL_GUARDED_BY(mutex_);         // queued, or taken and not yet committed
  std::int64_t rowTime_ QUARVEL_GUARDED_BY(mutex_) = 0;  // of a commit, in nanoseconds; 0: unknown
  std::size_t rowsInTime_ QUARVEL_GUARDED_BY(mutex_);
  StoreCounters counters_  // without what is on its way
      QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
