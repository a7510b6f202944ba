#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "base/Date.h"
#include "store/database/ClockMarks.h"
#include "store/database/Sqlite.h"
#include "store/database/Tables.h"

namespace quarvel {

/// Keeps the store within its bounds by removing the oldest rows, in steps of a few milliseconds
/// between commits. Rows that a remote backend has not yet received go last, but they go.
///
/// The file holds its bound because room is made before a batch is written, and because SQLite
/// reuses freed pages before the file grows. A file that is still too large (the bound was lowered)
/// is vacuumed page by page. The write-ahead log adds a few megabytes.
///
/// Owned by the `StoreDatabase`, whose connection it uses and with which it lives. The writer's
/// thread.
class Retention {
 public:
  struct Bounds {
    std::uint64_t maximumBytes = 268'435'456;  // of the database file
    /// The backends whose cursors say which rows have been exported; with none, no row waits.
    std::vector<std::string> remoteBackends;
  };

  /// `connection` and `lastIDs`, the last committed ids, must outlive this.
  Retention(Bounds bounds, SqliteConnection& connection, const StoreIDs& lastIDs)
      : bounds_(std::move(bounds)),
        connection_(connection),
        lastIDs_(lastIDs),
        clockMarks_(connection) {}

  /// Once, before this run of the service has stored anything. False when it failed.
  [[nodiscard]] bool prepare(Date now);

  /// Records that the clock was set, so that the times of rows from this run of the service are not
  /// trusted. False when that failed.
  [[nodiscard]] bool markClockSet(Date now) { return clockMarks_.add(now); }
  struct Expiry {
    Date before;
    StoreIDs trusted;  // beyond these ids nothing is removed for its age
  };
  /// The rows past their age, those from before `before`; none when a read failed.
  [[nodiscard]] std::optional<Expiry> expiry(Date now, Date before);

  enum class Progress : std::uint8_t { nothingToDo, more, failed };
  /// One step, in a transaction of its own, towards a file with room for about `incomingBytes` and,
  /// when `expired` is given, without such rows.
  [[nodiscard]] Progress step(std::uint64_t incomingBytes, std::optional<Expiry> expired);

  /// Rows removed by the steps since the last call; `notExported` of them never left the device.
  struct Removed {
    std::uint64_t rows = 0;
    std::uint64_t notExported = 0;
  };
  [[nodiscard]] Removed takeRemoved() { return std::exchange(removed_, {}); }

 private:
  /// The rows that one run of steps may remove.
  struct Removal {
    std::int64_t through;  // up to this time, in microseconds
    StoreIDs lastIDs;      // up to these ids
    bool exportedOnly;
  };
  /// Find and remove the oldest rows of one table.
  struct Statements {
    SqliteStatement oldest, remove;
  };
  /// The rows that one step may remove from one table: the oldest, up to an id.
  struct Window {
    std::int64_t lastID = 0;
    std::int64_t lastTime = 0;  // of its last row; the end of time when no row follows
    std::int64_t exportedThrough = 0;
  };

  /// Removes rows of about `bytes`: exported ones, or others when there are none left.
  Progress makeRoom(std::uint64_t bytes);
  /// Removes rows, oldest first.
  Progress removeOldest(std::uint64_t bytes, Removal removal);
  /// Removes the rows of the windows up to the time of `removal`. False, here and below: a
  /// statement failed.
  bool removeWithin(const PerStoreTable<Window>& windows, const Removal& removal, Removed& removed);
  /// Removes sessions that ended before every message that is left.
  bool removeSessions(const Removal& removal);
  /// Keeps the last ids and adds to the drops in `meta`.
  bool record(std::int64_t removed);
  std::optional<Window> window(StoreTable table, std::uint64_t bytes, const Removal& removal);
  /// The last id that every remote backend has had.
  std::optional<std::int64_t> exportedThrough(StoreTable table);
  std::optional<std::int64_t> value(SqliteStatement& statement);

  const Bounds bounds_;
  SqliteConnection& connection_;
  const StoreIDs& lastIDs_;
  ClockMarks clockMarks_;
  std::int64_t lastEarlierSession_ = 0;  // given before this run
  std::int64_t openedAt_ = 0;            // microseconds
  std::uint64_t pageBytes_ = 0;          // of the file
  PerStoreTable<Statements> statements_;
  SqliteStatement pages_, freePages_, cursor_, removeSessions_, keepLastID_, countDropped_;
  Removed removed_;  // since `takeRemoved`
};

}  // namespace quarvel
