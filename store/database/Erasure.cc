#include "store/database/Erasure.h"

#include <fmt/format.h>

#include <array>
#include <utility>

#include "base/StoreCounters.h"

namespace quarvel {

namespace {

constexpr int kSliceRows = 512;
constexpr int kTruncations = 20;  // each waits as long as the connection waits for a reader

/// Tables that are not counted, the sessions, come last: the messages left tell which sessions are
/// still needed.
constexpr auto kErased = [] {
  std::array<StoreTable, kAllStoreTables.size()> tables{};
  std::size_t next = 0;
  for (const bool counted : {true, false}) {
    for (const StoreTable table : kAllStoreTables) {
      if (Describe(table).isCounted == counted) tables[next++] = table;
    }
  }
  return tables;
}();

std::int64_t Microseconds(Date date) {
  return date.time_since_epoch().count();
}

std::string BeforeCondition(StoreTable table, Date before) {
  if (Describe(table).isCounted) {
    return fmt::format("{} < {}", Describe(table).timeColumn, Microseconds(before));
  }
  return fmt::format(
      "opened_at < {0} AND ifnull(flushed_at, opened_at) < {0} AND id NOT IN"
      " (SELECT agent_session FROM message WHERE agent_session IS NOT NULL)",
      Microseconds(before));
}

}  // namespace

std::string ErasureSelection::description() const {
  if (const auto* session = std::get_if<std::int64_t>(&what)) {
    return fmt::format("session {}", *session);
  }
  if (const auto* before = std::get_if<Date>(&what)) {
    return fmt::format("before {}", DateText(*before));
  }
  return "all";
}

Erasure::Erasure(SqliteConnection& connection, ErasureSelection selection, const StoreIDs& through,
                 const StoreIDs& lastIDs, Date now)
    : connection_(connection),
      selection_(selection),
      lastIDs_(lastIDs),
      through_(through),
      now_(now) {
  connection_.execute("PRAGMA secure_delete = ON");
}

Erasure::Erasure(SqliteConnection& connection, ErasureSelection selection, Date now)
    : connection_(connection), selection_(selection), lastIDs_(ownLastIDs_), now_(now) {
  connection_.execute("PRAGMA secure_delete = ON");
  for (const StoreTable table : kAllStoreTables) {
    ownLastIDs_[table] = connection_.integer(LastIDSql(table)).value_or(0);
  }
  through_ = ownLastIDs_;
}

Erasure::~Erasure() {
  connection_.execute("PRAGMA secure_delete = FAST");
}

Erasure::Progress Erasure::step() {
  if (ledgerLine_ && table_ == kErased.size()) return giveBack();
  const auto before = std::pair(table_, after_);
  const std::int64_t rowsBefore = rows_;
  const std::uint64_t countedBefore = counted_;
  const std::optional<std::int64_t> lineBefore = ledgerLine_;
  if (connection_.execute("BEGIN IMMEDIATE") && begin() && removeSlice() &&
      connection_.execute("COMMIT")) {
    return Progress::more;
  }
  connection_.rollBack();
  std::tie(table_, after_) = before;
  rows_ = rowsBefore;
  counted_ = countedBefore;
  ledgerLine_ = lineBefore;
  return Progress::failed;
}

bool Erasure::begin() {
  if (ledgerLine_) return true;
  const std::string line = fmt::format(
      "INSERT INTO export_log(backend, table_name, rows, bytes, outcome, at)"
      " VALUES('store', '*', 0, 0, 'erased: {}', {})",
      selection_.description(), Microseconds(now_));
  if (!connection_.execute(line.c_str())) return false;
  ledgerLine_ = connection_.integer("SELECT last_insert_rowid()");
  return ledgerLine_.has_value();
}

bool Erasure::removeSlice() {
  const StoreTable table = kErased[table_];
  Slice slice;
  if (const std::string wanted = condition(table); !wanted.empty()) {
    if (!removeRows(table, slice)) return false;
  }
  if (slice.lastID == 0) {
    ++table_;
    after_ = 0;
    return true;
  }
  after_ = slice.lastID;
  return slice.rows == 0 || record(table, slice);
}

bool Erasure::removeRows(StoreTable table, Slice& slice) {
  SqliteStatement end;
  SqliteStatement count;
  const std::string where = fmt::format("FROM {} WHERE id > {} AND id <= ?1 AND {}",
                                        StoreTableName(table), after_, condition(table));
  if (!connection_.prepare(
          end, fmt::format("SELECT ifnull(max(id), 0) FROM (SELECT id FROM {} WHERE id > {} AND"
                           " id <= {} ORDER BY id LIMIT {})",
                           StoreTableName(table), after_, through_[table], kSliceRows)) ||
      end.step() != SqliteStatement::Step::row) {
    return false;
  }
  slice.lastID = end.integer(0);
  if (slice.lastID == 0) return true;
  if (!connection_.prepare(count, fmt::format("SELECT count(*), ifnull(sum(length({})), 0) {}",
                                              JsonColumn(Describe(table))->name, where)) ||
      count.bind(1, slice.lastID).step() != SqliteStatement::Step::row) {
    return false;
  }
  slice.rows = count.integer(0);
  slice.bytes = count.integer(1);
  count.reset();
  SqliteStatement remove;
  return slice.rows == 0 ||
         (connection_.prepare(remove, "DELETE " + where) && remove.bind(1, slice.lastID).run());
}

bool Erasure::record(StoreTable table, const Slice& slice) {
  const bool counted = Describe(table).isCounted;
  rows_ += slice.rows;
  if (counted) counted_ += static_cast<std::uint64_t>(slice.rows);
  if (!write(fmt::format("UPDATE export_log SET rows = rows + {}, bytes = bytes + {} WHERE id = {}",
                         slice.rows, slice.bytes, *ledgerLine_))) {
    return false;
  }
  for (const StoreTable each : kAllStoreTables) {
    if (!write(fmt::format("INSERT OR REPLACE INTO meta VALUES('{}', {})", LastIDKey(each),
                           lastIDs_[each]))) {
      return false;
    }
  }
  return !counted || write(fmt::format("INSERT INTO meta VALUES('{}', {}) ON CONFLICT(key) DO"
                                       " UPDATE SET value = value + excluded.value",
                                       StoreDropKey(StoreDrop::erased), slice.rows));
}

bool Erasure::write(const std::string& statement) {
  return connection_.execute(statement.c_str());
}

std::string Erasure::condition(StoreTable table) const {
  if (const auto* session = std::get_if<std::int64_t>(&selection_.what)) {
    const char* column = Describe(table).sessionColumn;
    return column != nullptr ? fmt::format("{} = {}", column, *session) : "";
  }
  if (const auto* before = std::get_if<Date>(&selection_.what)) {
    return BeforeCondition(table, *before);
  }
  return "true";
}

Erasure::Progress Erasure::giveBack() {
  // Pages keep copies of rows that were once moved on them, which no later write covers: only a
  // rewritten file is clean. Without room for that, the free pages go.
  if (rows_ > 0 && !std::exchange(rewritten_, true)) {
    connection_.execute("VACUUM");
    return Progress::more;
  }
  const auto freePages = connection_.integer("PRAGMA freelist_count");
  if (!freePages) return Progress::failed;
  if (*freePages > 0) {
    return connection_.execute("PRAGMA incremental_vacuum(256)") ? Progress::more
                                                                 : Progress::failed;
  }
  if (connection_.emptyLog()) return Progress::done;
  logRemains_ = ++truncations_ == kTruncations;
  return logRemains_ ? Progress::done : Progress::more;
}

std::uint64_t Erasure::takeCounted() {
  return std::exchange(counted_, 0);
}

}  // namespace quarvel
