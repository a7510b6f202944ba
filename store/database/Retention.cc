#include "store/database/Retention.h"

#include <fmt/format.h>

#include <algorithm>
#include <limits>

#include "base/StoreCounters.h"

namespace quarvel {

namespace {

constexpr std::int64_t kEnd = std::numeric_limits<std::int64_t>::max();
constexpr std::uint64_t kStepBytes = 1 << 20;
constexpr int kWindowRows = 256;  // a step deletes at most so many of a table: a few milliseconds
constexpr const char* kVacuumStep = "PRAGMA incremental_vacuum(256)";

/// A session's row goes after its last message: no message follows the flush, nor comes in this run
/// for a session that an earlier run left unflushed.
constexpr const char* kRemoveSessions =
    "DELETE FROM agent_session WHERE id <= min(?4, (SELECT min(id) + 4096 FROM agent_session))"
    " AND coalesce(flushed_at, CASE WHEN id <= ?1 THEN ?2 END) < "
    "min(?3, ifnull((SELECT sent_at FROM message ORDER BY id LIMIT 1), ?3))";

}  // namespace

bool Retention::prepare(Date now) {
  lastEarlierSession_ = lastIDs_[StoreTable::agentSession];
  openedAt_ = now.time_since_epoch().count();
  const auto pageBytes = connection_.integer("PRAGMA page_size");
  if (!pageBytes) return false;
  pageBytes_ = static_cast<std::uint64_t>(*pageBytes);
  for (const StoreTable table : kCountedStoreTables) {
    const TableDescription& described = Describe(table);
    const std::string oldest =
        fmt::format("SELECT id, {}, length({}) FROM {} WHERE id <= ?1 ORDER BY id LIMIT {}",
                    described.timeColumn, JsonColumn(described)->name, described.name, kWindowRows);
    const std::string remove = fmt::format("DELETE FROM {} WHERE id <= ?1 AND {} <= ?2",
                                           described.name, described.timeColumn);
    if (!connection_.prepare(statements_[table].oldest, oldest) ||
        !connection_.prepare(statements_[table].remove, remove)) {
      return false;
    }
  }
  return clockMarks_.prepare(lastIDs_) && connection_.prepare(pages_, "PRAGMA page_count") &&
         connection_.prepare(freePages_, "PRAGMA freelist_count") &&
         connection_.prepare(cursor_,
                             "SELECT exported_through FROM backend_cursor"
                             " WHERE backend = ?1 AND table_name = ?2") &&
         connection_.prepare(removeSessions_, kRemoveSessions) &&
         connection_.prepare(keepLastID_,
                             "INSERT INTO meta VALUES(?1, ?2)"
                             " ON CONFLICT(key) DO UPDATE SET value = excluded.value") &&
         connection_.prepare(countDropped_,
                             "INSERT INTO meta VALUES(?1, ?2)"
                             " ON CONFLICT(key) DO UPDATE SET value = value + excluded.value");
}

Retention::Progress Retention::step(std::uint64_t incomingBytes, std::optional<Expiry> expired) {
  const auto pages = value(pages_);
  const auto freePages = value(freePages_);
  if (!pages || !freePages) return Progress::failed;
  const std::uint64_t fileBytes = static_cast<std::uint64_t>(*pages) * pageBytes_;
  const std::uint64_t usedBytes = fileBytes - static_cast<std::uint64_t>(*freePages) * pageBytes_;
  // Cells, page heads and JSON's quotes add about a quarter to a row.
  const std::uint64_t wantedBytes = incomingBytes + incomingBytes / 4;
  Progress progress = Progress::nothingToDo;
  if (usedBytes + wantedBytes > bounds_.maximumBytes) {
    progress = makeRoom(usedBytes + wantedBytes - bounds_.maximumBytes);
  } else if (fileBytes > bounds_.maximumBytes) {
    progress = connection_.execute(kVacuumStep) ? Progress::more : Progress::failed;
  }
  if (progress != Progress::nothingToDo || !expired) return progress;
  return removeOldest(kStepBytes,
                      {expired->before.time_since_epoch().count() - 1, expired->trusted, false});
}

std::optional<Retention::Expiry> Retention::expiry(Date now, Date before) {
  auto trusted = clockMarks_.trusted(now, before);
  if (!trusted) return std::nullopt;
  return Expiry{before, *trusted};
}

Retention::Progress Retention::makeRoom(std::uint64_t bytes) {
  const Progress progress = removeOldest(bytes, {kEnd, AllStoreIDs(), true});
  return progress == Progress::nothingToDo ? removeOldest(bytes, {kEnd, AllStoreIDs(), false})
                                           : progress;
}

Retention::Progress Retention::removeOldest(std::uint64_t bytes, Removal removal) {
  PerStoreTable<Window> windows;
  for (const StoreTable table : kCountedStoreTables) {
    const auto found = window(table, std::min(bytes, kStepBytes), removal);
    if (!found) return Progress::failed;
    windows[table] = *found;
    // Rows between the end of the shortest window and the ends of the others are younger than rows
    // that the next step will see.
    removal.through = std::min(removal.through, found->lastTime);
  }
  Removed removed;
  if (!connection_.execute("BEGIN IMMEDIATE")) return Progress::failed;
  if (!removeWithin(windows, removal, removed) || !connection_.execute("COMMIT")) {
    connection_.rollBack();
    return Progress::failed;
  }
  removed_.rows += removed.rows;
  removed_.notExported += removed.notExported;
  return removed.rows > 0 ? Progress::more : Progress::nothingToDo;
}

bool Retention::removeWithin(const PerStoreTable<Window>& windows, const Removal& removal,
                             Removed& removed) {
  for (const StoreTable table : kCountedStoreTables) {
    const Window& window = windows[table];
    const auto removeThrough = [&](std::int64_t lastID) -> std::optional<std::uint64_t> {
      if (!statements_[table].remove.bind(1, lastID).bind(2, removal.through).run()) {
        return std::nullopt;
      }
      return static_cast<std::uint64_t>(connection_.changes());
    };
    const auto exported = removeThrough(std::min(window.lastID, window.exportedThrough));
    const auto notExported = exported ? removeThrough(window.lastID) : std::nullopt;
    if (!notExported) return false;
    removed.rows += *exported + *notExported;
    removed.notExported += *notExported;
  }
  return removeSessions(removal) &&
         (removed.rows == 0 || record(static_cast<std::int64_t>(removed.rows)));
}

bool Retention::removeSessions(const Removal& removal) {
  return removeSessions_.bind(1, lastEarlierSession_)
      .bind(2, openedAt_)
      .bind(3, removal.through)
      .bind(4, removal.lastIDs[StoreTable::agentSession])
      .run();
}

bool Retention::record(std::int64_t removed) {
  for (const StoreTable table : kAllStoreTables) {
    const std::string key = LastIDKey(table);
    if (!keepLastID_.bind(1, key).bind(2, lastIDs_[table]).run()) return false;
  }
  const std::string key = StoreDropKey(StoreDrop::retention);
  return countDropped_.bind(1, key).bind(2, removed).run();
}

std::optional<Retention::Window> Retention::window(StoreTable table, std::uint64_t bytes,
                                                   const Removal& removal) {
  const auto exported = exportedThrough(table);
  if (!exported) return std::nullopt;
  Window window{std::min(removal.lastIDs[table], removal.exportedOnly ? *exported : kEnd), kEnd,
                *exported};
  SqliteStatement& oldest = statements_[table].oldest.bind(1, window.lastID);
  std::uint64_t found = 0;
  std::int64_t rows = 0;
  SqliteStatement::Step step = oldest.step();
  for (; step == SqliteStatement::Step::row; step = oldest.step()) {
    found += static_cast<std::uint64_t>(oldest.integer(2));
    if (++rows < kWindowRows && found < bytes) continue;
    window.lastID = oldest.integer(0);
    window.lastTime = oldest.integer(1);
    oldest.reset();
    break;
  }
  if (step == SqliteStatement::Step::failed) return std::nullopt;
  return window;
}

std::optional<std::int64_t> Retention::exportedThrough(StoreTable table) {
  std::int64_t through = kEnd;
  for (const std::string& backend : bounds_.remoteBackends) {
    cursor_.bind(1, backend).bind(2, StoreTableName(table));
    switch (cursor_.step()) {
      case SqliteStatement::Step::row:
        through = std::min(through, cursor_.integer(0));
        cursor_.reset();
        break;
      case SqliteStatement::Step::done:
        through = 0;
        break;
      case SqliteStatement::Step::failed:
        return std::nullopt;
    }
  }
  return through;
}

std::optional<std::int64_t> Retention::value(SqliteStatement& statement) {
  if (statement.step() != SqliteStatement::Step::row) return std::nullopt;
  const std::int64_t value = statement.integer(0);
  statement.reset();
  return value;
}

}  // namespace quarvel
