#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <variant>

#include "base/Date.h"
#include "store/database/Sqlite.h"
#include "store/database/Tables.h"

namespace quarvel {

/// Which rows somebody wants gone: one reporter ID's sessions and messages, everything from before
/// a date, or everything.
struct ErasureSelection {
  struct All {};
  std::variant<All, std::int64_t, Date> what;

  /// "session 4102", "before 2026-01-31T00:00:00.000000Z", "all".
  [[nodiscard]] std::string description() const;
};

/// Removes rows for good, in steps so small that rows on their way in hardly notice; only those
/// that were there when it began. Then the file is written anew, in one step that takes a second or
/// two when it is large, and the write-ahead log emptied, so that neither holds them any more.
/// Leaves one line in the ledger that says how many they were, and their number in `meta`; ids are
/// not given again.
///
/// For whoever writes the store: the service's writer, or a tool while there is no service.
class Erasure {
 public:
  /// Of rows up to the ids `through`. `connection` must outlive this, and so must `lastIDs`, the
  /// last ones committed at any time.
  Erasure(SqliteConnection& connection, ErasureSelection selection, const StoreIDs& through,
          const StoreIDs& lastIDs, Date now);
  /// As above for a store that nobody else writes: with the last ids that the file tells.
  Erasure(SqliteConnection& connection, ErasureSelection selection, Date now);
  Erasure(const Erasure&) = delete;
  Erasure& operator=(const Erasure&) = delete;
  ~Erasure();

  enum class Progress : std::uint8_t { more, done, failed };
  /// After `failed` nothing has been changed by this step, and it may be tried again.
  [[nodiscard]] Progress step();

  /// Rows of all kinds that were removed so far.
  [[nodiscard]] std::int64_t rows() const { return rows_; }
  /// Messages and events among those removed since the last call.
  [[nodiscard]] std::uint64_t takeCounted();
  /// Once done: whether a reader kept the log from being emptied, for longer than one waits.
  [[nodiscard]] bool logRemains() const { return logRemains_; }

  /// Removes the damaged stores that were set aside beside this one, which nobody can pick rows out
  /// of. Returns how many files went.
  static std::size_t removeSetAside(const std::filesystem::path& store);

 private:
  struct Slice {
    std::int64_t lastID = 0;
    std::int64_t rows = 0;
    std::int64_t bytes = 0;
  };

  [[nodiscard]] bool begin();
  [[nodiscard]] bool removeSlice();
  [[nodiscard]] bool removeRows(StoreTable table, Slice& slice);
  [[nodiscard]] bool record(StoreTable table, const Slice& slice);
  [[nodiscard]] bool write(const std::string& statement);
  [[nodiscard]] std::string condition(StoreTable table) const;
  [[nodiscard]] Progress giveBack();

  SqliteConnection& connection_;
  const ErasureSelection selection_;
  StoreIDs ownLastIDs_;
  const StoreIDs& lastIDs_;
  StoreIDs through_;
  const Date now_;
  std::optional<std::int64_t> ledgerLine_;
  std::size_t table_ = 0;   // of kErased, under way
  std::int64_t after_ = 0;  // what has been looked through of it
  std::int64_t rows_ = 0;
  std::uint64_t counted_ = 0;
  bool rewritten_ = false;
  int truncations_ = 0;  // tried
  bool logRemains_ = false;
};

}  // namespace quarvel
