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

/// Why SQLite did not do something, as far as anybody above can act on it.
enum class SqliteFault : std::uint8_t {
  none,
  diskFull,
  corrupt,
  statement,  // it makes no sense to this database: a table is missing, say
  other,
};

/// A prepared statement. One thread at a time; must not outlive its connection.
class SqliteStatement {
 public:
  enum class Step : std::uint8_t { row, done, failed };

  SqliteStatement() = default;
  /// Null when it could not be prepared: every run fails.
  explicit SqliteStatement(sqlite3_stmt* prepared) : statement_(prepared) {}

  // Parameters count from 1. Text is not copied: it must live until the statement has run.
  SqliteStatement& bind(int parameter, std::int64_t integer);
  SqliteStatement& bind(int parameter, double real);
  SqliteStatement& bind(int parameter, std::string_view text);
  SqliteStatement& bind(int parameter, std::nullptr_t);
  /// For a parameter that is mostly what it was in the last run, and then costs a comparison; bound
  /// in no other way. The text is copied.
  SqliteStatement& bindSteady(int parameter, std::int64_t integer);
  SqliteStatement& bindSteady(int parameter, std::string_view text);
  /// A column of another statement's current row, of whatever kind.
  SqliteStatement& bind(int parameter, const SqliteStatement& row, int column);

  /// Runs to the end, whatever rows there are, and makes ready for the next run. False when it
  /// failed: the connection says why.
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

/// A connection to one database file. One thread at a time.
class SqliteConnection {
 public:
  SqliteConnection() = default;

  /// Opens for reading and writing; `path` must be a file that exists. False when it failed:
  /// `fault` and `message` say why.
  bool open(const std::filesystem::path& path);

  /// Runs statements without parameters, rows ignored. False when one failed.
  bool execute(const char* statements);
  /// The statement is unusable (every run fails) when this failed, and `sql` must not.
  [[nodiscard]] bool prepare(SqliteStatement& statement, std::string_view sql);
  /// The first column of the first row; none when there is no row or on failure.
  [[nodiscard]] std::optional<std::int64_t> integer(std::string_view sql);
  [[nodiscard]] std::optional<std::string> text(std::string_view sql);

  /// How many rows the last INSERT, UPDATE or DELETE changed.
  [[nodiscard]] std::int64_t changes() const;
  /// Ends the transaction under way, if there still is one: some failures end it themselves.
  void rollBack();

  struct Moved {
    bool all = false;  // then every commit is on the medium
    int pages = 0;     // up to which page of the log
  };
  /// Moves what readers allow from the write-ahead log into the database file; never waits for one.
  Moved checkpoint();
  /// Has the write-ahead log begin again at its start, all of it moved; waits for readers as long
  /// as the busy time-out. False when a reader still needs it.
  bool restartLog();
  /// Before closing: moves the whole log as far as readers let it (it waits for them as long as the
  /// busy time-out) and lets closing remove it.
  void checkpointAtClose();
  /// Moves the whole log into the database file and leaves none of it behind; waits for readers as
  /// long as the busy time-out. False when one was longer.
  bool emptyLog();
  /// Syncs the write-ahead log: everything committed is on the medium, and nothing new is written,
  /// but for what an earlier sync failed to write. A failure does not show in `fault` and
  /// `message`.
  bool syncLog();
  /// Whether a sync has failed and none has succeeded since: then commits and checkpoints must wait
  /// until `syncLog` has succeeded.
  [[nodiscard]] bool logIsDoubtful() const { return logIsDoubtful_; }
  /// A sync has failed on another connection.
  void doubtLog() { logIsDoubtful_ = true; }
  /// Pages in the write-ahead log after the last commit.
  [[nodiscard]] int logPages() const { return *logPages_; }

  /// Whether the file is no longer where it was opened: it was removed or renamed, or its directory
  /// was.
  [[nodiscard]] bool hasMoved() const;
  [[nodiscard]] bool isSameFileAs(const SqliteConnection& other) const {
    return device_ == other.device_ && inode_ == other.inode_;
  }
  /// Copies everything that is committed into the file `path`, which must be empty or not exist.
  bool copyTo(const std::filesystem::path& path);

  // About the last call that failed, also when it was rolled back since.
  [[nodiscard]] SqliteFault fault() const;
  [[nodiscard]] std::string message() const;

 private:
  [[nodiscard]] SqliteFault currentFault() const;
  void noteSyncFailure();
  Moved moveLog(int mode);

  struct Close {
    void operator()(sqlite3* connection) const;
  };
  std::unique_ptr<int> logPages_ = std::make_unique<int>(0);  // where the commit hook writes
  std::filesystem::path path_;
  dev_t device_ = 0;
  ino_t inode_ = 0;
  bool logIsDoubtful_ = false;
  SqliteFault rolledBackFault_ = SqliteFault::none;
  std::string rolledBackMessage_;
  std::unique_ptr<sqlite3, Close> connection_;
};

}  // namespace quarvel
