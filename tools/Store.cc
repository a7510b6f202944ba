#include "tools/Store.h"

#include <fmt/format.h>
#include <poll.h>
#include <sqlite3.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <utility>

#include "base/StandardPaths.h"

namespace quarvel {
namespace {

constexpr std::int64_t kApplication = 0x51525654;
constexpr std::int64_t kVersion = 1;
constexpr int kBusyMilliseconds = 5'000;

Error Failed(std::string reason) {
  return Error::because("quarvel.store", 1, std::move(reason));
}

std::string FilePath(std::string path) {
  if (std::error_code error; std::filesystem::is_directory(path, error)) path += "/telemetry.db";
  return path;
}

/// A path as it stands in a URI.
std::string UriPath(std::string_view path) {
  std::string encoded;
  for (const char byte : path) {
    if (byte == '%' || byte == '?' || byte == '#') {
      encoded += fmt::format("%{:02X}", static_cast<unsigned char>(byte));
    } else {
      encoded.push_back(byte);
    }
  }
  return encoded;
}

/// A prepared statement, row by row.
class Statement {
 public:
  Statement(sqlite3* database, std::string_view sql) : database_(database) {
    status_ = sqlite3_prepare_v2(database, sql.data(), static_cast<int>(sql.size()), &statement_,
                                 nullptr);
  }
  ~Statement() { sqlite3_finalize(statement_); }
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;

  void bind(int index, std::int64_t number) { sqlite3_bind_int64(statement_, index, number); }
  void bind(int index, const std::string& text) {
    sqlite3_bind_text64(statement_, index, text.data(), text.size(), SQLITE_TRANSIENT, SQLITE_UTF8);
  }
  [[nodiscard]] bool next() {
    if (status_ == SQLITE_OK || status_ == SQLITE_ROW) status_ = sqlite3_step(statement_);
    return status_ == SQLITE_ROW;
  }
  /// When there are no more rows: whether that was the end.
  [[nodiscard]] Outcome outcome() const {
    if (status_ == SQLITE_DONE) return Success();
    return Failed(fmt::format("The store {} cannot be read: {}.",
                              sqlite3_db_filename(database_, "main"), sqlite3_errmsg(database_)));
  }

  [[nodiscard]] bool isNull(int column) const {
    return sqlite3_column_type(statement_, column) == SQLITE_NULL;
  }
  [[nodiscard]] std::int64_t integer(int column) const {
    return sqlite3_column_int64(statement_, column);
  }
  [[nodiscard]] double real(int column) const { return sqlite3_column_double(statement_, column); }
  [[nodiscard]] Date date(int column) const {
    return Date(std::chrono::microseconds(integer(column)));
  }
  [[nodiscard]] std::string text(int column) const {
    const unsigned char* text = sqlite3_column_text(statement_, column);
    if (text == nullptr) return {};
    return {reinterpret_cast<const char*>(text),
            static_cast<std::size_t>(sqlite3_column_bytes(statement_, column))};
  }

