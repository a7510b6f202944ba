#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "base/Date.h"
#include "base/Error.h"
#include "base/StoreCounters.h"
#include "store/StoreBatch.h"
#include "store/StoreSyncer.h"
#include "store/database/Retention.h"
#include "store/database/Sqlite.h"
#include "store/database/Tables.h"

namespace quarvel {

/// The store's open database file: transactions of rows, syncs and checkpoints of its log.
///
/// Owned by the `StoreWriter`, from one opening of the file to its closing. Used by one thread at a
/// time: the thread that opens it, then the writer's. An operation that returns false has failed
/// and changed nothing, and may be tried again; `error` says why.
class StoreDatabase {
 public:
  struct Options {
    std::filesystem::path path;  // of the database file
    Retention::Bounds bounds;
    int logPages = 1024;  // see `TelemetryStore::Options::logPages`
    /// Known from an earlier opening in this process: ids that were given, rows that were removed.
    StoreIDs knownIDs{};
    StoreDrops knownDrops{};
  };

  /// Calls `OpenStore` and logs its notices. `isSuspect`: as for `OpenStore`. Waits for the medium.
  [[nodiscard]] static Result<std::unique_ptr<StoreDatabase>> open(const Options& options, Date now,
                                                                   bool isSuspect);
  StoreDatabase(const StoreDatabase&) = delete;
  StoreDatabase& operator=(const StoreDatabase&) = delete;
  /// Moves everything into the database file and removes the log, as far as readers allow.
  ~StoreDatabase();

  /// A `normal` commit survives the end of the process. A `full` one survives a power cut, and
  /// makes everything before it durable.
  enum class Synchronous : std::uint8_t { normal, full };
  /// Writes rows `first` to `last` - 1 of a batch, and the counts in `drops`, in one transaction.
  [[nodiscard]] bool write(const StoreBatch& batch, std::size_t first, std::size_t last,
                           Synchronous synchronous, Date now, const StoreDrops& drops);
  /// Makes all commits durable; waits for the medium. Syncs the log alone: a transaction to carry a
  /// full commit would wear the medium for nothing.
  [[nodiscard]] bool sync();

  // Syncs and checkpoints beside the writer, one at a time. They run on the calling thread when
  // there can be no thread for them.

  /// `done` is called, on any thread, when a task has ended. Before any task is begun.
  void onSyncDone(std::function<void()> done) { onSyncDone_ = std::move(done); }
  /// Whether a task runs, or its result has not been taken.
  [[nodiscard]] bool taskInFlight() const { return inFlight_.has_value(); }
  /// Begins to make all commits durable. Only when no task is in flight.
  void beginSync() { beginTask(StoreSyncer::Task::sync); }
  /// Begins to move the write-ahead log into the database file once it has grown to a few
  /// megabytes, or has been left long. False when there is nothing to move. Only when no task is in
  /// flight.
  [[nodiscard]] bool beginCheckpointIfDue();
  /// Returns when the task in flight has ended, with or without success.
  void waitForSync();
  struct SyncResult {
    bool durable;     // everything committed when the task began
    StoreIDs ids;     // the last ids at that time
    bool syncFailed;  // the task was a sync, and not a checkpoint
  };
  /// The result of a task that has ended.
  [[nodiscard]] std::optional<SyncResult> takeSyncResult();

  /// Moves the log on this thread: on a full disk that may free the log's own space.
  void checkpoint();

  /// Whether the file was removed or renamed, so that no reader finds its rows.
  [[nodiscard]] bool fileIsGone() const { return connection_.hasMoved(); }
  /// Writes the content of a file that is gone to `path`, with its directory. When another file
  /// stands there, writes it beside that one as a store set aside, which the next opening salvages.
  [[nodiscard]] Outcome restoreFile(const std::filesystem::path& path, Date now);

  /// Sessions added while the file could not be opened get ids after this one.
  void placeProvisionalSessions(std::int64_t after) { provisionalSessionsAfter_ = after; }
  /// An erasure of rows up to these ids; must not outlive this.
  [[nodiscard]] std::unique_ptr<Erasure> erasure(const ErasureSelection& selection,
                                                 const StoreIDs& through, Date now) {
    return std::make_unique<Erasure>(connection_, selection, through, committedIDs_, now);
  }

