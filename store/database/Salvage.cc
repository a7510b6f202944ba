#include "store/database/Salvage.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <cstdlib>
#include <string>
#include <vector>

namespace quarvel {

namespace {

using Step = SqliteStatement::Step;

constexpr std::int64_t kLastPossibleID = kProvisionalSessions - 1;
constexpr int kRowsPerCommit = 4096;

/// Copies one table, row by row, in the order of ids. When a damaged page ends the scan, goes on
/// with the first id behind it that can be reached. Lives on the stack of `Salvage`.
class TableSalvage {
 public:
  TableSalvage(const TableDescription& table, SqliteConnection& from, SqliteConnection& into)
      : table_(table),
        columns_(static_cast<int>(table.columns.size()) + 1),
        from_(from),
        into_(into) {}

  /// False when the new store takes no more rows.
  bool run() {
    if (!from_.prepare(scan_, SelectSql(table_) + " WHERE id >= ?1 ORDER BY id") ||
        !from_.prepare(seek_, fmt::format("SELECT id FROM {} WHERE id >= ?1 ORDER BY id LIMIT 1",
                                          table_.name))) {
      return true;  // nothing can be read
    }
    std::string values = "?1";
    for (int i = 2; i <= columns_; ++i) values += fmt::format(", ?{}", i);
    if (const StoreColumn* json = JsonColumn(table_)) {
      values += fmt::format(" WHERE json_valid(?{})", json - table_.columns.data() + 2);
    }
    if (!into_.prepare(insert_,
                       fmt::format("INSERT OR IGNORE INTO {} SELECT {}", table_.name, values))) {
      return false;
    }
    // A damaged page may hold ids that were never given.
    largestGap_ = 256 * from_.integer("PRAGMA page_count").value_or(0);
    expected_ = firstIDs();
    while (scan() == Step::failed && !takesNoMore_ && skipDamage()) {
    }
    return commit() && !takesNoMore_;
  }

  [[nodiscard]] std::int64_t copied() const { return copied_; }

 private:
  /// About where the ids begin: of the first few, most must be right.
  std::int64_t firstIDs() {
    SqliteStatement first;
    std::vector<std::int64_t> ids;
    if (from_.prepare(first, fmt::format("SELECT id FROM {} ORDER BY id LIMIT 15", table_.name))) {
      while (first.step() == Step::row) ids.push_back(first.integer(0));
    }
    if (ids.empty()) return 0;
    std::ranges::sort(ids);
    return ids[ids.size() / 2];
  }

  Step scan() {
    scan_.bind(1, next_);
    for (;;) {
      const Step step = scan_.step();
      if (step != Step::row) return step;
      const std::int64_t id = scan_.integer(0);
      if (id < 1 || id > kLastPossibleID || std::abs(id - expected_) > largestGap_) continue;
      if (!copyRow()) {
        scan_.reset();
        return Step::failed;
      }
      expected_ = id;
      next_ = std::max(next_, id + 1);
    }
  }

  bool copyRow() {
    if (uncommitted_ == 0 && !into_.execute("BEGIN IMMEDIATE")) return !(takesNoMore_ = true);
    for (int i = 0; i < columns_; ++i) insert_.bind(i + 1, scan_, i);
    if (!insert_.run()) {
      into_.rollBack();
      return !(takesNoMore_ = true);
    }
    copied_ += into_.changes();
    return ++uncommitted_ < kRowsPerCommit || commit();
  }

  bool commit() {
    if (uncommitted_ == 0) return true;
    uncommitted_ = 0;
    if (into_.execute("COMMIT")) return true;
    into_.rollBack();
    return !(takesNoMore_ = true);
  }

  /// Whether a row at `id` or behind it can be reached; `found` is its id.
  bool reaches(std::int64_t id, std::int64_t& found) {
    const Step step = seek_.bind(1, id).step();
    found = step == Step::row ? seek_.integer(0) : kLastPossibleID;
    seek_.reset();
    return step != Step::failed && found >= id;
  }

  /// Goes on behind the damage at which the scan ended; false when there is nothing behind it.
  bool skipDamage() {
    std::int64_t found = 0;
    if (reaches(next_, found)) {
      // The row itself can be found and not read.
      next_ = found + 1;
      return found < kLastPossibleID;
    }
    std::int64_t unreachable = next_;
    std::int64_t reachable = next_ + 1;
    for (std::int64_t distance = 1; !reaches(reachable, found); distance *= 2) {
      unreachable = reachable;
      if (distance > largestGap_) return false;
      reachable += distance;
    }
    while (reachable - unreachable > 1) {
      const std::int64_t middle = unreachable + (reachable - unreachable) / 2;
      (reaches(middle, found) ? reachable : unreachable) = middle;
    }
    next_ = reachable;
    return true;
  }

