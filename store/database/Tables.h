#pragma once

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <span>
#include <string>
#include <string_view>

namespace quarvel {

// The one description of every table in the store. The schema, inserts, reads, salvage, retention,
// erasure, exports and the tools derive their SQL from it. A new table of rows needs an entry here
// and in `StoreTable`, a row type with an insert binding (`StoreBatch`, `StoreDatabase`) and code
// that produces the rows.

/// A column, under the name and in the order that it has in the file.
struct StoreColumn {
  /// `boolean` is stored as 0 or 1, `json` as text, `time` in microseconds since the epoch.
  enum class Kind : std::uint8_t { integer, real, boolean, text, json, time };

  const char* name;
  Kind kind;
  bool mayBeNull = false;  // otherwise NOT NULL
  /// Filled in by a later UPDATE: neither inserted with the row nor exported. Such columns stand
  /// behind all others.
  bool isSetLater = false;
  /// The table to whose `id` the column refers.
  const char* references = nullptr;
};

/// A table. Lives as long as the program.
struct TableDescription {
  const char* name;  // in the file
  /// All columns but `id`.
  std::span<const StoreColumn> columns;
  /// Empty: the key is a column `id` in front of the others. Otherwise the columns of the key.
  std::string_view primaryKey{};
  /// Tells how old a row is; null for a table whose rows do not age.
  const char* timeColumn = nullptr;
  /// Holds the reporter ID by which a session's rows are erased; null when rows have no session.
  const char* sessionColumn = nullptr;
  /// Whether rows count as messages or events from acceptance to storage.
  bool isCounted = false;
};

/// The tables of rows from clients, each with a column `id`. All of them are exported.
enum class StoreTable : std::uint8_t { agentSession, message, analyticsEvent, powerEvent };
inline constexpr std::array kAllStoreTables{StoreTable::agentSession, StoreTable::message,
                                            StoreTable::analyticsEvent, StoreTable::powerEvent};

// The columns, in the order of the file. A store of this version has exactly these.
namespace columns {
using Kind = StoreColumn::Kind;

inline constexpr std::array kAgentSession{
    StoreColumn{"session_id", Kind::integer},   StoreColumn{"client_type", Kind::integer},
    StoreColumn{"client_version", Kind::real},  StoreColumn{"batch_event", Kind::boolean},
    StoreColumn{"hierarchy_token", Kind::text}, StoreColumn{"client_name", Kind::text},
    StoreColumn{"service_name", Kind::text},    StoreColumn{"user_info", Kind::json},
    StoreColumn{"opened_at", Kind::time},       StoreColumn{"flushed_at", Kind::time, true, true}};
inline constexpr std::array kMessage{
    StoreColumn{"agent_session", Kind::integer, true, false, "agent_session"},
    StoreColumn{"session_id", Kind::integer},
    StoreColumn{"client_name", Kind::text},
    StoreColumn{"service_name", Kind::text},
    StoreColumn{"category", Kind::integer},
    StoreColumn{"type", Kind::integer},
    StoreColumn{"payload", Kind::json},
    StoreColumn{"sent_at", Kind::time}};
inline constexpr std::array kAnalyticsEvent{StoreColumn{"name", Kind::text},
                                            StoreColumn{"payload", Kind::json},
                                            StoreColumn{"recorded_at", Kind::time}};
inline constexpr std::array kPowerEvent{
    StoreColumn{"domain", Kind::integer}, StoreColumn{"name", Kind::text},
    StoreColumn{"payload", Kind::json}, StoreColumn{"recorded_at", Kind::time}};
inline constexpr std::array kBackendCursor{StoreColumn{"backend", Kind::text},
                                           StoreColumn{"table_name", Kind::text},
                                           StoreColumn{"exported_through", Kind::integer}};
inline constexpr std::array kExportLog{
    StoreColumn{"backend", Kind::text},           StoreColumn{"table_name", Kind::text},
    StoreColumn{"first_id", Kind::integer, true}, StoreColumn{"last_id", Kind::integer, true},
    StoreColumn{"rows", Kind::integer},           StoreColumn{"bytes", Kind::integer},
    StoreColumn{"outcome", Kind::text},           StoreColumn{"at", Kind::time}};
inline constexpr std::array kMeta{StoreColumn{"key", Kind::text, true},
                                  StoreColumn{"value", Kind::text}};
}  // namespace columns

/// Agent sessions. Their rows are not counted: a session is no message.
inline constexpr TableDescription kAgentSessionTable{.name = "agent_session",
                                                     .columns = columns::kAgentSession,
                                                     .timeColumn = "opened_at",
                                                     .sessionColumn = "session_id"};
/// Messages, of agent sessions and single ones.
inline constexpr TableDescription kMessageTable{.name = "message",
                                                .columns = columns::kMessage,
                                                .timeColumn = "sent_at",
                                                .sessionColumn = "session_id",
                                                .isCounted = true};
/// Events of the analytics sink; they name no session.
inline constexpr TableDescription kAnalyticsEventTable{.name = "analytics_event",
                                                       .columns = columns::kAnalyticsEvent,
                                                       .timeColumn = "recorded_at",
                                                       .isCounted = true};
/// Events of the power log; they name no session.
inline constexpr TableDescription kPowerEventTable{.name = "power_event",
                                                   .columns = columns::kPowerEvent,
                                                   .timeColumn = "recorded_at",
                                                   .isCounted = true};
/// How far each backend has exported each table.
inline constexpr TableDescription kBackendCursorTable{.name = "backend_cursor",
                                                      .columns = columns::kBackendCursor,
                                                      .primaryKey = "backend, table_name"};
/// The ledger: rows that left the device, that an engine refused, or that were erased.
inline constexpr TableDescription kExportLogTable{.name = "export_log",
                                                  .columns = columns::kExportLog};
/// Single values: the store's id, counts of drops, last ids, clock marks.
inline constexpr TableDescription kMetaTable{
    .name = "meta", .columns = columns::kMeta, .primaryKey = "key"};

/// Every table, in the order of creation. The tables in `StoreTable` come first, in its order.
inline constexpr std::array<const TableDescription*, 7> kTables{
    &kAgentSessionTable, &kMessageTable,       &kAnalyticsEventTable,
    &kPowerEventTable,   &kBackendCursorTable, &kExportLogTable,
    &kMetaTable};

/// The description of a table of rows. Lives as long as the program.
[[nodiscard]] constexpr const TableDescription& Describe(StoreTable table) {
  return *kTables[static_cast<std::size_t>(table)];
}
[[nodiscard]] constexpr const char* StoreTableName(StoreTable table) {
  return Describe(table).name;
}
/// The columns that an INSERT fills, and that are exported.
[[nodiscard]] constexpr std::span<const StoreColumn> InsertedColumns(
    const TableDescription& table) {
  std::size_t count = 0;
  while (count < table.columns.size() && !table.columns[count].isSetLater) ++count;
  return table.columns.first(count);
}
/// The column with a row's payload; null when there is none.
[[nodiscard]] constexpr const StoreColumn* JsonColumn(const TableDescription& table) {
  for (const StoreColumn& column : table.columns) {
    if (column.kind == StoreColumn::Kind::json) return &column;
  }
  return nullptr;
}

/// The place of a column in `SelectSql`, where `id` is column 0. A wrong name does not compile.
[[nodiscard]] consteval int ColumnOf(const TableDescription& table, std::string_view name) {
  int place = table.primaryKey.empty() ? 1 : 0;
  for (const StoreColumn& column : table.columns) {
    if (column.name == name) return place;
    ++place;
  }
  throw "the table has no such column";
}
/// The parameter of a column in `InsertSql`, where `id` is parameter 1.
[[nodiscard]] consteval int ParameterOf(const TableDescription& table, std::string_view name) {
  return ColumnOf(table, name) + 1;
}

// SQL derived from a description.

/// One CREATE TABLE for each table, each ended with a semicolon.
[[nodiscard]] std::string CreateTablesSql();
/// The same for one table.
[[nodiscard]] std::string CreateTableSql(const TableDescription& table);
/// INSERT of `InsertedColumns`, with the key's `id` first. NULL for `id` takes the next one.
[[nodiscard]] std::string InsertSql(const TableDescription& table);
/// SELECT of all columns, `id` first, without conditions.
[[nodiscard]] std::string SelectSql(const TableDescription& table);
/// SELECT of the last id given in a table: that of its newest row, or the one in `meta` when rows
/// have been removed.
[[nodiscard]] std::string LastIDSql(StoreTable table);
/// The key in `meta` for a table's last id once rows of it have been removed.
[[nodiscard]] std::string LastIDKey(StoreTable table);

/// The tables whose rows are counted from acceptance to storage.
inline constexpr auto kCountedStoreTables = [] {
  constexpr auto kCount = std::ranges::count_if(
      kAllStoreTables, [](StoreTable table) { return Describe(table).isCounted; });
  std::array<StoreTable, static_cast<std::size_t>(kCount)> counted{};
  std::ranges::copy_if(kAllStoreTables, counted.begin(),
                       [](StoreTable table) { return Describe(table).isCounted; });
  return counted;
}();

/// One `T` for each table of rows.
template <class T>
class PerStoreTable {
 public:
  constexpr T& operator[](StoreTable table) { return each_[static_cast<std::size_t>(table)]; }
  const T& operator[](StoreTable table) const { return each_[static_cast<std::size_t>(table)]; }
  bool operator==(const PerStoreTable&) const = default;

 private:
  std::array<T, kAllStoreTables.size()> each_{};
};

/// The last id given in each table. An id is never given twice, even after the newest row is gone:
/// the names of exported rows and the cursors of backends depend on that. The last id therefore
/// also counts every row that was ever added.
using StoreIDs = PerStoreTable<std::int64_t>;

/// The largest possible id in each table.
[[nodiscard]] constexpr StoreIDs AllStoreIDs() {
  StoreIDs ids;
  for (const StoreTable table : kAllStoreTables) {
    ids[table] = std::numeric_limits<std::int64_t>::max();
  }
  return ids;
}

/// How far a store is durable. A power cut may lose later rows and give their ids to other rows.
struct DurableExtent {
  std::string storeID;  // empty before the file was opened
  StoreIDs lastIDs;     // rows with greater ids are not durable yet

  bool operator==(const DurableExtent&) const = default;
};

/// Ids from here on belong to agent sessions that were added before the file could be opened, when
/// its last id was unknown. The opening maps them to ids behind those in the file.
inline constexpr std::int64_t kProvisionalSessions = std::int64_t{1} << 62;

}  // namespace quarvel
