#include "export/ExportSource.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>

#include "store/database/StoreFile.h"

namespace quarvel {

namespace {

std::string SelectRows(StoreTable table) {
  std::string columns;
  for (const ExportColumn& column : ExportColumns(table)) {
    columns += ", ";
    columns += column.name;
  }
  return fmt::format("SELECT id{} FROM {} WHERE id > ?1 AND id <= ?2 ORDER BY id LIMIT ?3", columns,
                     StoreTableName(table));
}

/// Ids have no gaps except erased rows, so both ends tell the number of rows without a scan.
std::string CountRows(StoreTable table) {
  return fmt::format(
      "SELECT max(0, (SELECT max(id) FROM {0}) - max(?1, (SELECT min(id) FROM {0})"
      " - 1))",
      StoreTableName(table));
}

ExportValue ValueIn(const SqliteStatement& row, int index, ExportColumn::Kind kind) {
  using Kind = ExportColumn::Kind;
  if (row.isNull(index)) return std::monostate{};
  switch (kind) {
    case Kind::real:
      return row.real(index);
    case Kind::text:
    case Kind::json:
      return std::string(row.text(index));
    case Kind::integer:
    case Kind::boolean:
    case Kind::time:
      break;
  }
  return row.integer(index);
}

ExportRow RowIn(const SqliteStatement& statement, StoreTable table) {
  ExportRow row{statement.integer(0), 0, {}};
  const auto columns = ExportColumns(table);
  row.values.reserve(columns.size());
  for (const ExportColumn& column : columns) {
    const int index = static_cast<int>(row.values.size()) + 1;
    row.values.push_back(ValueIn(statement, index, column.kind));
    const auto* text = std::get_if<std::string>(&row.values.back());
    row.bytes += text != nullptr ? text->size() : sizeof(std::int64_t);
  }
  return row;
}

}  // namespace

ExportSource::ExportSource(TelemetryStore& store, std::filesystem::path path, std::string backend)
    : store_(store), path_(std::move(path)), backend_(std::move(backend)) {}

Error ExportSource::failed() const {
  return StoreError(StoreErrorCode::failed, fmt::format("The telemetry store {} cannot be read: {}",
                                                        path_.string(), connection_.message()));
}

Outcome ExportSource::open() {
  isOpen_ = false;
  for (const StoreTable table : kAllStoreTables) statements_[table] = {};
  connection_ = {};
  // 128 KiB: each page is read once and in order, so a larger cache would never be hit.
  if (!connection_.open(path_) ||
      !connection_.execute("PRAGMA query_only = 1; PRAGMA cache_size = -128")) {
    return failed();
  }
  for (const StoreTable table : kAllStoreTables) {
    if (!connection_.prepare(statements_[table].select, SelectRows(table)) ||
        !connection_.prepare(statements_[table].count, CountRows(table))) {
      return failed();
    }
  }
  auto storeID = connection_.text("SELECT value FROM meta WHERE key = 'store_id'");
  if (!storeID) return failed();
  storeID_ = std::move(*storeID);
  isOpen_ = true;
  return Success();
}

Result<ExportSource::Position> ExportSource::position() {
  if (!isCurrent()) {
    if (Outcome opened = open(); !opened) return opened.error();
  }
  Position position{storeID_, {}, {}};
  SqliteStatement cursor;
  SqliteStatement last;
  if (!connection_.prepare(cursor,
                           "SELECT exported_through FROM backend_cursor"
                           " WHERE backend = ?1 AND table_name = ?2") ||
      !connection_.prepare(last,
                           "SELECT at FROM export_log WHERE backend = ?1"
                           " AND outcome NOT LIKE 'refused%' ORDER BY id DESC LIMIT 1")) {
    return failed();
  }
  for (const StoreTable table : kAllStoreTables) {
    const auto step = cursor.bind(1, backend_).bind(2, StoreTableName(table)).step();
    if (step == SqliteStatement::Step::failed) return failed();
    if (step == SqliteStatement::Step::done) continue;
    position.exportedThrough[table] = cursor.integer(0);
    cursor.reset();
  }
  if (last.bind(1, backend_).step() == SqliteStatement::Step::row) {
    position.acknowledgedAt = Date(std::chrono::microseconds(last.integer(0)));
  }
  return position;
}

Result<ExportBatch> ExportSource::read(StoreTable table, const Bounds& bounds) {
  ExportBatch batch{table, storeID_, {}};
  SqliteStatement& select = statements_[table].select;
  select.bind(1, bounds.after)
      .bind(2, bounds.through)
      .bind(3, static_cast<std::int64_t>(bounds.rows));
  std::size_t bytes = 0;
  SqliteStatement::Step step = select.step();
  for (; step == SqliteStatement::Step::row; step = select.step()) {
    batch.rows.push_back(RowIn(select, table));
    bytes += batch.rows.back().bytes;
    if (bytes < bounds.bytes) continue;
    select.reset();
    break;
  }
  if (step == SqliteStatement::Step::failed) return failed();
  return batch;
}

Result<std::int64_t> ExportSource::backlog(const StoreIDs& exportedThrough) {
  std::int64_t rows = 0;
  for (const StoreTable table : kAllStoreTables) {
    SqliteStatement& count = statements_[table].count;
    if (count.bind(1, exportedThrough[table]).step() != SqliteStatement::Step::row) return failed();
    rows += count.integer(0);
    count.reset();
  }
  return rows;
}

Outcome ExportSource::record(ExportRecord record) {
  const std::uint64_t number = ++records_;
  Outcome added = store_.addExport(std::move(record),
                                   [pending = pending_, number](const std::optional<Error>& error) {
                                     const MutexLock lock(pending->mutex);
                                     pending->answered = number;
                                     pending->error = error;
                                     pending->changed.notifyAll();
                                   });
  if (!added) return added;
  const MutexLock lock(pending_->mutex);
  while (pending_->answered < number && !pending_->stopped) pending_->changed.wait(pending_->mutex);
  if (pending_->answered < number) {
    return StoreError(StoreErrorCode::failed, "The export was stopped before it was recorded.");
  }
  if (pending_->error) return *pending_->error;
  return Success();
}

void ExportSource::stop() {
  const MutexLock lock(pending_->mutex);
  pending_->stopped = true;
  pending_->changed.notifyAll();
}

void ExportSource::resume() {
  const MutexLock lock(pending_->mutex);
  pending_->stopped = false;
}

bool ExportSource::isStopped() const {
  const MutexLock lock(pending_->mutex);
  return pending_->stopped;
}

}  // namespace quarvel
