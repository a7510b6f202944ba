#include "store/database/Sqlite.h"

#include <sqlite3.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cerrno>

namespace quarvel {

namespace {

constexpr int kBusyMilliseconds = 250;          // of the writer: rows wait behind it
constexpr int kReaderBusyMilliseconds = 5'000;  // of a tool: longer than any commit

/// Rewrites a file. After a failed sync the system drops the pages that it could not write, so that
/// the next sync succeeds without them; pages written again are synced.
bool Rewrite(sqlite3_file& file) {
  sqlite3_int64 size = 0;
  if (file.pMethods->xFileSize(&file, &size) != SQLITE_OK) return false;
  std::array<char, 65536> bytes{};
  for (sqlite3_int64 at = 0; at < size;) {
    const auto count =
        static_cast<int>(std::min(size - at, static_cast<sqlite3_int64>(bytes.size())));
    if (file.pMethods->xRead(&file, bytes.data(), count, at) != SQLITE_OK) return false;
    if (file.pMethods->xWrite(&file, bytes.data(), count, at) != SQLITE_OK) return false;
    at += count;
  }
  return true;
}

/// The name of a file as a URI that SQLite opens without looking for a log or locks.
std::string ImmutableUri(std::string_view path) {
  constexpr std::string_view kDigits = "0123456789ABCDEF";
  std::string uri = "file:";
  for (const char byte : path) {
    if (byte != '%' && byte != '?' && byte != '#') {
      uri += byte;
      continue;
    }
    const auto value = static_cast<unsigned char>(byte);
    uri += {'%', kDigits[value >> 4], kDigits[value & 15]};
  }
  return uri + "?immutable=1";
}

}  // namespace

void SqliteStatement::Finalize::operator()(sqlite3_stmt* statement) const {
  sqlite3_finalize(statement);
}

SqliteStatement& SqliteStatement::bind(int parameter, std::int64_t integer) {
  sqlite3_bind_int64(statement_.get(), parameter, integer);
  return *this;
}

SqliteStatement& SqliteStatement::bind(int parameter, double real) {
  sqlite3_bind_double(statement_.get(), parameter, real);
  return *this;
}

SqliteStatement& SqliteStatement::bind(int parameter, std::string_view text) {
  // A null pointer would bind NULL, and an empty view may hold one.
  sqlite3_bind_text64(statement_.get(), parameter, text.empty() ? "" : text.data(), text.size(),
                      nullptr, SQLITE_UTF8);
  return *this;
}

SqliteStatement& SqliteStatement::bind(int parameter, std::nullptr_t) {
  sqlite3_bind_null(statement_.get(), parameter);
  return *this;
}

SqliteStatement::Steady& SqliteStatement::steady(int parameter) {
  const auto index = static_cast<std::size_t>(parameter);
  if (index >= steady_.size()) {
    const int count = std::max(sqlite3_bind_parameter_count(statement_.get()), parameter);
    steady_.resize(static_cast<std::size_t>(count) + 1);
  }
  return steady_[index];
}

SqliteStatement& SqliteStatement::bindSteady(int parameter, std::int64_t integer) {
  Steady& bound = steady(parameter);
  if (bound.integer == integer) return *this;
  bound.integer = integer;
  return bind(parameter, integer);
}

SqliteStatement& SqliteStatement::bindSteady(int parameter, std::string_view text) {
  Steady& bound = steady(parameter);
  if (bound.text == text) return *this;
  bound.text = text;
  return bind(parameter, std::string_view(*bound.text));
}

SqliteStatement& SqliteStatement::bind(int parameter, const SqliteStatement& row, int column) {
  sqlite3_bind_value(statement_.get(), parameter,
                     sqlite3_column_value(row.statement_.get(), column));
  return *this;
}

bool SqliteStatement::run() {
  Step step = Step::row;
  while (step == Step::row) step = this->step();
  return step == Step::done;
}

SqliteStatement::Step SqliteStatement::step() {
  switch (sqlite3_step(statement_.get())) {
    case SQLITE_ROW:
      return Step::row;
    case SQLITE_DONE:
      reset();
      return Step::done;
    default:
      reset();
      return Step::failed;
  }
}

void SqliteStatement::reset() {
  sqlite3_reset(statement_.get());
}

std::int64_t SqliteStatement::integer(int column) const {
  return sqlite3_column_int64(statement_.get(), column);
}

std::string_view SqliteStatement::text(int column) const {
  const unsigned char* octets = sqlite3_column_text(statement_.get(), column);
  if (octets == nullptr) return {};
  return {reinterpret_cast<const char*>(octets),
          static_cast<std::size_t>(sqlite3_column_bytes(statement_.get(), column))};
}

double SqliteStatement::real(int column) const {
  return sqlite3_column_double(statement_.get(), column);
}

bool SqliteStatement::isNull(int column) const {
  return sqlite3_column_type(statement_.get(), column) == SQLITE_NULL;
}

void SqliteConnection::Close::operator()(sqlite3* connection) const {
  sqlite3_close_v2(connection);
}

bool SqliteConnection::open(const std::filesystem::path& path, Access access) {
  // Memory statistics are not used, and take a lock at each allocation.
  static const int uncounted [[maybe_unused]] = sqlite3_config(SQLITE_CONFIG_MEMSTATUS, 0);
  sqlite3* connection = nullptr;
  const bool writes = access == Access::readWrite;
  const std::string name =
      access == Access::immutable ? ImmutableUri(path.native()) : path.native();
  const int result = sqlite3_open_v2(name.c_str(), &connection,
                                     (writes ? SQLITE_OPEN_READWRITE : SQLITE_OPEN_READONLY) |
                                         (access == Access::immutable ? SQLITE_OPEN_URI : 0) |
                                         SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE,
                                     nullptr);
  connection_.reset(connection);
  if (result != SQLITE_OK) return false;
  if (writes && sqlite3_db_readonly(connection, "main") == 1) {
    // SQLite falls back to reading when the file cannot be opened for writing at this moment.
    rolledBackFault_ = SqliteFault::other;
    rolledBackMessage_ = "the file cannot be opened for writing";
    return false;
  }
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) {
    rolledBackFault_ = SqliteFault::other;
    rolledBackMessage_ = "the file cannot be looked at";
    return false;
  }
  path_ = path;
  device_ = status.st_dev;
  inode_ = status.st_ino;
  sqlite3_busy_timeout(connection, writes ? kBusyMilliseconds : kReaderBusyMilliseconds);
  // A file that is corrupt, or another program's, stays as it was found.
  sqlite3_db_config(connection, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 1, nullptr);
  sqlite3_wal_hook(
      connection,
      [](void* pages, sqlite3*, const char*, int logPages) {
        *static_cast<int*>(pages) = logPages;
        return SQLITE_OK;
      },
      logPages_.get());
  return true;
}

