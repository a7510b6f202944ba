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

/// The store as one exporter sees it: rows after a cursor, and the store's writer, which moves the
/// cursor. Has a connection of its own that only reads, and never for longer than one batch takes.
/// For the exporter's thread, but for `stop` and `resume`.
class ExportSource {
 public:
  /// `store` must outlive this.
  ExportSource(TelemetryStore& store, std::filesystem::path path, std::string backend);

  struct Position {
    std::string storeID;
    StoreIDs exportedThrough;
    std::optional<Date> acknowledgedAt;
  };
  /// Opens the store's file, again when another one has taken its place, and tells how far the
  /// backend is.
  [[nodiscard]] Result<Position> position();
  /// Whether the file that was opened is still the store.
  [[nodiscard]] bool isCurrent() { return isOpen_ && !connection_.hasMoved(); }

  struct Bounds {
    std::int64_t after = 0;    // ids above this,
    std::int64_t through = 0;  // and up to this
    std::size_t rows = 0;
    std::size_t bytes = 0;  // may be passed by one row
  };
  [[nodiscard]] Result<ExportBatch> read(StoreTable table, const Bounds& bounds);
  /// How many rows lie after the cursors. Any thread but with its own source.
  [[nodiscard]] Result<std::int64_t> backlog(const StoreIDs& exportedThrough);

  /// Has the store's writer keep this, and waits until it has. Errors: the store is closed, or
  /// `stop` was called meanwhile, and it is not known what became of it.
  [[nodiscard]] Outcome record(ExportRecord record);

  // Any thread. From now on until `resume`, `record` does not wait.
  void stop();
  void resume();
  [[nodiscard]] bool isStopped() const;

 private:
  /// Shared with the writer, who may answer when nobody waits any more.
  struct Pending {
    Mutex mutex;
    ConditionVariable changed;
    std::uint64_t answered QUARVEL_GUARDED_BY(mutex) = 0;  // the last record
    std::optional<Error> error QUARVEL_GUARDED_BY(mutex);
    bool stopped QUARVEL_GUARDED_BY(mutex) = false;
  };

  [[nodiscard]] Outcome open();
  [[nodiscard]] Error failed() const;

  TelemetryStore& store_;
  const std::filesystem::path path_;
  const std::string backend_;
  SqliteConnection connection_;  // before the statements, which must not outlive it
  struct Statements {
    SqliteStatement select, count;
  };
  PerStoreTable<Statements> statements_;
  bool isOpen_ = false;
  std::string storeID_;
  std::uint64_t records_ = 0;
  const std::shared_ptr<Pending> pending_ = std::make_shared<Pending>();
};

}  // namespace quarvel
