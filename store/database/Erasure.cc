#include "store/database/Erasure.h"

#include <fmt/format.h>

#include <array>
#include <system_error>
#include <utility>

#include "store/database/StoreCounters.h"

namespace quarvel {

namespace {

constexpr int kSliceRows = 512;
constexpr int kTruncations = 20;  // each waits as long as the connection waits for a reader
/// Sessions last: what is left of messages says which of them are still needed.
constexpr std::array kErased{StoreTable::message, StoreTable::analyticsEvent,
                             StoreTable::powerEvent, StoreTable::agentSession};

std::int64_t Microseconds(Date date) {
  return date.time_since_epoch().count();
}

constexpr const char* BytesColumn(StoreTable table) {
  return table == StoreTable::agentSession ? "user_info" : "payload";
}

std::string BeforeCondition(StoreTable table, Date before) {
  switch (table) {
    case StoreTable::agentSession:
      return fmt::format(
          "opened_at < {0} AND ifnull(flushed_at, opened_at) < {0} AND id NOT IN"
          " (SELECT agent_session FROM message WHERE agent_session IS NOT NULL)",
          Microseconds(before));
    case StoreTable::message:
      return fmt::format("sent_at < {}", Microseconds(before));
    case StoreTable::analyticsEvent:
    case StoreTable::powerEvent:
      break;
  }
  return fmt::format("recorded_at < {}", Microseconds(before));
}

bool HasReporter(StoreTable table) {
  return table == StoreTable::message || table == StoreTable::agentSession;
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
    ownLastIDs_[table] =
        connection_
            .integer(fmt::format("SELECT max(ifnull((SELECT max(id) FROM {}), 0), ifnull((SELECT"
                                 " CAST(value AS INTEGER) FROM meta WHERE key = '{}'), 0))",
                                 StoreTableName(table), LastIDKey(table)))
            .value_or(0);
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
                                              BytesColumn(table), where)) ||
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
  const bool counted = table != StoreTable::agentSession;
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
    return HasReporter(table) ? fmt::format("session_id = {}", *session) : "";
  }
  if (const auto* before = std::get_if<Date>(&selection_.what)) {
    return BeforeCondition(table, *before);
  }
  return "true";
}

Erasure::Progress Erasure::giveBack() {
  // Pages keep copies of rows that were once moved to make room on them, which nothing overwrites:
  // only a file that is written anew is clean. Should there be no room for that, the free pages go.
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

std::size_t Erasure::removeSetAside(const std::filesystem::path& store) {
  const std::string prefix = store.filename().string() + ".corrupt-";
  std::size_t removed = 0;
  std::error_code failure;
  for (auto entry = std::filesystem::directory_iterator(store.parent_path(), failure);
       !failure && entry != std::filesystem::directory_iterator(); entry.increment(failure)) {
    if (!entry->path().filename().string().starts_with(prefix)) continue;
    std::error_code kept;
    if (std::filesystem::remove(entry->path(), kept)) ++removed;
  }
  return removed;
}

}  // namespace quarvel
