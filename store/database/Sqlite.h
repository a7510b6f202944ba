#pragma once

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Error.h"

struct sqlite3;
struct sqlite3_stmt;

namespace quarvel {

// The only wrapper around SQLite: the store, the exporters and the tools use it. Nothing throws; a
// false or empty result means failure, and the connection says why.

/// The kinds of failure that callers tell apart.
enum class SqliteFault : std::uint8_t {
  none,
  diskFull,
  corrupt,
  statement,     // does not fit this database: a table is missing, for example
  inaccessible,  // the file, or its log, cannot be opened or written
  other,
};

/// A prepared statement. Owned by the object that runs it; one thread at a time; must not outlive
/// its connection.
class SqliteStatement {
 public:
  enum class Step : std::uint8_t { row, done, failed };

  SqliteStatement() = default;
  /// `prepared` is null when the preparation failed: every run fails.
  explicit SqliteStatement(sqlite3_stmt* prepared) : statement_(prepared) {}

  // Parameters count from 1 and keep their values for later runs. Text is not copied: it must live
  // until the statement has run.
  SqliteStatement& bind(int parameter, std::int64_t integer);
  SqliteStatement& bind(int parameter, double real);
  SqliteStatement& bind(int parameter, std::string_view text);
  SqliteStatement& bind(int parameter, std::nullptr_t);
  /// For a parameter that seldom changes between runs: an equal value costs a comparison instead of
  /// a binding. Must not be mixed with `bind` for the same parameter. The text is copied.
  SqliteStatement& bindSteady(int parameter, std::int64_t integer);
  SqliteStatement& bindSteady(int parameter, std::string_view text);
  /// Takes a column of another statement's current row, of any kind.
  SqliteStatement& bind(int parameter, const SqliteStatement& row, int column);

  /// Runs to the end, ignores rows, and makes ready for the next run. False when it failed.
  bool run();
  /// Moves to the next row. After `done` and `failed` the statement is ready for the next run;
  /// after `row`, `reset` makes it so.
  Step step();
  void reset();

  // The current row's columns, counted from 0. The text is valid until the next step.
  [[nodiscard]] std::int64_t integer(int column) const;
  [[nodiscard]] std::string_view text(int column) const;
  [[nodiscard]] double real(int column) const;
  [[nodiscard]] bool isNull(int column) const;

 private:
  struct Finalize {
    void operator()(sqlite3_stmt* statement) const;
  };
  struct Steady {
    std::optional<std::int64_t> integer;
    std::optional<std::string> text;
  };
  Steady& steady(int parameter);

  std::vector<Steady> steady_;  // by parameter; its texts are bound, so it never grows
  std::unique_ptr<sqlite3_stmt, Finalize> statement_;
};

/// A connection to one database file. Closed by its destructor, or by assigning another one. One
/// thread at a time.
class SqliteConnection {
 public:
  SqliteConnection() = default;

  /// `immutable` reads a file that no process writes, without the locks and the log that SQLite
  /// otherwise needs beside it.
  enum class Access : std::uint8_t { readWrite, readOnly, immutable };
  /// Opens a file that exists. Statements wait for other connections, for up to 250 ms, or 5 s
  /// on a read-only connection. False when it failed.
  bool open(const std::filesystem::path& path, Access access = Access::readWrite);

  /// Runs statements without parameters, rows ignored. False when one failed.
  bool execute(const char* statements);
  /// On failure every run of the statement fails.
  [[nodiscard]] bool prepare(SqliteStatement& statement, std::string_view sql);
  /// The first column of the first row; none when there is no row or on failure.
  [[nodiscard]] std::optional<std::int64_t> integer(std::string_view sql);
  [[nodiscard]] std::optional<std::string> text(std::string_view sql);

  /// How many rows the last INSERT, UPDATE or DELETE changed.
  [[nodiscard]] std::int64_t changes() const;
  /// Ends the open transaction, if there still is one: some failures end it themselves.
  void rollBack();

  struct Checkpoint {
    bool complete = false;  // every commit is in the database file, and durable
    int pages = 0;          // of the log that have been moved
  };
  /// Moves the write-ahead log into the database file as far as readers allow; does not wait for
  /// them.
  Checkpoint checkpoint();
  /// Moves the whole log and begins it again at its start. Waits for readers as long as the busy
  /// time-out. False when a reader still needs the log.
  bool restartLog();
  /// Before closing: moves the log as far as readers allow, waiting for them as long as the busy
  /// time-out, and lets closing remove it.
  void checkpointAtClose();
  /// Moves the whole log into the database file and truncates it. Waits for readers as long as the
  /// busy time-out. False when a reader still needs the log.
  bool emptyLog();
  /// Syncs the write-ahead log, which makes all commits durable. Writes nothing new, but after a
  /// failed sync it first rewrites the log. A failure does not show in `fault` and `message`.
  bool syncLog();
  /// Whether the last sync has failed: commits and checkpoints must wait until `syncLog` succeeds.
  [[nodiscard]] bool logSyncFailed() const { return logSyncFailed_; }
  /// Notes a failed sync of another connection.
  void noteLogSyncFailure() { logSyncFailed_ = true; }
  /// Pages in the write-ahead log after the last commit.
  [[nodiscard]] int logPages() const { return *logPages_; }

  /// Whether the file, or its directory, was removed or renamed since the opening.
  [[nodiscard]] bool hasMoved() const;
  [[nodiscard]] bool isSameFileAs(const SqliteConnection& other) const {
    return device_ == other.device_ && inode_ == other.inode_;
  }
  /// Copies everything committed into the file `path`, which must be empty or not exist.
  bool copyTo(const std::filesystem::path& path);
  /// The full name of the file, for error texts.
  [[nodiscard]] std::string fileName() const;

  // The last call that failed, also when it was rolled back since.
  [[nodiscard]] SqliteFault fault() const;
  [[nodiscard]] std::string message() const;

 private:
  [[nodiscard]] SqliteFault currentFault() const;
  void checkForSyncFailure();
  Checkpoint moveLog(int mode);

  struct Close {
    void operator()(sqlite3* connection) const;
  };
  std::unique_ptr<int> logPages_ = std::make_unique<int>(0);  // where the commit hook writes
  std::filesystem::path path_;
  dev_t device_ = 0;
  ino_t inode_ = 0;
  bool logSyncFailed_ = false;
  SqliteFault rolledBackFault_ = SqliteFault::none;
  std::string rolledBackMessage_;
  std::unique_ptr<sqlite3, Close> connection_;
};

}  // namespace quarvel
