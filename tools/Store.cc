#include "tools/Store.h"

#include <fmt/format.h>
#include <poll.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <utility>

#include "base/StandardPaths.h"

#include "store/database/StoreFile.h"
#include "store/database/Tables.h"

namespace quarvel {
namespace {

Error Failed(std::string reason) {
  return Error::because("quarvel.store", 1, std::move(reason));
}

std::string FilePath(std::string path) {
  if (std::error_code error; std::filesystem::is_directory(path, error)) path += "/telemetry.db";
  return path;
}

Error CannotBeRead(const SqliteConnection& connection) {
  return Failed(
      fmt::format("The store {} cannot be read: {}.", connection.fileName(), connection.message()));
}

Result<std::int64_t> Number(SqliteConnection& connection, std::string_view sql) {
  if (const auto number = connection.integer(sql)) return *number;
  return CannotBeRead(connection);
}

/// The rows of a query, one after the other.
class Rows {
 public:
  Rows(SqliteConnection& connection, std::string_view sql)
      : connection_(connection), prepared_(connection.prepare(statement_, sql)) {}

  template <class T>
  void bind(int parameter, const T& value) {
    statement_.bind(parameter, value);
  }
  [[nodiscard]] bool next() {
    if (!prepared_) return false;
    step_ = statement_.step();
    return step_ == SqliteStatement::Step::row;
  }
  /// After the last row: why there are no more, unless that was the end.
  [[nodiscard]] Outcome outcome() const {
    if (step_ == SqliteStatement::Step::done) return Success();
    return CannotBeRead(connection_);
  }

  [[nodiscard]] bool isNull(int column) const { return statement_.isNull(column); }
  [[nodiscard]] std::int64_t integer(int column) const { return statement_.integer(column); }
  [[nodiscard]] double real(int column) const { return statement_.real(column); }
  [[nodiscard]] std::string text(int column) const { return std::string(statement_.text(column)); }
  [[nodiscard]] Date date(int column) const {
    return Date(std::chrono::microseconds(integer(column)));
  }
  [[nodiscard]] std::optional<std::int64_t> optionalInteger(int column) const {
    return isNull(column) ? std::nullopt : std::optional(integer(column));
  }
  [[nodiscard]] std::optional<Date> optionalDate(int column) const {
    return isNull(column) ? std::nullopt : std::optional(date(column));
  }

