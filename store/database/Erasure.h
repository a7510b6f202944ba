#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>

#include "base/Date.h"
#include "store/database/Sqlite.h"
#include "store/database/Tables.h"

namespace quarvel {

/// The rows to erase: the sessions and messages of one reporter ID, all rows from before a date, or
/// all rows. A plain value.
struct ErasureSelection {
  struct All {};
  std::variant<All, std::int64_t, Date> what;

  /// "session 4102", "before 2026-01-31T00:00:00.000000Z", "all".
  [[nodiscard]] std::string description() const;
};

/// Removes rows for good, in steps of a few milliseconds between commits; only rows that existed
/// when it began. Then rewrites the file, in one step that takes a second or two when the file is
/// large, and empties the write-ahead log, so that neither holds the rows any more. Adds one line
/// to the ledger and the number of rows to `meta`. Erased ids are not given again.
///
/// Owned by the one process that writes the store: the service (`StoreWriter`, on its thread), or a
/// tool while no service runs. Lives as long as one erasure.
class Erasure {
 public:
  /// Erases rows up to the ids `through`. `connection` and `lastIDs`, which always holds the last
  /// committed ids, must outlive this.
  Erasure(SqliteConnection& connection, ErasureSelection selection, const StoreIDs& through,
          const StoreIDs& lastIDs, Date now);
  /// The same for a store without a service: takes the last ids from the file.
  Erasure(SqliteConnection& connection, ErasureSelection selection, Date now);
  Erasure(const Erasure&) = delete;
  Erasure& operator=(const Erasure&) = delete;
  ~Erasure();

  enum class Progress : std::uint8_t { more, done, failed };
  /// A step that `failed` has changed nothing and may be tried again.
  /// After `done` no further step may follow.
  [[nodiscard]] Progress step();

  /// Rows of all kinds that were removed so far.
  [[nodiscard]] std::int64_t rows() const { return rows_; }
  /// Messages and events among those removed since the last call.
  [[nodiscard]] std::uint64_t takeCounted();
  /// After `done`: whether a reader kept the log from being emptied for longer than the time-out.
  [[nodiscard]] bool logRemains() const { return logRemains_; }

 private:
  /// The rows that one step has removed from a table.
  struct Slice {
    std::int64_t lastID = 0;  // the last one that was searched
    std::int64_t rows = 0;
    std::int64_t bytes = 0;  // of their payloads
  };

  /// Writes the line of the ledger, once. False, here and below: a statement failed.
  [[nodiscard]] bool begin();
  [[nodiscard]] bool removeSlice();
  [[nodiscard]] bool removeRows(StoreTable table, Slice& slice);
  /// Adds a slice to the ledger's line and to the drops in `meta`, and keeps the last ids there.
  [[nodiscard]] bool record(StoreTable table, const Slice& slice);
  [[nodiscard]] bool write(const std::string& statement);
  /// The SQL condition for the selected rows of a table.
  [[nodiscard]] std::string condition(StoreTable table) const;
  /// Rewrites the file and empties the log.
  [[nodiscard]] Progress giveBack();

  SqliteConnection& connection_;
  const ErasureSelection selection_;
  StoreIDs ownLastIDs_;      // without a service; otherwise unused
  const StoreIDs& lastIDs_;  // of the service, or `ownLastIDs_`
  StoreIDs through_;         // rows with greater ids stay
  const Date now_;
  std::optional<std::int64_t> ledgerLine_;  // its id, once it is written
  std::size_t table_ = 0;                   // of kErased, under way
  std::int64_t after_ = 0;                  // the last id of it that was searched
  std::int64_t rows_ = 0;
  std::uint64_t counted_ = 0;  // since `takeCounted`
  bool rewritten_ = false;     // the file
  int truncations_ = 0;        // tried
  bool logRemains_ = false;
};

}  // namespace quarvel
