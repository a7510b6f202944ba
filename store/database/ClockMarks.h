#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "base/Date.h"
#include "store/database/Sqlite.h"
#include "store/database/Tables.h"

namespace quarvel {

/// Marks runs of the service in which the clock was set: all rows of such a run may carry wrong
/// times. Their age counts from the mark. Otherwise a device that boots in 1970 would lose the rows
/// that it stored before it knew the time.
///
/// Each mark is an entry in `meta`: the key holds the ids after which the run began, the value the
/// time of the mark in microseconds. Owned by the `Retention`; the writer's thread.
class ClockMarks {
 public:
  /// `connection` must outlive this.
  explicit ClockMarks(SqliteConnection& connection) : connection_(connection) {}

  /// Once, with the last ids of earlier runs. False when it failed.
  [[nodiscard]] bool prepare(const StoreIDs& earlierRuns);

  /// Marks this run: the clock was set, the last time to `now`. False when the write failed.
  [[nodiscard]] bool add(Date now);

  /// The ids up to which the times of rows are right, for a search for rows from before `expired`.
  /// Marks from before `expired` are deleted. A mark later than `now` is wrong, or the clock is:
  /// the mark counts as wrong, and is deleted, once the clock has run as long as rows live. None
  /// when a read or write failed.
  [[nodiscard]] std::optional<StoreIDs> trusted(Date now, Date expired);

 private:
  /// Whether the clock has been behind a mark for so long that the mark counts as wrong. Times in
  /// microseconds. None when a read or write failed.
  std::optional<bool> hasBeenBehind(std::int64_t time, std::int64_t expired);

  SqliteConnection& connection_;
  std::string ownKey_;
  SqliteStatement marks_, keep_, forget_, behindSince_, forgetBehind_;
};

}  // namespace quarvel