  [[nodiscard]] Retention& retention() { return retention_; }

  [[nodiscard]] const std::string& storeID() const { return storeID_; }
  /// The last committed ids.
  [[nodiscard]] const StoreIDs& lastIDs() const { return committedIDs_; }
  /// At the opening: the counted rows in the file, and the drops that the file tells.
  [[nodiscard]] std::uint64_t storedAtOpening() const { return storedAtOpening_; }
  [[nodiscard]] const StoreDrops& dropsAtOpening() const { return dropsAtOpening_; }

  [[nodiscard]] bool isCorrupt() const { return connection_.fault() == SqliteFault::corrupt; }
  /// The last failure.
  [[nodiscard]] Error error() const;

 private:
  StoreDatabase(SqliteConnection connection, const Options& options);
  /// Prepares the statements, reads ids and counts, adds the ids and drops that only this process
  /// knows. False when it failed.
  [[nodiscard]] bool prepare(const Options& options, Date now);
  [[nodiscard]] bool readLastIDs();
  /// Writes ids and drops that this process knows and the file does not.
  [[nodiscard]] bool addKnown(const Options& options);
  [[nodiscard]] std::string message() const;

  /// Begins a transaction that commits as `synchronous`.
  bool begin(Synchronous synchronous);
  // In the open transaction; false when a statement failed.
  bool insert(const StoreBatch& batch, const AgentSessionRow& row);
  bool insert(const StoreBatch& batch, const MessageRow& row);
  bool insert(const StoreBatch& batch, const AnalyticsEventRow& row);
  bool insert(const StoreBatch& batch, const PowerEventRow& row);
  bool insert(const StoreBatch& batch, const FlushRow& row);
  /// Writes the counts in `meta` that differ from the file's.
  bool keepDrops(const StoreDrops& drops);
  bool insert(const StoreBatch& batch, const ExportedRow& row);
  bool insert(const StoreBatch&, const ErasureRow&) { return true; }
  [[nodiscard]] bool logIsLong() const;
  void beginTask(StoreSyncer::Task task);
  /// Runs the task in flight on this thread, for lack of a thread or a descriptor.
  void runTaskHere();
  /// Notes how much of the log a task has moved, and whether its sync failed.
  void taskEnded(const StoreSyncer::TaskResult& result);
  /// A payload as JSON text; valid until the next call.
  std::string_view json(const Payload& payload);
  /// The id in the file of a session that may have a provisional one.
  [[nodiscard]] std::int64_t storedID(std::int64_t session) const;

  SqliteConnection connection_;  // before the statements, which must not outlive it
  SqliteStatement begin_, commit_;
  PerStoreTable<SqliteStatement> inserts_;
  SqliteStatement markFlushed_, keepDrops_;
  SqliteStatement moveCursor_, writeLedger_, trimLedger_;
  Synchronous synchronous_ = Synchronous::normal;  // the connection's setting
  const int logPages_;                             // from here on the log is moved
  const int
      longestLogPages_;  // from here on rows wait: a reader keeps the log from beginning again
  bool logIsTooLong_ = false;  // it has reached that length
  // The log at the last checkpoint.
  int checkpointedPages_ = 0;  // its length when that began
  int movedPages_ = 0;
  bool isCatchingUp_ = false;  // all of it was moved, and it has grown meanwhile
  std::string storeID_;
  StoreIDs lastIDs_;  // with the ids of the open transaction
  StoreIDs committedIDs_;
  Retention retention_;
  std::int64_t provisionalSessionsAfter_ = 0;
  std::int64_t now_ = 0;  // of the open transaction, in microseconds
  std::string json_;      // of the current row; kept for its capacity
  std::uint64_t storedAtOpening_ = 0;
  StoreDrops dropsAtOpening_;
  StoreDrops keptDrops_;  // as the file has them
  const std::filesystem::path path_;
  std::function<void()> onSyncDone_ = [] {};
  std::unique_ptr<StoreSyncer> syncer_;  // null before it is needed
  struct InFlight {
    StoreIDs ids;                                   // the last committed ones at its beginning
    std::optional<StoreSyncer::TaskResult> result;  // once it has ended
    StoreSyncer::Task task;
  };
  std::optional<InFlight> inFlight_;
};

}  // namespace quarvel
