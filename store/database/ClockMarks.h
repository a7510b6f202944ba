#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "base/Date.h"
#include "store/database/Sqlite.h"
#include "store/database/Tables.h"

namespace quarvel {

/// Which rows may carry wrong times: those of a run of the service in which the clock was set, from
/// its beginning on. Their age counts from when that was found, or a device that boots in 1970
/// would lose what it reported until it was told the time.
///
/// A mark in `meta` for each such run: its key holds the ids after which the run began, its value
/// the time, in microseconds. Part of the `Retention`; the writer's thread.
class ClockMarks {
 public:
  /// `connection` must outlive this.
  explicit ClockMarks(SqliteConnection& connection) : connection_(connection) {}

  /// Once, with the last ids of earlier runs. False when it failed.
  [[nodiscard]] bool prepare(const StoreIDs& earlierRuns);

  /// The clock was set, to `now` at last. False when that could not be kept.
  [[nodiscard]] bool add(Date now);

  /// The ids up to which rows are as old as they say, as long as rows of before `expired` are
  /// looked for. Marks older than that are forgotten. A mark ahead of the clock is one that a clock
  /// ahead of the time has left, or the clock is behind it now; the former once the clock has run
  /// as long as rows live. None when it failed.
  [[nodiscard]] std::optional<StoreIDs> trusted(Date now, Date expired);

 private:
  /// Whether the clock has been behind a mark for so long that the mark is wrong. Times in
  /// microseconds. None when that could not be found.
  std::optional<bool> hasBeenBehind(std::int64_t time, std::int64_t expired);

  SqliteConnection& connection_;
  std::string ownKey_;
  SqliteStatement marks_, keep_, forget_, behindSince_, forgetBehind_;
};

}  // namespace quarvel
