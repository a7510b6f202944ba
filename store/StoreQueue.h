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
#include "quotas/FlowControl.h"
#include "store/StoreBatch.h"

namespace quarvel {

/// Queue of rows from any number of senders to the store's writer, in order. Bounded by rows
/// (`StoreDepth`) and bytes; a row counts until it is committed or lost. A sender waits for room.
/// Owner: `TelemetryStore`. Threads: any; one lock.
class StoreQueue {
 public:
  using Instant = StoreBatch::Instant;

  /// `maximumRows`: the upper end of the bound that `StoreDepth` learns.
  StoreQueue(std::size_t maximumRows, std::size_t maximumBytes)
      : maximumBytes_(maximumBytes), depth_(maximumRows) {}

  // Any thread.

  /// Blocks while either bound is reached; the bound on bytes may be passed by one row. A caller
  /// that must not block (`BlockingScope`) passes the bounds. Errors: the queue is closed, also
  /// while the caller waited; the row is larger than `kMostRowBytes`.
  template <class Row>
  Outcome push(Row&& row, std::initializer_list<std::string_view> texts) QUARVEL_EXCLUDES(mutex_) {
    const bool tooLarge = IsTooLarge(row, texts);
    MutexLock lock(mutex_);
    if (!tooLarge) awaitRoom();
    if (closed_ || tooLarge) return refuse(1);
    append(std::forward<Row>(row), texts);
    return Success();
  }

  /// As `push`, but where that would block it does nothing and returns false. True also when the
  /// row is refused.
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

  /// As `push`, but never blocks and passes the bounds: for agent sessions, flushes, exports and
  /// erasures, which are few.
  template <class Row>
  Outcome pushAtOnce(Row&& row, std::initializer_list<std::string_view> texts)
      QUARVEL_EXCLUDES(mutex_) {
    const bool tooLarge = IsTooLarge(row, texts);
    MutexLock lock(mutex_);
    if (closed_ || tooLarge) return refuse(0);
    append(std::forward<Row>(row), texts);
    return Success();
  }

  // Counts of messages that are accepted and not pushed yet. Any thread; never blocks.

  /// A message was accepted and will be pushed later, or dropped.
  void countAccepted() { ++unqueued_; }
  /// An accepted message was pushed or refused.
  void countQueued() { --unqueued_; }
  /// An accepted message will not be pushed.
  void countDropped(StoreDrop reason) QUARVEL_EXCLUDES(mutex_);

  /// Refuses further rows and wakes every waiting thread; messages that are accepted and not pushed
  /// count as dropped. Any thread.
  void close() QUARVEL_EXCLUDES(mutex_);
  /// Whether `close` was called. Any thread; may be out of date on return.
  [[nodiscard]] bool isClosed() const QUARVEL_EXCLUDES(mutex_);

  // The writer's, except where any thread is named.

  enum class Take : std::uint8_t { rows, called, deadline, closed };
  /// Exchanges the queued rows for the empty `batch`. Blocks until there are rows, `call` was
  /// called or `deadline`, if there is one, has passed; `closed` once the queue is closed and
  /// empty.
  Take take(StoreBatch& batch, std::optional<Instant> deadline) QUARVEL_EXCLUDES(mutex_);
  /// Has `take` return without rows, once. Any thread.
  void call() QUARVEL_EXCLUDES(mutex_);
  /// Blocks until `deadline`, also when rows are queued; returns early, and true, when closed.
  [[nodiscard]] bool waitForClose(Instant deadline) QUARVEL_EXCLUDES(mutex_);

  /// Amounts that count against the bounds; `counted` of the rows are counted from acceptance on.
  struct Tally {
    std::size_t rows = 0;
    std::size_t bytes = 0;  // as `StoreBatch::bytes`
    std::size_t counted = 0;

    /// Adds one row of a batch.
    void add(const StoreRow& row);
  };
  // Makes room: rows that were taken are now in the database, in a transaction of `time`, or lost.
  void committed(const Tally& tally, std::chrono::nanoseconds time) QUARVEL_EXCLUDES(mutex_);
  void lost(const Tally& tally) QUARVEL_EXCLUDES(mutex_);

  /// Takes over the counts of the opened database: its rows, and the drops that it has recorded.
  void restart(std::uint64_t stored, const StoreDrops& kept) QUARVEL_EXCLUDES(mutex_);
  /// Stored rows were removed from the database: they count as dropped instead of stored.
  void droppedFromStore(StoreDrop reason, std::uint64_t rows) QUARVEL_EXCLUDES(mutex_);

  /// In every result accepted = stored + waiting + dropped. Any thread.
  [[nodiscard]] StoreCounters counters() const QUARVEL_EXCLUDES(mutex_);
  /// Rows and bytes that count against the bounds now.
  [[nodiscard]] Tally outstanding() const QUARVEL_EXCLUDES(mutex_);

 private:
  /// Whether both bounds allow a further row.
  [[nodiscard]] bool hasRoom() const QUARVEL_REQUIRES(mutex_);
  /// Blocks until `hasRoom` or the end, where the calling thread may block.
  void awaitRoom() QUARVEL_REQUIRES(mutex_);
  /// Counts a refused row (`counted` is 0 or 1) and tells why it is refused.
  Error refuse(std::uint64_t counted) QUARVEL_REQUIRES(mutex_);
  /// Counts rows as accepted and dropped: they will not be queued.
  void dropAccepted(StoreDrop reason, std::uint64_t rows) QUARVEL_REQUIRES(mutex_);
  /// Rows no longer count against the bounds.
  void release(const Tally& tally) QUARVEL_REQUIRES(mutex_);

  template <class Row>
  void append(Row&& row, std::initializer_list<std::string_view> texts) QUARVEL_REQUIRES(mutex_) {
    if (waiting_.rows().empty()) waiting_.queuedAt = std::chrono::steady_clock::now();
    waiting_.append(std::forward<Row>(row), texts);
    appended();
  }
  /// Counts the row that was appended last and wakes the writer.
  void appended() QUARVEL_REQUIRES(mutex_);

  const std::size_t maximumBytes_;

  std::atomic<std::int64_t> unqueued_ = 0;  // messages that are not pushed yet

  mutable Mutex mutex_;
  ConditionVariable hasRows_;   // the writer waits
  ConditionVariable roomFree_;  // senders wait
  ConditionVariable closing_;   // the writer waits for space on the disk
  bool closed_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool writerWaits_ QUARVEL_GUARDED_BY(mutex_) = false;  // for rows: `appended` has to wake it
  bool called_ QUARVEL_GUARDED_BY(mutex_) = false;       // and `take` has not returned since
  std::size_t waitingSenders_ QUARVEL_GUARDED_BY(mutex_) = 0;
  StoreBatch waiting_ QUARVEL_GUARDED_BY(mutex_);  // rows that `take` has not given out
  Tally outstanding_ QUARVEL_GUARDED_BY(mutex_);   // queued, or taken and not yet committed
  StoreDepth depth_ QUARVEL_GUARDED_BY(mutex_);    // the bound on rows, from the time of commits
  StoreCounters counters_ QUARVEL_GUARDED_BY(mutex_);  // without `unqueued_`
};

}  // namespace quarvel
