#pragma once

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "base/Date.h"
#include "base/Error.h"
#include "base/Payload.h"
#include "store/database/Erasure.h"
#include "store/database/Tables.h"

namespace quarvel {

/// A part of a batch's text.
struct TextSpan {
  std::uint32_t offset = 0;
  std::uint32_t length = 0;
};

// Rows that are queued for the store, one struct for each kind. Plain values; the batch sets
// `texts`.

/// A row of `agent_session`.
struct AgentSessionRow {
  /// The places in `texts`, here and below.
  enum Text { hierarchyToken, clientName, serviceName };

  std::int64_t id;         // given by `TelemetryStore`; from `kProvisionalSessions` on: provisional
  std::int64_t sessionID;  // the reporter ID
  std::int64_t clientType;
  double clientVersion;  // finite
  bool batchEvent;
  Payload userInfo;
  Date openedAt;
  std::array<TextSpan, 3> texts{};
};

/// A row of `message`.
struct MessageRow {
  enum Text { clientName, serviceName };

  std::optional<std::int64_t> agentSession;  // none: a single message
  std::int64_t sessionID;                    // the reporter ID; -1: a single message
  std::uint16_t category;
  std::uint16_t type;
  Payload payload;
  Date sentAt;
  std::array<TextSpan, 2> texts{};
};

/// A row of `analytics_event`.
struct AnalyticsEventRow {
  enum Text { name };

  Payload payload;
  Date recordedAt;
  std::array<TextSpan, 1> texts{};
};

/// A row of `power_event`.
struct PowerEventRow {
  enum Text { name };

  std::int32_t domain;
  Payload payload;
  Date recordedAt;
  std::array<TextSpan, 1> texts{};
};

/// No row of its own: marks the agent session as flushed. `completion` is called once everything
/// before it is durable.
struct FlushRow {
  std::int64_t agentSession;  // its id, which may be provisional
  std::function<void(const std::optional<Error>&)> completion;
  std::array<TextSpan, 0> texts{};
};

/// A delivery to a backend: the new position of its cursor in one table, and lines for the ledger.
struct ExportRecord {
  /// One entry of the ledger (`export_log`).
  struct Line {
    std::int64_t firstID = 0;  // of the rows in the delivery, both ends included
    std::int64_t lastID = 0;
    std::int64_t rows = 0;
    std::int64_t bytes = 0;  // as `ExportRow::bytes`
    std::string outcome;     // "exported", or why the rows were not
  };

  std::string backend;
  std::string storeID;  // of the store from which the rows were read
  StoreTable table{};
  std::int64_t lastID = 0;  // the new position: rows up to here are settled
  std::vector<Line> lines;
};

/// No row of its own: moves a backend's cursor and writes the ledger.
struct ExportedRow {
  ExportRecord record;
  std::function<void(const std::optional<Error>&)> completion;  // after the commit
  std::array<TextSpan, 0> texts{};
};

/// No row of its own: begins an erasure once everything before it is committed.
struct ErasureRow {
  ErasureSelection selection;
  std::function<void(const Result<std::int64_t>&)> completion;  // gets the number of rows
  std::array<TextSpan, 0> texts{};
};

/// Everything that can stand in the queue.
using StoreRow = std::variant<AgentSessionRow, MessageRow, AnalyticsEventRow, PowerEventRow,
                              FlushRow, ExportedRow, ErasureRow>;

/// The longest sum of a row's texts and payload. As JSON they become at most six times as long. A
/// row longer than SQLite takes (10^9 bytes) would be tried for ever, and hold up all later rows.
inline constexpr std::size_t kMostRowBytes = std::size_t{128} << 20;

/// Whether a row with these texts is longer than `kMostRowBytes`.
template <class Row>
[[nodiscard]] bool IsTooLarge(const Row& row, std::initializer_list<std::string_view> texts) {
  std::size_t bytes = 0;
  for (const std::string_view text : texts) bytes += text.size();
  if constexpr (requires { row.payload; }) bytes += row.payload.encoded().size();
  if constexpr (requires { row.userInfo; }) bytes += row.userInfo.encoded().size();
  return bytes > kMostRowBytes;
}

/// Rows in the order in which they were queued. Their texts stand one after the other in one string
/// that keeps its memory for the next batch, so that a row costs no allocation of its own.
///
/// One is owned by the `StoreQueue`, which fills it under its lock, and one by the writer's thread;
/// the two are swapped.
class StoreBatch {
 public:
  using Instant = std::chrono::steady_clock::time_point;

  /// Takes over `row` and copies `texts`, one for each element of `row.texts`, in their order.
  template <class Row>
  void append(Row&& row, std::initializer_list<std::string_view> texts) {
    std::size_t index = 0;
    for (const std::string_view text : texts) {
      row.texts[index++] = {static_cast<std::uint32_t>(text_.size()),
                            static_cast<std::uint32_t>(text.size())};
      text_.append(text);
    }
    rows_.emplace_back(std::forward<Row>(row));
  }

  [[nodiscard]] const std::vector<StoreRow>& rows() const { return rows_; }
  /// A text of one of the rows; valid until the next `append` or `clear`.
  [[nodiscard]] std::string_view text(TextSpan span) const {
    return std::string_view(text_).substr(span.offset, span.length);
  }

  /// Drops all rows; keeps the memory for the next ones, up to a bound.
  void clear();

  /// The bytes of a row in the queue's bound.
  [[nodiscard]] static std::size_t bytes(const StoreRow& row);
  /// The completion to call after a row's commit; null when it has none.
  [[nodiscard]] static const std::function<void(const std::optional<Error>&)>* completion(
      const StoreRow& row);
  /// Whether a row is counted from acceptance to storage.
  [[nodiscard]] static bool isCounted(const StoreRow& row);

  /// When the oldest row was queued.
  Instant queuedAt{};
  /// Whether this is the last batch: the store is being closed.
  bool isLast = false;

 private:
  std::vector<StoreRow> rows_;
  std::string text_;  // the texts of all rows
};

}  // namespace quarvel