bool SqliteConnection::execute(const char* statements) {
  return sqlite3_exec(connection_.get(), statements, nullptr, nullptr, nullptr) == SQLITE_OK;
}

bool SqliteConnection::prepare(SqliteStatement& statement, std::string_view sql) {
  sqlite3_stmt* prepared = nullptr;
  const int result = sqlite3_prepare_v3(connection_.get(), sql.data(), static_cast<int>(sql.size()),
                                        SQLITE_PREPARE_PERSISTENT, &prepared, nullptr);
  statement = SqliteStatement(prepared);
  return result == SQLITE_OK;
}

std::string SqliteConnection::fileName() const {
  const char* name = sqlite3_db_filename(connection_.get(), "main");
  return name != nullptr ? name : path_.native();
}

std::optional<std::int64_t> SqliteConnection::integer(std::string_view sql) {
  SqliteStatement statement;
  if (!prepare(statement, sql) || statement.step() != SqliteStatement::Step::row) {
    return std::nullopt;
  }
  return statement.integer(0);
}

std::optional<std::string> SqliteConnection::text(std::string_view sql) {
  SqliteStatement statement;
  if (!prepare(statement, sql) || statement.step() != SqliteStatement::Step::row) {
    return std::nullopt;
  }
  return std::string(statement.text(0));
}

