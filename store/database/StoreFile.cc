#include "store/database/StoreFile.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <bit>
#include <cerrno>
#include <functional>
#include <system_error>

#include "base/Files.h"
#include "store/database/Salvage.h"
#include "store/database/SecureRandom.h"
#include "store/database/Tables.h"

namespace quarvel {

namespace {

constexpr mode_t kMode = 0640;
constexpr mode_t kDirectoryMode = 0750;

StoreErrorCode CodeOf(int errorNumber) {
  switch (errorNumber) {
    case ENOSPC:
    case EDQUOT:
      return StoreErrorCode::diskFull;
    case EIO:
    case EINTR:
    case EAGAIN:
    case EMFILE:
    case ENFILE:
    case ENOMEM:
      return StoreErrorCode::failed;
    default:
      return StoreErrorCode::inaccessible;
  }
}

bool Exists(const std::string& path) {
  struct stat status {};
  return ::lstat(path.c_str(), &status) == 0;
}

std::string AsideName(const std::filesystem::path& path, Date now) {
  std::string time = DateText(now);
  std::erase_if(time, [](char character) { return character == '-' || character == ':'; });
  return fmt::format("{}.corrupt-{}", path.string(), time);
}

/// Every file of the stores that were set aside, side files included.
std::vector<std::filesystem::path> FilesSetAside(const std::filesystem::path& path) {
  std::vector<std::filesystem::path> files;
  const std::string prefix = path.filename().string() + ".corrupt-";
  const std::filesystem::path directory = path.has_parent_path() ? path.parent_path() : ".";
  std::error_code failure;
  for (auto entry = std::filesystem::directory_iterator(directory, failure);
       !failure && entry != std::filesystem::directory_iterator(); entry.increment(failure)) {
    if (entry->path().filename().string().starts_with(prefix)) files.push_back(entry->path());
  }
  return files;
}

/// Moves the log of a store whose file was set aside or removed. SQLite would delete it, or apply
/// it to the new file.
Outcome MoveLogAside(const std::filesystem::path& path, Date now) {
  const std::string log = path.string() + "-wal";
  if (!Exists(log)) return Success();
  const auto aside = StoresSetAside(path);
  std::string to = (aside.empty() ? AsideName(path, now) : aside.front().string()) + "-wal";
  if (Exists(to)) to = AsideName(path, now) + "-wal";
  if (::rename(log.c_str(), to.c_str()) == 0) return Success();
  return StoreUnusable(log, errno, "It belongs to no store: move it away.");
}

}  // namespace

Error StoreUnusable(const std::filesystem::path& path, int errorNumber, std::string_view remedy) {
  return StoreError(CodeOf(errorNumber),
                    fmt::format("The telemetry store {} cannot be used: {}. {}", path.string(),
                                std::generic_category().message(errorNumber), remedy));
}

Outcome MakeStoreFile(const std::filesystem::path& path, Date now) {
  if (!Exists(path.string())) {
    if (Outcome moved = MoveLogAside(path, now); !moved) return moved;
  }
  const int made = ::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, kMode);
  if (made >= 0) {
    // The process's mask may have taken bits away.
    const int failure = ::fchmod(made, kMode) == 0 ? 0 : errno;
    ::close(made);
    if (failure == 0) return Success();
    ::unlink(path.c_str());
    return StoreUnusable(path, failure, "The file system must keep permissions.");
  }
  const std::string directory = path.parent_path().string();
  if (errno == ENOENT || errno == ENOTDIR) {
    return StoreUnusable(path, errno,
                         fmt::format("Make the directory {}, or set path in [store].", directory));
  }
  if (errno != EEXIST) {
    return StoreUnusable(
        path, errno,
        fmt::format("Let the service write to {}, or set path in [store].", directory));
  }
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) {
    return StoreUnusable(path, errno, "Let the service read and write it.");
  }
  if (!S_ISREG(status.st_mode)) {
    return StoreUnusable(path, EEXIST, "It must be a file: move away what is there.");
  }
  if (::access(path.c_str(), R_OK | W_OK) != 0) {
    return StoreUnusable(path, errno, "Let the service read and write it, or set path in [store].");
  }
  if (::access(path.parent_path().empty() ? "." : directory.c_str(), W_OK | X_OK) != 0) {
    // The write-ahead log stands beside the file.
    return StoreUnusable(path, errno, fmt::format("Let the service write to {} too.", directory));
  }
  return Success();
}