  const TableDescription& table_;
  const int columns_;  // with `id`
  SqliteConnection& from_;
  SqliteConnection& into_;
  SqliteStatement scan_, seek_, insert_;
  std::int64_t next_ = 1;      // where the scan begins
  std::int64_t expected_ = 0;  // the next row's id is near this one
  std::int64_t largestGap_ = 0;
  std::int64_t copied_ = 0;
  int uncommitted_ = 0;
  bool takesNoMore_ = false;
};

/// Copies `meta` and the cursors. The larger of two numbers is right, since they only grow. An
/// exported id is not given again, even when its row is lost.
bool CopyMetaAndCursors(SqliteConnection& from, SqliteConnection& into) {
  SqliteStatement read;
  SqliteStatement write;
  if (from.prepare(read, "SELECT key, value FROM meta")) {
    if (!into.prepare(write,
                      "INSERT INTO meta VALUES(?1, ?2) ON CONFLICT(key) DO UPDATE SET value ="
                      " CASE WHEN key = 'store_id' THEN excluded.value"
                      " ELSE max(CAST(value AS INTEGER), CAST(excluded.value AS INTEGER)) END")) {
      return false;
    }
    while (read.step() == Step::row) {
      if (!write.bind(1, read, 0).bind(2, read, 1).run()) return false;
    }
  }
  if (from.prepare(read, "SELECT backend, table_name, exported_through FROM backend_cursor")) {
    SqliteStatement keepID;
    if (!into.prepare(write, "INSERT OR REPLACE INTO backend_cursor VALUES(?1, ?2, ?3)") ||
        !into.prepare(keepID,
                      "INSERT INTO meta VALUES('last_id.' || ?1, ?2) ON CONFLICT(key) DO UPDATE"
                      " SET value = max(CAST(value AS INTEGER), excluded.value)")) {
      return false;
    }
    while (read.step() == Step::row) {
      if (!write.bind(1, read, 0).bind(2, read, 1).bind(3, read, 2).run()) return false;
      if (!keepID.bind(1, read, 1).bind(2, read, 2).run()) return false;
    }
  }
  return true;
}

std::int64_t MetaNumber(SqliteConnection& store, const std::string& key) {
  return store.integer(fmt::format("SELECT CAST(value AS INTEGER) FROM meta WHERE key = '{}'", key))
      .value_or(0);
}

/// Copies one damaged store. False when the new one takes no more rows.
bool Salvage(const std::filesystem::path& damaged, SqliteConnection& into,
             const std::string& doneKey, StoreNotices& notices) {
  SqliteConnection from;
  std::int64_t copied = 0;
  // A file that cannot be opened is not tried again.
  if (from.open(damaged)) {
    // Lets SQLite read a file that was cut short. Nothing is written to it.
    (void)from.execute("PRAGMA writable_schema = ON");
    if (!CopyMetaAndCursors(from, into)) return false;
    for (const TableDescription* table : kTables) {
      if (!table->primaryKey.empty()) continue;
      TableSalvage salvage(*table, from, into);
      const bool done = salvage.run();
      copied += salvage.copied();
      if (!done) return false;
    }
  }
  StoreIDs lastIDs;
  for (const StoreTable table : kAllStoreTables)
    lastIDs[table] = MetaNumber(into, LastIDKey(table));
  StoreDrops drops;
  for (const StoreDrop reason : {StoreDrop::retention, StoreDrop::erased}) {
    drops[reason] = static_cast<std::uint64_t>(MetaNumber(into, StoreDropKey(reason)));
  }
  if (!SettleAccounts(into, lastIDs, drops) ||
      !into.execute(
          fmt::format("INSERT OR REPLACE INTO meta VALUES('{}', '{}')", doneKey, copied).c_str())) {
    return false;
  }
  notices.push_back(
      {"Salvage",
       fmt::format("{} rows could be read from the damaged store {}; {} are lost in all.", copied,
                   damaged.string(), MetaNumber(into, StoreDropKey(StoreDrop::damaged)))});
  return true;
}

}  // namespace

void SalvageStoresSetAside(const std::filesystem::path& path, SqliteConnection& into,
                           StoreNotices& notices) {
  for (const std::filesystem::path& damaged : StoresSetAside(path)) {
    const std::string doneKey = "salvaged." + damaged.filename().string();
    const auto done =
        into.integer(fmt::format("SELECT count(*) FROM meta WHERE key = '{}'", doneKey));
    if (!done || *done > 0) continue;
    if (Salvage(damaged, into, doneKey, notices)) continue;
    notices.push_back(
        {"SalvageStoresSetAside",
         fmt::format("The rows of the damaged store {} cannot be copied now ({}). Trying again at "
                     "the next start.",
                     damaged.string(), into.message())});
    return;
  }
}

bool SettleAccounts(SqliteConnection& store, const StoreIDs& lastIDs, const StoreDrops& drops) {
  std::int64_t missing = 0;
  std::string statements = "BEGIN IMMEDIATE;";
  const auto keep = [&statements](const std::string& key, std::int64_t number) {
    statements += fmt::format("INSERT OR REPLACE INTO meta VALUES('{}', '{}');", key, number);
  };
  for (const StoreTable table : kAllStoreTables) {
    const auto last = store.integer(fmt::format("SELECT max(ifnull(max(id), 0), {}) FROM {}",
                                                lastIDs[table], StoreTableName(table)));
    const auto rows = store.integer(fmt::format("SELECT count(*) FROM {}", StoreTableName(table)));
    if (!last || !rows) return false;
    keep(LastIDKey(table), *last);
    if (Describe(table).isCounted) missing += *last - *rows;
  }
  for (const StoreDrop reason : {StoreDrop::retention, StoreDrop::erased}) {
    keep(StoreDropKey(reason), static_cast<std::int64_t>(drops[reason]));
    missing -= static_cast<std::int64_t>(drops[reason]);
  }
  keep(StoreDropKey(StoreDrop::damaged), std::max(missing, std::int64_t{0}));
  statements += "COMMIT";
  if (store.execute(statements.c_str())) return true;
  store.rollBack();
  return false;
}

}  // namespace quarvel
