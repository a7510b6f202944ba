#include "store/database/Schema.h"

#include <fmt/format.h>

#include <algorithm>
#include <bit>
#include <cerrno>
#include <cstdint>
#include <system_error>

#include "store/database/Salvage.h"
#include "store/database/SecureRandom.h"
#include "store/database/StoreError.h"
#include "store/database/StoreFile.h"
#include "store/database/Tables.h"

namespace quarvel {

namespace {

constexpr std::int64_t kApplicationID = 0x51525654;
constexpr std::int64_t kVersion = 1;

constexpr const char* kTables = R"sql(
CREATE TABLE agent_session(
  id INTEGER PRIMARY KEY, session_id INTEGER NOT NULL,
  client_type INTEGER NOT NULL, client_version REAL NOT NULL, batch_event INTEGER NOT NULL,
  hierarchy_token TEXT NOT NULL, client_name TEXT NOT NULL, service_name TEXT NOT NULL,
  user_info TEXT NOT NULL,
  opened_at INTEGER NOT NULL, flushed_at INTEGER);
CREATE TABLE message(
  id INTEGER PRIMARY KEY, agent_session INTEGER REFERENCES agent_session(id),
  session_id INTEGER NOT NULL,
  client_name TEXT NOT NULL, service_name TEXT NOT NULL,
  category INTEGER NOT NULL, type INTEGER NOT NULL,
  payload TEXT NOT NULL, sent_at INTEGER NOT NULL);
CREATE TABLE analytics_event(
  id INTEGER PRIMARY KEY, name TEXT NOT NULL, payload TEXT NOT NULL, recorded_at INTEGER NOT NULL);
CREATE TABLE power_event(
  id INTEGER PRIMARY KEY, domain INTEGER NOT NULL, name TEXT NOT NULL, payload TEXT NOT NULL,
  recorded_at INTEGER NOT NULL);
CREATE TABLE backend_cursor(
  backend TEXT NOT NULL, table_name TEXT NOT NULL, exported_through INTEGER NOT NULL,
  PRIMARY KEY(backend, table_name));
CREATE TABLE export_log(
  id INTEGER PRIMARY KEY, backend TEXT NOT NULL, table_name TEXT NOT NULL,
  first_id INTEGER, last_id INTEGER,
  rows INTEGER NOT NULL, bytes INTEGER NOT NULL, outcome TEXT NOT NULL, at INTEGER NOT NULL);
CREATE TABLE meta(key TEXT PRIMARY KEY, value TEXT NOT NULL);
)sql";

Error Failed(const std::filesystem::path& path, const SqliteConnection& connection) {
  return StoreError(connection.fault() == SqliteFault::diskFull ? StoreErrorCode::diskFull
                                                                : StoreErrorCode::failed,
                    fmt::format("The telemetry store {} cannot be opened: {}.", path.string(),
                                connection.message()));
}

bool CreateTables(SqliteConnection& connection) {
  // Incremental, so that a file can be made smaller step by step when its bound is lowered. It has
  // to be set before there is a table.
  return connection.execute("PRAGMA auto_vacuum = INCREMENTAL; BEGIN IMMEDIATE") &&
         connection.execute(kTables) &&
         connection.execute(
             fmt::format("INSERT INTO meta VALUES('store_id', '{}');"
                         "PRAGMA application_id = {}; PRAGMA user_version = {}; COMMIT",
                         NewUuid(), kApplicationID, kVersion)
                 .c_str());
}

/// Whether the numbers are neither ours nor anybody's, but what one wrong bit makes of ours.
bool HasDamagedHeader(std::int64_t application, std::int64_t version) {
  constexpr std::int64_t kNoVersionYet = 10'000;
  const auto difference = static_cast<std::uint64_t>(application ^ kApplicationID);
  return std::has_single_bit(difference) ||
         (difference == 0 && (version < 0 || version >= kNoVersionYet));
}

/// What the file is, and what it takes to make it a store of this version.
Outcome BringToVersion(const std::filesystem::path& path, SqliteConnection& connection) {
  const auto application = connection.integer("PRAGMA application_id");
  const auto version = connection.integer("PRAGMA user_version");
  const auto tables = connection.integer("SELECT count(*) FROM sqlite_schema");
  if (!application || !version || !tables) return Failed(path, connection);

  const bool isNew = *application == 0 && *version == 0 && *tables == 0;
  if (HasDamagedHeader(*application, *version)) {
    return StoreError(StoreErrorCode::corrupt, "its header is damaged");
  }
  if (!isNew && *application != kApplicationID) {
    return StoreError(StoreErrorCode::foreign,
                      fmt::format("{} is the database of another program. Set path in [store] to a "
                                  "file of the service's own.",
                                  path.string()));
  }
  if (*version > kVersion) {
    return StoreError(
        StoreErrorCode::laterVersion,
        fmt::format("The telemetry store {} has version {}, and this service knows versions up to "
                    "{}. Install the later service again, or move the file away.",
                    path.string(), *version, kVersion));
  }
  switch (*version) {
    case 0:
      if (!CreateTables(connection)) return Failed(path, connection);
      break;
    default:
      break;
  }
  return Success();
}

/// How closely a file is looked at before it is used.
enum class Look : std::uint8_t { brief, close };

/// Looks at both ends of every table, or closely at every page, which takes a second for a few
/// hundred megabytes. What a brief look does not find is dealt with in the same way when it is met.
bool IsSound(SqliteConnection& connection, Look look) {
  return connection.integer("SELECT count(value) FROM meta WHERE key = 'store_id'").value_or(0) ==
             1 &&
         connection.text("PRAGMA encoding") == "UTF-8" &&
         std::ranges::all_of(kAllStoreTables,
                             [&connection](StoreTable table) {
                               const std::string ends = fmt::format(
                                   "SELECT ifnull((SELECT min(id) FROM {0}), 0) <= "
                                   "ifnull((SELECT max(id) FROM {0}), 0)",
                                   StoreTableName(table));
                               return connection.integer(ends).has_value();
                             }) &&
         (look == Look::brief || connection.text("PRAGMA quick_check(1)") == "ok");
}

/// What costs milliseconds is always looked at closely; after an end that was not in order, when
/// the log is still there, what costs a tenth of a second.
Look LookFor(const std::filesystem::path& path, bool isSuspect) {
  constexpr std::uintmax_t kAlwaysChecked = 4 << 20;
  constexpr std::uintmax_t kCheckedWhenLeftBehind = 32 << 20;
  std::error_code none;
  const auto log = std::filesystem::file_size(path.string() + "-wal", none);
  const bool wasLeftBehind = !none && log > 0;
  const auto bytes = std::filesystem::file_size(path, none);
  if (isSuspect) return Look::close;
  const std::uintmax_t checked = wasLeftBehind ? kCheckedWhenLeftBehind : kAlwaysChecked;
  return !none && bytes <= checked ? Look::close : Look::brief;
}

/// Whether a file that could not be used is corrupt. In one that is a store by its header
/// (`opened`), so is a table that is missing, or pages that make no sense.
bool IsCorrupt(SqliteFault fault, const Outcome& opened) {
  return fault == SqliteFault::corrupt ||
         (!opened && opened.error().code == static_cast<std::int64_t>(StoreErrorCode::corrupt)) ||
         (opened && (fault == SqliteFault::statement || fault == SqliteFault::none));
}

Outcome Open(const std::filesystem::path& path, SqliteConnection& connection) {
  if (!connection.open(path)) return Failed(path, connection);
  if (Outcome version = BringToVersion(path, connection); !version) return version;
  // Deleted rows are overwritten only where that costs no further page.
  if (!connection.execute("PRAGMA journal_mode = WAL; PRAGMA synchronous = NORMAL;"
                          "PRAGMA secure_delete = FAST; PRAGMA journal_size_limit = 4194304")) {
    return Failed(path, connection);
  }
  if (connection.text("PRAGMA journal_mode") != "wal") {
    return StoreUnusable(path, ENOTSUP, "Its file system must have shared memory and locks.");
  }
  return Success();
}

}  // namespace

Result<SqliteConnection> OpenStore(const std::filesystem::path& path, Date now, bool isSuspect) {
  const Look look = LookFor(path, isSuspect);
  // An error of the medium that passes may look like damage: what looks so twice is set aside.
  for (int timesCorrupt = 0;;) {
    if (Outcome file = MakeStoreFile(path, now); !file) return file.error();
    SqliteConnection connection;
    const Outcome opened = Open(path, connection);
    if (opened && IsSound(connection, look)) {
      SalvageStoresSetAside(path, connection);
      return connection;
    }
    if (!IsCorrupt(connection.fault(), opened) || ++timesCorrupt > 2) {
      return opened ? Failed(path, connection) : opened.error();
    }
    if (timesCorrupt < 2) continue;
    const std::string reason = connection.fault() == SqliteFault::none
                                   ? "its content makes no sense"
                                   : connection.message();
    connection = {};
    if (Outcome aside = SetStoreAside(path, now, reason); !aside) return aside.error();
  }
}

}  // namespace quarvel
