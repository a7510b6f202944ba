#include "platform/linux/store/StoreSchema.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <system_error>

#include "platform/Log.h"
#include "platform/linux/store/SecureRandom.h"
#include "platform/linux/store/StoreError.h"

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

Error Inaccessible(const std::filesystem::path& path, int errorNumber, std::string_view remedy) {
  return StoreError(StoreErrorCode::inaccessible,
                    fmt::format("The telemetry store {} cannot be used: {}. {}", path.string(),
                                std::generic_category().message(errorNumber), remedy));
}

/// Makes the file when there is none, and says clearly what is wrong when it cannot be used:
/// SQLite's own answer to all of these is "unable to open database file".
Outcome MakeFile(const std::filesystem::path& path) {
  const int made = ::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0640);
  if (made >= 0) {
    // The process's mask may have taken bits away.
    const bool moded = ::fchmod(made, 0640) == 0;
    ::close(made);
    if (moded) return Success();
    return Inaccessible(path, errno, "The file system must keep permissions.");
  }
  const std::string directory = path.parent_path().string();
  if (errno == ENOENT || errno == ENOTDIR) {
    return Inaccessible(path, errno,
                        fmt::format("Make the directory {}, or set path in [store].", directory));
  }
  if (errno != EEXIST) {
    return Inaccessible(
        path, errno,
        fmt::format("Let the service write to {}, or set path in [store].", directory));
  }
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) {
    return Inaccessible(path, EEXIST, "It must be a file: move away what is there.");
  }
  if (::access(path.c_str(), R_OK | W_OK) != 0) {
    return Inaccessible(path, errno, "Let the service read and write it, or set path in [store].");
  }
  if (::access(path.parent_path().empty() ? "." : directory.c_str(), W_OK | X_OK) != 0) {
    // The write-ahead log stands beside the file.
    return Inaccessible(path, errno, fmt::format("Let the service write to {} too.", directory));
  }
  return Success();
}

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

/// What the file is, and what it takes to make it a store of this version.
Outcome BringToVersion(const std::filesystem::path& path, SqliteConnection& connection) {
  const auto application = connection.integer("PRAGMA application_id");
  const auto version = connection.integer("PRAGMA user_version");
  const auto tables = connection.integer("SELECT count(*) FROM sqlite_schema");
  if (!application || !version || !tables) return Failed(path, connection);

  const bool isNew = *application == 0 && *version == 0 && *tables == 0;
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

/// Looks at both ends of every table. A full check of the file would take seconds; what it could
/// find beyond this is found, and dealt with in the same way, when it is met.
bool IsSound(SqliteConnection& connection) {
  return connection.integer("SELECT count(value) FROM meta WHERE key = 'store_id'").value_or(0) ==
             1 &&
         std::ranges::all_of(
             std::array{"agent_session", "message", "analytics_event", "power_event"},
             [&connection](const char* table) {
               const std::string ends = fmt::format(
                   "SELECT ifnull((SELECT min(id) FROM {0}), 0) <= "
                   "ifnull((SELECT max(id) FROM {0}), 0)",
                   table);
               return connection.integer(ends).has_value();
             });
}

/// Whether a file that could not be used is corrupt. In one that is a store by its header
/// (`isStore`), so is a table that is missing.
bool IsCorrupt(SqliteFault fault, bool isStore) {
  return fault == SqliteFault::corrupt ||
         (isStore && (fault == SqliteFault::statement || fault == SqliteFault::none));
}

Outcome Open(const std::filesystem::path& path, const std::string& vfs,
             SqliteConnection& connection) {
  if (!connection.open(path, vfs)) return Failed(path, connection);
  if (Outcome version = BringToVersion(path, connection); !version) return version;
  // Deleted rows are overwritten only where that costs no further page.
  if (!connection.execute("PRAGMA journal_mode = WAL; PRAGMA synchronous = NORMAL;"
                          "PRAGMA secure_delete = FAST; PRAGMA journal_size_limit = 4194304")) {
    return Failed(path, connection);
  }
  if (connection.text("PRAGMA journal_mode") != "wal") {
    return Inaccessible(path, ENOTSUP, "Its file system must have shared memory and locks.");
  }
  return Success();
}

}  // namespace

Outcome SetStoreAside(const std::filesystem::path& path, Date now, const std::string& reason) {
  ZQ_FUNCTION("SetStoreAside");
  std::string time = DateText(now);
  std::erase_if(time, [](char character) { return character == '-' || character == ':'; });
  const std::filesystem::path aside = fmt::format("{}.corrupt-{}", path.string(), time);
  for (const char* suffix : {"", "-wal", "-shm"}) {
    const std::string from = path.string() + suffix;
    if (::rename(from.c_str(), (aside.string() + suffix).c_str()) != 0 && errno != ENOENT) {
      return Inaccessible(from, errno, "It is corrupt: move it away.");
    }
  }
  ZQ_LOG(nullptr, error,
         "The telemetry store {} is corrupt ({}). It is kept as {}, and a new one begun.",
         path.string(), reason, aside.string());
  return Success();
}

Result<SqliteConnection> OpenStore(const std::filesystem::path& path, const std::string& vfs,
                                   Date now) {
  for (bool mayBeCorrupt = true;; mayBeCorrupt = false) {
    if (Outcome file = MakeFile(path); !file) return file.error();
    SqliteConnection connection;
    const Outcome opened = Open(path, vfs, connection);
    if (opened && IsSound(connection)) return connection;
    if (!mayBeCorrupt || !IsCorrupt(connection.fault(), opened.ok())) {
      return opened ? Failed(path, connection) : opened.error();
    }
    const std::string reason =
        connection.fault() == SqliteFault::none ? "no store_id" : connection.message();
    connection = {};
    if (Outcome aside = SetStoreAside(path, now, reason); !aside) return aside.error();
  }
}

}  // namespace quarvel
