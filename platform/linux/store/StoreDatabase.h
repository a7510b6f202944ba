#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <string_view>

#include "base/Date.h"
#include "base/Error.h"
#include "platform/linux/store/Sqlite.h"
#include "platform/linux/store/StoreBatch.h"
#include "platform/linux/store/StoreRetention.h"
#include "platform/linux/store/StoreTables.h"

namespace quarvel {

/// The store's database file as its writer sees it: transactions of rows, and what makes them safe.
/// Used by one thread at a time: the one that opens it, then the writer. What returns false has
/// failed, changed nothing, and may be tried again; `fault` and `message` say why.
class StoreDatabase {
 public:
  struct Options {
    std::filesystem::path path;
    std::string vfs;  // empty: the default
    StoreRetention::Bounds bounds;
  };

  /// As `OpenStore`.
  [[nodiscard]] static Result<std::unique_ptr<StoreDatabase>> open(const Options& options,
                                                                   Date now);
  StoreDatabase(const StoreDatabase&) = delete;
  StoreDatabase& operator=(const StoreDatabase&) = delete;
  /// Moves everything into the database file and removes the log, as far as readers let it.
  ~StoreDatabase();

  /// How safe a commit is: `normal` survives the end of the process, `full` a power cut, and makes
  /// everything before it as safe.
  enum class Safety : std::uint8_t { normal, full };
  /// Writes rows `first` to `last` - 1 of a batch in one transaction.
  [[nodiscard]] bool write(const StoreBatch& batch, std::size_t first, std::size_t last,
                           Safety safety, Date now);
  /// Makes all earlier commits as safe as a full one. Only the log is synced: a transaction to
  /// carry a full commit would wear the medium for nothing.
  [[nodiscard]] bool sync() { return connection_.syncLog(); }

  /// Moves the write-ahead log into the database file once it has grown to a few megabytes. True
  /// when this made every commit safe.
  bool checkpointIfDue();
  /// Does so at once: on a full disk this may give the log's own space back.
  void checkpoint() { connection_.checkpoint(); }

  [[nodiscard]] StoreRetention& retention() { return retention_; }

  [[nodiscard]] std::int64_t lastAgentSession() const {
    return committedIDs_[StoreTable::agentSession];
  }
  /// The counted rows as of opening: in the file, and removed from it by retention since it was
  /// made.
  [[nodiscard]] std::uint64_t storedAtOpening() const { return storedAtOpening_; }
  [[nodiscard]] std::uint64_t droppedAtOpening() const { return droppedAtOpening_; }

  [[nodiscard]] SqliteFault fault() const { return connection_.fault(); }
  [[nodiscard]] std::string message() const { return connection_.message(); }

 private:
  StoreDatabase(SqliteConnection connection, StoreRetention::Bounds bounds);
  [[nodiscard]] bool prepare(Date now);
  [[nodiscard]] bool readLastIDs();

  bool begin(Safety safety);
  bool insert(const StoreBatch& batch, const AgentSessionRow& row);
  bool insert(const StoreBatch& batch, const MessageRow& row);
  bool insert(const StoreBatch& batch, const AnalyticsEventRow& row);
  bool insert(const StoreBatch& batch, const PowerEventRow& row);
  bool insert(const StoreBatch& batch, const FlushRow& row);
  std::string_view json(const Payload& payload);

  SqliteConnection connection_;  // before the statements, which must not outlive it
  SqliteStatement begin_, commit_;
  SqliteStatement insertAgentSession_, insertMessage_, insertAnalyticsEvent_, insertPowerEvent_;
  SqliteStatement markFlushed_;
  Safety safety_ = Safety::normal;  // what the connection is set to
  int checkpointedPages_ = 0;       // length of the log at the last checkpoint
  StoreIDs lastIDs_;                // given, in the transaction under way too
  StoreIDs committedIDs_;
  StoreRetention retention_;
  std::int64_t now_ = 0;  // of the transaction under way, in microseconds
  std::string json_;      // of the row under way; kept for its capacity
  std::uint64_t storedAtOpening_ = 0;
  std::uint64_t droppedAtOpening_ = 0;
};

}  // namespace quarvel
