#include "store/database/ClockMarks.h"

#include <fmt/format.h>

#include <algorithm>
#include <charconv>
#include <limits>
#include <string>
#include <string_view>

namespace quarvel {

namespace {

constexpr std::string_view kPrefix = "clock_set";
constexpr std::string_view kBehindSince = "clock_behind_since";
constexpr std::int64_t kEnd = std::numeric_limits<std::int64_t>::max();

std::string MarkKey(const StoreIDs& after) {
  std::string key(kPrefix);
  for (const StoreTable table : kAllStoreTables) key += fmt::format(".{}", after[table]);
  return key;
}

/// None for any other key of `meta`.
std::optional<StoreIDs> MarkedIDs(std::string_view key) {
  StoreIDs ids;
  key.remove_prefix(std::min(kPrefix.size(), key.size()));
  for (const StoreTable table : kAllStoreTables) {
    if (!key.starts_with('.')) return std::nullopt;
    const auto [end, error] = std::from_chars(key.data() + 1, key.data() + key.size(), ids[table]);
    if (error != std::errc()) return std::nullopt;
    key.remove_prefix(static_cast<std::size_t>(end - key.data()));
  }
  return key.empty() ? std::optional(ids) : std::nullopt;
}

}  // namespace

bool ClockMarks::prepare(const StoreIDs& earlierRuns) {
  ownKey_ = MarkKey(earlierRuns);
  return connection_.prepare(marks_,
                             "SELECT key, CAST(value AS INTEGER) FROM meta"
                             " WHERE key GLOB 'clock_set.*'") &&
         connection_.prepare(keep_, "INSERT OR REPLACE INTO meta VALUES(?1, ?2)") &&
         connection_.prepare(forget_,
                             "DELETE FROM meta WHERE key GLOB 'clock_set.*'"
                             " AND CAST(value AS INTEGER) NOT BETWEEN ?1 AND ?2") &&
         connection_.prepare(behindSince_,
                             "SELECT CAST(value AS INTEGER) FROM meta WHERE key = ?1") &&
         connection_.prepare(forgetBehind_, "DELETE FROM meta WHERE key = ?1");
}

bool ClockMarks::add(Date now) {
  return keep_.bind(1, ownKey_).bind(2, now.time_since_epoch().count()).run();
}

std::optional<StoreIDs> ClockMarks::trusted(Date now, Date expired) {
  const std::int64_t time = now.time_since_epoch().count();
  const std::int64_t expiredTime = expired.time_since_epoch().count();
  StoreIDs trusted = AllStoreIDs();
  std::int64_t latest = std::numeric_limits<std::int64_t>::min();
  std::int64_t earliest = kEnd;
  SqliteStatement::Step step = marks_.step();
  for (; step == SqliteStatement::Step::row; step = marks_.step()) {
    const auto ids = MarkedIDs(marks_.text(0));
    const std::int64_t markedAt = marks_.integer(1);
    earliest = std::min(earliest, markedAt);
    latest = std::max(latest, markedAt);
    if (!ids || markedAt < expiredTime) continue;
    for (const StoreTable table : kAllStoreTables) {
      trusted[table] = std::min(trusted[table], (*ids)[table]);
    }
  }
  if (step == SqliteStatement::Step::failed) return std::nullopt;
  std::int64_t last = kEnd;
  if (latest > time) {
    const auto isWrong = hasBeenBehind(time, expiredTime);
    if (!isWrong) return std::nullopt;
    if (*isWrong) last = time;
  } else if (!forgetBehind_.bind(1, kBehindSince).run()) {
    return std::nullopt;
  }
  if (earliest >= expiredTime && latest <= last) return trusted;
  return forget_.bind(1, expiredTime).bind(2, last).run() ? std::optional(trusted) : std::nullopt;
}

std::optional<bool> ClockMarks::hasBeenBehind(std::int64_t time, std::int64_t expired) {
  std::int64_t since = kEnd;
  switch (behindSince_.bind(1, kBehindSince).step()) {
    case SqliteStatement::Step::row:
      since = behindSince_.integer(0);
      behindSince_.reset();
      break;
    case SqliteStatement::Step::done:
      break;
    case SqliteStatement::Step::failed:
      return std::nullopt;
  }
  if (since > time && !keep_.bind(1, kBehindSince).bind(2, time).run()) return std::nullopt;
  return since < expired;
}

}  // namespace quarvel