std::int64_t SqliteConnection::changes() const {
  return sqlite3_changes64(connection_.get());
}

void SqliteConnection::rollBack() {
  rolledBackFault_ = fault();
  rolledBackMessage_ = message();
  checkForSyncFailure();
  if (sqlite3_get_autocommit(connection_.get()) == 0) {
    sqlite3_exec(connection_.get(), "ROLLBACK", nullptr, nullptr, nullptr);
  }
}

void SqliteConnection::checkForSyncFailure() {
  if (sqlite3_extended_errcode(connection_.get()) == SQLITE_IOERR_FSYNC) logSyncFailed_ = true;
}

SqliteConnection::Checkpoint SqliteConnection::moveLog(int mode) {
  if (logSyncFailed_ && !syncLog()) return {};
  int logPages = -1;
  int movedPages = -1;
  const int result =
      sqlite3_wal_checkpoint_v2(connection_.get(), "main", mode, &logPages, &movedPages);
  checkForSyncFailure();
  return {result == SQLITE_OK && logPages == movedPages, movedPages};
}

SqliteConnection::Checkpoint SqliteConnection::checkpoint() {
  return moveLog(SQLITE_CHECKPOINT_PASSIVE);
}

bool SqliteConnection::restartLog() {
  if (!moveLog(SQLITE_CHECKPOINT_RESTART).complete) return false;
  *logPages_ = 0;
  return true;
}

bool SqliteConnection::emptyLog() {
  if (!moveLog(SQLITE_CHECKPOINT_TRUNCATE).complete) return false;
  *logPages_ = 0;
  return true;
}

void SqliteConnection::checkpointAtClose() {
  emptyLog();
  if (logSyncFailed_) return;
  sqlite3_db_config(connection_.get(), SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 0, nullptr);
}

bool SqliteConnection::syncLog() {
  sqlite3_file* log = nullptr;
  const int found =
      sqlite3_file_control(connection_.get(), "main", SQLITE_FCNTL_JOURNAL_POINTER, &log);
  if (found != SQLITE_OK) return false;
  if (log == nullptr || log->pMethods == nullptr) return true;
  if (logSyncFailed_ && !Rewrite(*log)) return false;
  logSyncFailed_ = log->pMethods->xSync(log, SQLITE_SYNC_NORMAL) != SQLITE_OK;
  return !logSyncFailed_;
}

bool SqliteConnection::hasMoved() const {
  struct stat status {};
  if (::stat(path_.c_str(), &status) != 0) return errno == ENOENT || errno == ENOTDIR;
  return status.st_dev != device_ || status.st_ino != inode_;
}

bool SqliteConnection::copyTo(const std::filesystem::path& path) {
  SqliteStatement copy;
  return prepare(copy, "VACUUM INTO ?1") && copy.bind(1, std::string_view(path.native())).run();
}

SqliteFault SqliteConnection::fault() const {
  const SqliteFault fault = currentFault();
  return fault == SqliteFault::none ? rolledBackFault_ : fault;
}

std::string SqliteConnection::message() const {
  return currentFault() == SqliteFault::none && rolledBackFault_ != SqliteFault::none
             ? rolledBackMessage_
             : sqlite3_errmsg(connection_.get());
}

SqliteFault SqliteConnection::currentFault() const {
  switch (sqlite3_errcode(connection_.get()) & 0xff) {
    case SQLITE_OK:
    case SQLITE_ROW:
    case SQLITE_DONE:
      return SqliteFault::none;
    case SQLITE_ERROR:
      return SqliteFault::statement;
    case SQLITE_FULL:
      return SqliteFault::diskFull;
    case SQLITE_CORRUPT:
    case SQLITE_NOTADB:
      return SqliteFault::corrupt;
    case SQLITE_CANTOPEN:
    case SQLITE_READONLY:
      return SqliteFault::inaccessible;
    default:
      return SqliteFault::other;
  }
}

}  // namespace quarvel
