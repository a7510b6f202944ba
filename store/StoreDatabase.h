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
#include "store/StoreBatch.h"
#include "store/StoreSyncer.h"
#include "store/database/Retention.h"
#include "store/database/Sqlite.h"
#include "store/database/StoreCounters.h"
#include "store/database/Tables.h"

namespace quarvel {

/// The store's database file as its writer sees it: transactions of rows, and what makes them safe.
/// Used by one thread at a time: the one that opens it, then the writer. What returns false has
/// failed, changed nothing, and may be tried again; `fault` and `message` say why.
class StoreDatabase {
 public:
  struct Options {
    std::filesystem::path path;
    Retention::Bounds bounds;
    int logPages = 1024;  // as `TelemetryStore::Options::logPages`
    /// What this process knows of the store from an earlier opening: ids that were given, rows that
    /// were removed.
    StoreIDs knownIDs{};
    StoreDrops knownDrops{};
  };

  /// As `OpenStore`.
  [[nodiscard]] static Result<std::unique_ptr<StoreDatabase>> open(const Options& options, Date now,
                                                                   bool isSuspect);
  StoreDatabase(const StoreDatabase&) = delete;
  StoreDatabase& operator=(const StoreDatabase&) = delete;
  /// Moves everything into the database file and removes the log, as far as readers let it.
  ~StoreDatabase();

  /// How safe a commit is: `normal` survives the end of the process, `full` a power cut, and makes
  /// everything before it as safe.
  enum class Safety : std::uint8_t { normal, full };
  /// Writes rows `first` to `last` - 1 of a batch in one transaction, and what has been dropped
  /// before it reached the store.
  [[nodiscard]] bool write(const StoreBatch& batch, std::size_t first, std::size_t last,
                           Safety safety, Date now, const StoreDrops& drops);
  /// Makes all earlier commits as safe as a full one, at once. Only the log is synced: a
  /// transaction to carry a full commit would wear the medium for nothing.
  [[nodiscard]] bool sync();

  // What waits for the medium is done beside the writer, one at a time; or here, where that cannot
  // be.

  /// Called, on any thread, when something has ended that was begun: `takeSafe` says what. Before
  /// anything is begun.
  void onMediumsAnswer(std::function<void()> answered) { mediumAnswered_ = std::move(answered); }
  /// Whether something is under way, or its end has not been taken.
  [[nodiscard]] bool isUnderWay() const { return underWay_.has_value(); }
  /// Begins to make all earlier commits as safe as a full one. Only when nothing is under way.
  void beginSync() { beginTask(StoreSyncer::Task::sync); }
  /// Begins to move the write-ahead log into the database file once it has grown to a few
  /// megabytes, or has been left long. False when there is nothing to be moved. Only when nothing
  /// is under way.
  [[nodiscard]] bool beginCheckpointIfDue();
  /// Returns when what is under way has ended, however it did.
  void awaitMedium();
  struct Safe {
    bool all;      // that was committed when it began
    StoreIDs ids;  // the last ones then
    bool syncFailed;
  };
  /// What has ended.
  [[nodiscard]] std::optional<Safe> takeSafe();

  /// Moves the log at once: on a full disk this may give its own space back.
  void checkpoint();

  /// Whether the file has been taken away; then nobody will find what is written to it.
  [[nodiscard]] bool wasTakenAway() const { return connection_.hasMoved(); }
  /// Puts all that is in a file that was taken away where it was, with its directory; beside what
  /// is there now, as a store set aside. It is opened like any other then.
  [[nodiscard]] Outcome putBack(const std::filesystem::path& path, Date now);

  /// Says after which id the sessions get theirs that were added while the file could not be
  /// opened.
  void placeProvisionalSessions(std::int64_t after) { provisionalSessionsAfter_ = after; }
  /// An erasure of rows up to these ids; must not outlive this.
  [[nodiscard]] std::unique_ptr<Erasure> erasure(const ErasureSelection& selection,
                                                 const StoreIDs& through, Date now) {
    return std::make_unique<Erasure>(connection_, selection, through, committedIDs_, now);
  }

  [[nodiscard]] Retention& retention() { return retention_; }

  [[nodiscard]] const std::string& storeID() const { return storeID_; }
  /// The last ids that have been committed.
  [[nodiscard]] const StoreIDs& lastIDs() const { return committedIDs_; }
  /// The counted rows as of opening: in the file, and what the file says of others.
  [[nodiscard]] std::uint64_t storedAtOpening() const { return storedAtOpening_; }
  [[nodiscard]] const StoreDrops& dropsAtOpening() const { return dropsAtOpening_; }

  [[nodiscard]] SqliteFault fault() const { return connection_.fault(); }
  [[nodiscard]] std::string message() const;

 private:
  StoreDatabase(SqliteConnection connection, const Options& options);
  [[nodiscard]] bool prepare(const Options& options, Date now);
  [[nodiscard]] bool readLastIDs();
  /// Should the file know less than this process does, it learns it.
  [[nodiscard]] bool learn(const Options& options);

  bool begin(Safety safety);
  bool insert(const StoreBatch& batch, const AgentSessionRow& row);
  bool insert(const StoreBatch& batch, const MessageRow& row);
  bool insert(const StoreBatch& batch, const AnalyticsEventRow& row);
  bool insert(const StoreBatch& batch, const PowerEventRow& row);
  bool insert(const StoreBatch& batch, const FlushRow& row);
  bool keepDrops(const StoreDrops& drops);
  bool insert(const StoreBatch& batch, const ExportedRow& row);
  bool insert(const StoreBatch&, const ErasureRow&) { return true; }
  [[nodiscard]] bool logIsLong() const;
  void beginTask(StoreSyncer::Task task);
  void carryOutHere();
  void taskEnded(const StoreSyncer::End& end);
  std::string_view json(const Payload& payload);
  [[nodiscard]] std::int64_t placed(std::int64_t session) const;

  SqliteConnection connection_;  // before the statements, which must not outlive it
  SqliteStatement begin_, commit_;
  SqliteStatement insertAgentSession_, insertMessage_, insertAnalyticsEvent_, insertPowerEvent_;
  SqliteStatement markFlushed_, keepDrops_;
  SqliteStatement moveCursor_, writeLedger_, trimLedger_;
  Safety safety_ = Safety::normal;  // what the connection is set to
  const int logPages_;
  const int longestLogPages_;
  bool logIsTooLong_ = false;
  // Of the log, as of the last checkpoint.
  int checkpointedPages_ = 0;  // how long it was when that began
  int movedPages_ = 0;         // up to where it has been moved
  bool isCatchingUp_ = false;  // all of it was moved, and it has grown meanwhile
  std::string storeID_;
  StoreIDs lastIDs_;  // given, in the transaction under way too
  StoreIDs committedIDs_;
  Retention retention_;
  std::int64_t provisionalSessionsAfter_ = 0;
  std::int64_t now_ = 0;  // of the transaction under way, in microseconds
  std::string json_;      // of the row under way; kept for its capacity
  std::uint64_t storedAtOpening_ = 0;
  StoreDrops dropsAtOpening_;
  StoreDrops keptDrops_;  // of those that are dropped before they reach the store
  const std::filesystem::path path_;
  std::function<void()> mediumAnswered_ = [] {};
  std::unique_ptr<StoreSyncer> syncer_;  // null before it is needed
  struct UnderWay {
    StoreSyncer::Task task;
    StoreIDs ids;
    std::optional<StoreSyncer::End> end;
  };
  std::optional<UnderWay> underWay_;
};

}  // namespace quarvel