Result<std::filesystem::path> MakePlaceFor(const std::filesystem::path& path, Date now) {
  if (Exists(path.string())) return std::filesystem::path(AsideName(path, now));
  const std::filesystem::path directory = path.parent_path();
  if (!directory.empty() && !Exists(directory.string()) &&
      ::mkdir(directory.c_str(), kDirectoryMode) != 0) {
    return StoreUnusable(path, errno, fmt::format("Make the directory {}.", directory.string()));
  }
  if (Outcome made = MakeStoreFile(path, now); !made) return made.error();
  return path;
}

Outcome SyncStoreFile(const std::filesystem::path& path) {
  const int descriptor = ::open(path.c_str(), O_RDWR | O_CLOEXEC);
  if (descriptor < 0) return StoreUnusable(path, errno, "");
  const int failure = ::fsync(descriptor) == 0 ? 0 : errno;
  ::close(descriptor);
  if (failure != 0) return StoreUnusable(path, failure, "");
  SyncDirectory(path.parent_path());
  return Success();
}

Outcome SetStoreAside(const std::filesystem::path& path, Date now, const std::string& reason,
                      StoreNotices& notices) {
  const std::string aside = AsideName(path, now);
  for (const char* suffix : {"", "-wal", "-shm"}) {
    const std::string from = path.string() + suffix;
    if (::rename(from.c_str(), (aside + suffix).c_str()) != 0 && errno != ENOENT) {
      return StoreUnusable(from, errno, "It is corrupt: move it away.");
    }
  }
  SyncDirectory(path.parent_path());
  notices.push_back(
      {"SetStoreAside",
       fmt::format("The telemetry store {} is corrupt ({}). It is kept as {}, and a new one begun.",
                   path.string(), reason, aside)});
  return Success();
}

std::vector<std::filesystem::path> StoresSetAside(const std::filesystem::path& path) {
  std::vector<std::filesystem::path> stores = FilesSetAside(path);
  std::erase_if(stores, [](const std::filesystem::path& file) {
    const std::string name = file.filename().string();
    return name.ends_with("-wal") || name.ends_with("-shm");
  });
  std::ranges::sort(stores, std::greater());
  return stores;
}

std::size_t RemoveStoresSetAside(const std::filesystem::path& path) {
  std::size_t removed = 0;
  for (const std::filesystem::path& file : FilesSetAside(path)) {
    std::error_code failure;
    if (std::filesystem::remove(file, failure)) ++removed;
  }
  return removed;
}