 private:
  SqliteConnection& connection_;
  SqliteStatement statement_;
  const bool prepared_;
  SqliteStatement::Step step_ = SqliteStatement::Step::failed;
};

/// The rows of a table in the order of their ids, or only the last so many.
std::string InOrder(std::string select, const std::optional<std::int64_t>& last) {
  if (!last) return select + " ORDER BY id";
  return fmt::format("SELECT * FROM ({} ORDER BY id DESC LIMIT {}) ORDER BY id", select, *last);
}

}  // namespace

std::string StoreReader::defaultPath() {
  return StandardPaths::find(StandardPaths::Kind::state, "telemetry.db").native();
}

Result<StoreReader> StoreReader::open(std::string path) {
  path = FilePath(std::move(path));
  if (::access(path.c_str(), F_OK) != 0 && errno != EACCES) {
    return Failed(
        fmt::format("There is no store {}. The service makes it when it first starts; if it keeps "
                    "it elsewhere, name it with --store.",
                    path));
  }
  StoreReader reader(std::move(path));
  if (auto connected = reader.connect(); !connected) return std::move(connected.error());
  const auto application = Number(reader.connection_, "PRAGMA application_id");
  if (!application) return application.error();
  const auto version = Number(reader.connection_, "PRAGMA user_version");
  if (!version) return version.error();
  if (application.value() != kStoreApplicationID) {
    return Failed(fmt::format("{} is not a telemetry store.", reader.path_));
  }
  if (version.value() > kStoreVersion) {
    return Failed(
        fmt::format("The store {} is of version {}, and this tool reads up to {}: use the "
                    "quarvelctl that came with the service.",
                    reader.path_, version.value(), kStoreVersion));
  }
  return reader;
}

// SQLite makes a log beside the store. While no service runs there is none, and a user without
// permission to write there cannot make one; but then no process writes the store either.
Outcome StoreReader::connect() {
  if (auto connected = connect(SqliteConnection::Access::readOnly); !connected) return connected;
  if (connection_.integer("PRAGMA schema_version")) return Success();
  const bool hasLog = ::access((path_ + "-wal").c_str(), F_OK) == 0;
  if (hasLog || connection_.fault() != SqliteFault::inaccessible) return Success();
  return connect(SqliteConnection::Access::immutable);
}

Outcome StoreReader::connect(SqliteConnection::Access access) {
  connection_ = {};
  isImmutable_ = access == SqliteConnection::Access::immutable;
  if (connection_.open(path_, access)) return Success();
  return Failed(
      fmt::format("The store {} cannot be opened: {}. It belongs to the service's user "
                  "and group; join that group, or read it as root.",
                  path_, connection_.message()));
}

Outcome StoreReader::reconnect() {
  return isImmutable_ ? connect() : Success();
}

Outcome StoreReader::sessions(const SessionQuery& query,
                              const std::function<void(StoredSession)>& each) {
  constexpr const TableDescription& kTable = kAgentSessionTable;
  constexpr int kMessages = static_cast<int>(kTable.columns.size()) + 1;  // behind all columns
  if (auto connected = reconnect(); !connected) return connected;
  const std::string sessions = fmt::format(
      "SELECT s.*, ifnull(m.messages, 0) FROM ({}) s LEFT JOIN (SELECT agent_session, count(*)"
      " messages FROM message GROUP BY agent_session) m ON m.agent_session = s.id"
      " WHERE s.{} >= ?1",
      SelectSql(kTable), kTable.timeColumn);
  Rows rows(connection_, InOrder(sessions, query.last));
  rows.bind(1, query.since.value_or(kEarliestDate).time_since_epoch().count());
  while (rows.next()) {
    each({rows.integer(0), rows.integer(ColumnOf(kTable, "session_id")),
          rows.integer(ColumnOf(kTable, "client_type")),
          rows.real(ColumnOf(kTable, "client_version")),
          rows.integer(ColumnOf(kTable, "batch_event")) != 0,
          rows.text(ColumnOf(kTable, "hierarchy_token")),
          rows.text(ColumnOf(kTable, "client_name")), rows.text(ColumnOf(kTable, "service_name")),
          rows.text(ColumnOf(kTable, "user_info")), rows.date(ColumnOf(kTable, "opened_at")),
          rows.optionalDate(ColumnOf(kTable, "flushed_at")), rows.integer(kMessages)});
  }
  return rows.outcome();
}

Outcome StoreReader::messages(const MessageQuery& query,
                              const std::function<void(StoredMessage)>& each) {
  constexpr const TableDescription& kTable = kMessageTable;
  if (auto connected = reconnect(); !connected) return connected;
  std::string sql = SelectSql(kTable) + " WHERE id > ?1";
  if (query.reporterID) sql += " AND session_id = ?2";
  if (query.agentSession) sql += " AND agent_session = ?3";
  if (query.since) sql += fmt::format(" AND {} >= ?4", kTable.timeColumn);
  Rows rows(connection_, InOrder(std::move(sql), query.last));
  rows.bind(1, query.afterID);
  if (query.reporterID) rows.bind(2, *query.reporterID);
  if (query.agentSession) rows.bind(3, *query.agentSession);
  if (query.since) rows.bind(4, query.since->time_since_epoch().count());
  while (rows.next()) {
    each({rows.integer(0), rows.optionalInteger(ColumnOf(kTable, "agent_session")),
          rows.integer(ColumnOf(kTable, "session_id")), rows.text(ColumnOf(kTable, "service_name")),
          static_cast<std::uint16_t>(rows.integer(ColumnOf(kTable, "category"))),
          static_cast<std::uint16_t>(rows.integer(ColumnOf(kTable, "type"))),
          rows.text(ColumnOf(kTable, "payload")), rows.date(ColumnOf(kTable, "sent_at"))});
  }
  return rows.outcome();
}

Outcome StoreReader::events(Events kind, const EventQuery& query,
                            const std::function<void(StoredEvent)>& each) {
  // The columns of the analytics events, then the domain.
  constexpr const TableDescription& kAnalytics = kAnalyticsEventTable;
  constexpr int kDomain = static_cast<int>(kAnalytics.columns.size()) + 1;
  if (auto connected = reconnect(); !connected) return connected;
  std::string sql = kind == Events::analytics
                        ? fmt::format("SELECT *, NULL FROM ({})", SelectSql(kAnalytics))
                        : "SELECT id, name, payload, recorded_at, domain FROM power_event";
  sql += " WHERE id > ?1";
  if (query.since) sql += fmt::format(" AND {} >= ?2", kAnalytics.timeColumn);
  if (query.name) sql += " AND name = ?3";
  Rows rows(connection_, InOrder(std::move(sql), query.last));
  rows.bind(1, query.afterID);
  if (query.since) rows.bind(2, query.since->time_since_epoch().count());
  if (query.name) rows.bind(3, std::string_view(*query.name));
  while (rows.next()) {
    each({rows.integer(0), rows.optionalInteger(kDomain), rows.text(ColumnOf(kAnalytics, "name")),
          rows.text(ColumnOf(kAnalytics, "payload")),
          rows.date(ColumnOf(kAnalytics, "recorded_at"))});
  }
  return rows.outcome();
}

Outcome StoreReader::backends(const std::function<void(StoredBackend)>& each) {
  // Ids have no gaps, but for erased rows: the ends of a table tell how many rows a backend lacks.
  std::string tables;
  for (const StoreTable table : kAllStoreTables) {
    if (!tables.empty()) tables += " UNION ALL ";
    tables += fmt::format("SELECT '{0}', (SELECT min(id) FROM {0}), (SELECT max(id) FROM {0})",
                          StoreTableName(table));
  }
  Rows rows(
      connection_,
      "WITH tables(name, least, most) AS (" + tables +
          "), names(name) AS (SELECT backend FROM backend_cursor UNION"
          " SELECT backend FROM export_log WHERE backend != 'store')"
          "SELECT n.name, (SELECT sum(max(0, t.most - max(t.least - 1, ifnull((SELECT "
          "exported_through FROM backend_cursor c WHERE c.backend = n.name AND c.table_name = "
          "t.name), 0)))) FROM tables t WHERE t.most IS NOT NULL),"
          " ifnull(sum(l.rows) FILTER (WHERE l.outcome NOT LIKE 'refused%'), 0),"
          " ifnull(sum(l.rows) FILTER (WHERE l.outcome LIKE 'refused%'), 0),"
          " max(l.at) FILTER (WHERE l.outcome NOT LIKE 'refused%')"
          " FROM names n LEFT JOIN export_log l ON l.backend = n.name GROUP BY n.name"
          " ORDER BY n.name");
  while (rows.next()) {
    each({rows.text(0), rows.integer(1), rows.integer(2), rows.integer(3), rows.optionalDate(4)});
  }
  return rows.outcome();
}

Outcome StoreReader::exports(std::int64_t last, const std::function<void(StoredExport)>& each) {
  constexpr const TableDescription& kTable = kExportLogTable;
  Rows rows(connection_, InOrder(SelectSql(kTable), last));
  while (rows.next()) {
    each({rows.integer(0), rows.text(ColumnOf(kTable, "backend")),
          rows.text(ColumnOf(kTable, "table_name")),
          rows.optionalInteger(ColumnOf(kTable, "first_id")),
          rows.optionalInteger(ColumnOf(kTable, "last_id")), rows.integer(ColumnOf(kTable, "rows")),
          rows.integer(ColumnOf(kTable, "bytes")), rows.text(ColumnOf(kTable, "outcome")),
          rows.date(ColumnOf(kTable, "at"))});
  }
  return rows.outcome();
}

StoreWatch::StoreWatch(const std::string& path)
    : watch_(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
  // The directory: the write-ahead log beside the store comes and goes.
  const auto directory = std::filesystem::absolute(FilePath(path)).parent_path();
  if (watch_ >= 0) ::inotify_add_watch(watch_, directory.c_str(), IN_MODIFY | IN_CREATE);
}

StoreWatch::~StoreWatch() {
  if (watch_ >= 0) ::close(watch_);
}

void StoreWatch::wait() {
  constexpr int kSecond = 1'000;
  pollfd changed{watch_, POLLIN, 0};
  ::poll(&changed, 1, kSecond);
  char events[4'096];
  while (::read(watch_, events, sizeof events) > 0) {
  }
}

}  // namespace quarvel
