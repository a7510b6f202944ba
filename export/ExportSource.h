#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>

#include "base/Date.h"
#include "base/Error.h"
#include "base/Mutex.h"
#include "export/ExportBatch.h"
#include "store/TelemetryStore.h"
#include "store/database/Sqlite.h"

namespace quarvel {

/// The store as one exporter sees it: the rows after its cursor, and the store's writer, which
/// moves the cursor. Reads through a connection of its own, one batch at a time, so that no read
/// holds up a checkpoint. Owned by its `ExportThread` and used on that thread, but for `stop`,
/// `resume` and `isStopped`.
class ExportSource {
 public:
  /// `store` must outlive this.
  /// `path` is the store's file, `backend` the name of the cursor. Opens nothing yet.
  ExportSource(TelemetryStore& store, std::filesystem::path path, std::string backend);

  /// The point up to which the backend has had all rows.
  struct Position {
    std::string storeID;                 // changes when another store took the place
    StoreIDs exportedThrough;            // the cursors
    std::optional<Date> acknowledgedAt;  // the last time by the ledger
  };
  /// Reads the backend's cursors, and opens the store's file first when it is not open or was
  /// replaced.
  [[nodiscard]] Result<Position> position();
  /// Whether the file that was opened is still the store.
  [[nodiscard]] bool isCurrent() { return isOpen_ && !connection_.hasMoved(); }

  /// The limits of one batch.
  struct Bounds {
    std::int64_t after = 0;    // ids above this,
    std::int64_t through = 0;  // and up to this
    std::size_t rows = 0;
    std::size_t bytes = 0;  // exceeded by one row at most
  };
  /// Reads rows that `position` found; none when they have been removed.
  [[nodiscard]] Result<ExportBatch> read(StoreTable table, const Bounds& bounds);
  /// Number of rows after the cursors, of all tables. Counts them in the store's file.
  [[nodiscard]] Result<std::int64_t> backlog(const StoreIDs& exportedThrough);

  /// Hands a record to the store's writer and waits until it is stored. Errors: the store is
  /// closed, or `stop` was called meanwhile and the record may or may not be stored.
  [[nodiscard]] Outcome record(ExportRecord record);

  // Any thread. Between `stop` and `resume`, `record` does not wait.
  void stop();
  void resume();  // later records wait again
  [[nodiscard]] bool isStopped() const;

 private:
  /// Shared with the store's writer, which may reply after `record` has stopped waiting.
  struct Pending {
    Mutex mutex;
    ConditionVariable changed;
    std::uint64_t answered QUARVEL_GUARDED_BY(mutex) =
        0;  // number of the last record that was stored or refused
    std::optional<Error> error QUARVEL_GUARDED_BY(mutex);
    bool stopped QUARVEL_GUARDED_BY(mutex) = false;
  };

  /// Opens the store's file for reading and prepares the statements.
  [[nodiscard]] Outcome open();
  /// The error of the connection's last call.
  [[nodiscard]] Error failed() const;

  TelemetryStore& store_;
  const std::filesystem::path path_;
  const std::string backend_;
  SqliteConnection connection_;  // before the statements, which must not outlive it
  struct Statements {
    SqliteStatement select, count;
  };
  PerStoreTable<Statements> statements_;
  bool isOpen_ = false;        // the connection and all statements are usable
  std::string storeID_;        // of the file that is open
  std::uint64_t records_ = 0;  // handed to the writer
  const std::shared_ptr<Pending> pending_ = std::make_shared<Pending>();
};

}  // namespace quarvel