namespace {

Error Failed(const std::filesystem::path& path, const SqliteConnection& connection) {
  return StoreError(connection.fault() == SqliteFault::diskFull ? StoreErrorCode::diskFull
                                                                : StoreErrorCode::failed,
                    fmt::format("The telemetry store {} cannot be opened: {}.", path.string(),
                                connection.message()));
}

bool CreateTables(SqliteConnection& connection) {
  // Incremental: a file shrinks step by step when its bound is lowered. Takes effect only before
  // the first table is made.
  return connection.execute("PRAGMA auto_vacuum = INCREMENTAL; BEGIN IMMEDIATE") &&
         connection.execute(CreateTablesSql().c_str()) &&
         connection.execute(
             fmt::format("INSERT INTO meta VALUES('store_id', '{}');"
                         "PRAGMA application_id = {}; PRAGMA user_version = {}; COMMIT",
                         NewUuid(), kStoreApplicationID, kStoreVersion)
                 .c_str());
}

/// Whether the numbers differ from ours by one wrong bit, and so belong to no other program.
bool HasDamagedHeader(std::int64_t application, std::int64_t version) {
  constexpr std::int64_t kNoVersionYet = 10'000;
  const auto difference = static_cast<std::uint64_t>(application ^ kStoreApplicationID);
  return std::has_single_bit(difference) ||
         (difference == 0 && (version < 0 || version >= kNoVersionYet));
}

/// Checks whose file it is and makes it a store of this version.
Outcome BringToVersion(const std::filesystem::path& path, SqliteConnection& connection) {
  const auto application = connection.integer("PRAGMA application_id");
  const auto version = connection.integer("PRAGMA user_version");
  const auto tables = connection.integer("SELECT count(*) FROM sqlite_schema");
  if (!application || !version || !tables) return Failed(path, connection);

  const bool isNew = *application == 0 && *version == 0 && *tables == 0;
  if (HasDamagedHeader(*application, *version)) {
    return StoreError(StoreErrorCode::corrupt, "its header is damaged");
  }
  if (!isNew && *application != kStoreApplicationID) {
    return StoreError(StoreErrorCode::foreign,
                      fmt::format("{} is the database of another program. Set path in [store] to a "
                                  "file of the service's own.",
                                  path.string()));
  }
  if (*version > kStoreVersion) {
    return StoreError(
        StoreErrorCode::laterVersion,
        fmt::format("The telemetry store {} has version {}, and this service knows versions up to "
                    "{}. Install the later service again, or move the file away.",
                    path.string(), *version, kStoreVersion));
  }
  if (*version == 0 && !CreateTables(connection)) return Failed(path, connection);
  return Success();
}

/// `ends` reads both ends of every table; `everyPage` takes a second for a few hundred megabytes.
/// Damage that `ends` misses is handled in the same way when the writer meets it.
enum class Check : std::uint8_t { ends, everyPage };

bool IsSound(SqliteConnection& connection, Check check) {
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
         (check == Check::ends || connection.text("PRAGMA quick_check(1)") == "ok");
}

/// Checks every page where that takes milliseconds, or a tenth of a second after an end without a
/// shutdown, which leaves the log behind.
Check CheckFor(const std::filesystem::path& path, bool isSuspect) {
  constexpr std::uintmax_t kAlwaysChecked = 4 << 20;
  constexpr std::uintmax_t kCheckedWhenLeftBehind = 32 << 20;
  std::error_code none;
  const auto log = std::filesystem::file_size(path.string() + "-wal", none);
  const bool wasLeftBehind = !none && log > 0;
  const auto bytes = std::filesystem::file_size(path, none);
  if (isSuspect) return Check::everyPage;
  const std::uintmax_t checked = wasLeftBehind ? kCheckedWhenLeftBehind : kAlwaysChecked;
  return !none && bytes <= checked ? Check::everyPage : Check::ends;
}

/// Whether a file that could not be used is corrupt. In a store by its header (`opened`), a missing
/// table or a page without meaning is corruption too.
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

Result<SqliteConnection> OpenStore(const std::filesystem::path& path, Date now, bool isSuspect,
                                   StoreNotices& notices) {
  const Check check = CheckFor(path, isSuspect);
  // A passing error of the medium may look like damage, so a file is set aside after the second.
  for (int timesCorrupt = 0;;) {
    if (Outcome file = MakeStoreFile(path, now); !file) return file.error();
    SqliteConnection connection;
    const Outcome opened = Open(path, connection);
    if (opened && IsSound(connection, check)) {
      SalvageStoresSetAside(path, connection, notices);
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
    if (Outcome aside = SetStoreAside(path, now, reason, notices); !aside) return aside.error();
  }
}

}  // namespace quarvel