 private:
  sqlite3* database_;
  sqlite3_stmt* statement_ = nullptr;
  int status_;
};

Result<std::int64_t> Number(sqlite3* database, std::string_view sql) {
  Statement statement(database, sql);
  if (statement.next()) return statement.integer(0);
  return statement.outcome().error();
}

// The rows of a table by their numbers, or only the last so many.
std::string InOrder(std::string select, const std::optional<std::int64_t>& last) {
  if (!last) return select + " ORDER BY id";
  return fmt::format("SELECT * FROM ({} ORDER BY id DESC LIMIT {}) ORDER BY id", select, *last);
}

}  // namespace

std::string StoreReader::defaultPath() {
  return StandardPaths::find(StandardPaths::Kind::state, "telemetry.db").native();
}

void StoreReader::Close::operator()(sqlite3* database) const {
  sqlite3_close(database);
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
  const auto application = Number(reader.database_.get(), "PRAGMA application_id");
  if (!application) return application.error();
  const auto version = Number(reader.database_.get(), "PRAGMA user_version");
  if (!version) return version.error();
  if (application.value() != kApplication) {
    return Failed(fmt::format("{} is not a telemetry store.", reader.path_));
  }
  if (version.value() > kVersion) {
    return Failed(
        fmt::format("The store {} is of version {}, and this tool reads up to {}: use the "
                    "quarvelctl that came with the service.",
                    reader.path_, version.value(), kVersion));
  }
  return reader;
}

// SQLite wants its log beside the store. While no service runs there is none, and who may not write
// there cannot make one; but then the store is whole and nobody writes it.
Outcome StoreReader::connect() {
  if (auto connected = connect(false); !connected) return connected;
  if (Number(database_.get(), "PRAGMA schema_version")) return Success();
  const int failure = sqlite3_errcode(database_.get());
  const bool noLog = ::access((path_ + "-wal").c_str(), F_OK) != 0;
  if (!noLog || (failure != SQLITE_CANTOPEN && failure != SQLITE_READONLY)) return Success();
  return connect(true);
}

Outcome StoreReader::connect(bool atRest) {
  std::string name = path_;
  if (atRest) name = fmt::format("file:{}?immutable=1", UriPath(path_));
  sqlite3* opened = nullptr;
  const int status = sqlite3_open_v2(
      name.c_str(), &opened, SQLITE_OPEN_READONLY | (atRest ? SQLITE_OPEN_URI : 0), nullptr);
  database_.reset(opened);
  atRest_ = atRest;
  if (status != SQLITE_OK) {
    return Failed(
        fmt::format("The store {} cannot be opened: {}. It belongs to the service's user "
                    "and group; join that group, or read it as root.",
                    path_, sqlite3_errmsg(opened)));
  }
  sqlite3_busy_timeout(opened, kBusyMilliseconds);
  return Success();
}

Outcome StoreReader::reconnect() {
  return atRest_ ? connect() : Success();
}

Outcome StoreReader::sessions(const SessionQuery& query,
                              const std::function<void(StoredSession)>& each) {
  if (auto connected = reconnect(); !connected) return connected;
  Statement rows(
      database_.get(),
      InOrder("SELECT s.id, s.session_id, s.client_type, s.client_version, s.batch_event,"
              " s.hierarchy_token, s.client_name, s.service_name, s.user_info, s.opened_at,"
              " s.flushed_at, ifnull(m.messages, 0) FROM agent_session s LEFT JOIN"
              " (SELECT agent_session, count(*) messages FROM message GROUP BY agent_session) m"
              " ON m.agent_session = s.id WHERE s.opened_at >= ?1",
              query.last));
  rows.bind(1, query.since.value_or(kEarliestDate).time_since_epoch().count());
  while (rows.next()) {
    each({rows.integer(0), rows.integer(1), rows.integer(2), rows.real(3), rows.integer(4) != 0,
          rows.text(5), rows.text(6), rows.text(7), rows.text(8), rows.date(9),
          rows.isNull(10) ? std::nullopt : std::optional(rows.date(10)), rows.integer(11)});
  }
  return rows.outcome();
}

Outcome StoreReader::messages(const MessageQuery& query,
                              const std::function<void(StoredMessage)>& each) {
  if (auto connected = reconnect(); !connected) return connected;
  std::string sql =
      "SELECT id, agent_session, session_id, service_name, category, type, payload, sent_at"
      " FROM message WHERE id > ?1";
  if (query.reporterID) sql += " AND session_id = ?2";
  if (query.agentSession) sql += " AND agent_session = ?3";
  if (query.since) sql += " AND sent_at >= ?4";
  Statement rows(database_.get(), InOrder(std::move(sql), query.last));
  rows.bind(1, query.afterID);
  if (query.reporterID) rows.bind(2, *query.reporterID);
  if (query.agentSession) rows.bind(3, *query.agentSession);
  if (query.since) rows.bind(4, query.since->time_since_epoch().count());
  while (rows.next()) {
    each({rows.integer(0), rows.isNull(1) ? std::nullopt : std::optional(rows.integer(1)),
          rows.integer(2), rows.text(3), static_cast<std::uint16_t>(rows.integer(4)),
          static_cast<std::uint16_t>(rows.integer(5)), rows.text(6), rows.date(7)});
  }
  return rows.outcome();
}

Outcome StoreReader::events(Events kind, const EventQuery& query,
                            const std::function<void(StoredEvent)>& each) {
  if (auto connected = reconnect(); !connected) return connected;
  std::string sql = kind == Events::power
                        ? "SELECT id, name, payload, recorded_at, domain FROM power_event"
                        : "SELECT id, name, payload, recorded_at, NULL FROM analytics_event";
  sql += " WHERE id > ?1";
  if (query.since) sql += " AND recorded_at >= ?2";
  if (query.name) sql += " AND name = ?3";
  Statement rows(database_.get(), InOrder(std::move(sql), query.last));
  rows.bind(1, query.afterID);
  if (query.since) rows.bind(2, query.since->time_since_epoch().count());
  if (query.name) rows.bind(3, *query.name);
  while (rows.next()) {
    each({rows.integer(0), rows.isNull(4) ? std::nullopt : std::optional(rows.integer(4)),
          rows.text(1), rows.text(2), rows.date(3)});
  }
  return rows.outcome();
}

Outcome StoreReader::backends(const std::function<void(StoredBackend)>& each) {
  // Ids come without gaps, but for rows that were erased.
  Statement rows(
      database_.get(),
      "WITH tables(name, least, most) AS ("
      " SELECT 'agent_session', (SELECT min(id) FROM agent_session), (SELECT max(id) FROM "
      "agent_session) UNION ALL"
      " SELECT 'message', (SELECT min(id) FROM message), (SELECT max(id) FROM message) UNION ALL"
      " SELECT 'analytics_event', (SELECT min(id) FROM analytics_event), (SELECT max(id) FROM "
      "analytics_event) UNION ALL"
      " SELECT 'power_event', (SELECT min(id) FROM power_event), (SELECT max(id) FROM "
      "power_event)),"
      " names(name) AS (SELECT backend FROM backend_cursor UNION"
      " SELECT backend FROM export_log WHERE backend != 'store')"
      "SELECT n.name, (SELECT sum(max(0, t.most - max(t.least - 1, ifnull((SELECT exported_through"
      " FROM backend_cursor c WHERE c.backend = n.name AND c.table_name = t.name), 0))))"
      " FROM tables t WHERE t.most IS NOT NULL),"
      " ifnull(sum(l.rows) FILTER (WHERE l.outcome NOT LIKE 'refused%'), 0),"
      " ifnull(sum(l.rows) FILTER (WHERE l.outcome LIKE 'refused%'), 0),"
      " max(l.at) FILTER (WHERE l.outcome NOT LIKE 'refused%')"
      " FROM names n LEFT JOIN export_log l ON l.backend = n.name GROUP BY n.name ORDER BY n.name");
  while (rows.next()) {
    each({rows.text(0), rows.integer(1), rows.integer(2), rows.integer(3),
          rows.isNull(4) ? std::nullopt : std::optional(rows.date(4))});
  }
  return rows.outcome();
}

Outcome StoreReader::exports(std::int64_t last, const std::function<void(StoredExport)>& each) {
  Statement rows(database_.get(),
                 InOrder("SELECT id, backend, table_name, first_id, last_id, rows, bytes, outcome,"
                         " at FROM export_log",
                         last));
  const auto optional = [&rows](int column) {
    return rows.isNull(column) ? std::nullopt : std::optional(rows.integer(column));
  };
  while (rows.next()) {
    each({rows.integer(0), rows.text(1), rows.text(2), optional(3), optional(4), rows.integer(5),
          rows.integer(6), rows.text(7), rows.date(8)});
  }
  return rows.outcome();
}

StoreWatch::StoreWatch(const std::string& path)
    : watch_(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
  // The directory, since the write-ahead log beside the store comes and goes.
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
