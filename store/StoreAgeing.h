#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <optional>

#include "base/Date.h"
#include "store/StoreDatabase.h"
#include "store/StoreDurability.h"
#include "store/StoreHealth.h"
#include "store/StoreQueue.h"

namespace quarvel {

/// Removes old rows: makes room before a batch when the file is at its bound, and every `interval`
/// removes rows past their age. Finds out when the clock was set, since a clock set forward by
/// years must not empty the store. Logs rows that no backend has had.
///
/// Owned by the `StoreWriter`, as long as it lives; the writer's thread.
class StoreAgeing {
 public:
  struct Options {
    std::filesystem::path path;  // for log lines
    std::chrono::days maximumAge{14};
    std::chrono::milliseconds interval{std::chrono::hours{1}};
    std::function<Date()> clock;
  };
  /// The other objects must outlive this.
  StoreAgeing(Options options, StoreQueue& queue, StoreDurability& durability, StoreHealth& health);

  /// The open database, or null while it is closed.
  void setDatabase(StoreDatabase* database) { database_ = database; }

  /// Whether `removeStep` has to be called when no rows come.
  [[nodiscard]] bool isDue() const { return removing_; }
  /// One step of removal. `isDue` turns false when nothing is left to remove.
  void removeStep();
  /// Removes rows until `incomingBytes` have room. Stops after a few steps, so that the batch does
  /// not wait; the rest is due.
  void makeRoom(std::uint64_t incomingBytes);

  /// After each batch, and before the end: finds out whether the clock was set.
  void checkClock(Date now);
  /// After each batch: looks for rows past their age when the interval is over, unless the clock
  /// was set during it.
  void ageIfDue(Date now);
  /// Logs the rows that no backend has had and that no line has told of.
  void reportRemoved();

 private:
  /// False when there is nothing more to remove.
  bool remove(std::uint64_t incomingBytes, const std::optional<Retention::Expiry>& expired);

  const Options options_;
  StoreQueue& queue_;
  StoreDurability& durability_;
  StoreHealth& health_;
  StoreDatabase* database_ = nullptr;

  bool removing_ = true;                          // there may be rows to remove
  std::optional<Retention::Expiry> expired_;      // these, by a clock that was not set meanwhile
  std::chrono::steady_clock::time_point agedAt_;  // the last search for rows past their age
  bool clockWasSet_ = false;                      // since then
  bool clockMarkIsDue_ = false;                   // the store has no mark of it yet
  std::chrono::nanoseconds clockSeenAt_;          // since boot
  Date clockSeen_;                                // the date at that time
  std::uint64_t removedNotExported_ = 0;          // not yet logged
  MinuteLimit removedLine_;
};

}  // namespace quarvel
