#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "base/Date.h"
#include "base/Error.h"
#include "base/Mutex.h"
#include "export/ExportEngine.h"
#include "export/ExportSource.h"
#include "store/TelemetryStore.h"

namespace quarvel {

/// The state of one backend, for the status file.
struct ExportStatus {
  std::string backend;             // its name in the configuration
  StoreIDs exportedThrough;        // the cursors
  std::uint64_t exportedRows = 0;  // since the service started
  std::uint64_t refusedRows = 0;   // likewise; set aside
  std::uint64_t wakeUps = 0;       // likewise; of its thread
  std::optional<Date> acknowledgedAt;
  std::optional<std::string> error;  // the reason of the present back-off
  std::optional<Date> nextAttempt;   // during back-off
};

/// Carries a store's rows to one engine. Sends one batch at a time; the next one follows only after
/// the engine has acknowledged it and the store's writer has moved the cursor. A crash or an outage
/// at any point therefore repeats one batch at most, under the same names.
///
/// Retries for ever, with a back-off that doubles from 1 second to 5 minutes. A batch that the
/// engine refuses is halved until the row that it objects to is found; that row is set aside, with
/// a line in the ledger.
///
/// Owned by `ExportThread`, which calls `step` on its thread whenever a step is due. Only `status`
/// may be called from another thread.
class Exporter {
 public:
  using Instant = std::chrono::steady_clock::time_point;

  /// After the first failure in a row. The jitter shortens each back-off by up to a half.
  static constexpr std::chrono::seconds kFirstBackOff{1};
  static constexpr std::chrono::minutes kLongestBackOff{5};
  /// Longest time that is granted to an engine that asks for one (Retry-After).
  static constexpr std::chrono::hours kLongestAskedFor{1};
  /// Time without rows after which the engine disconnects.
  static constexpr std::chrono::seconds kDisconnectAfter{30};
  /// Limits of one batch, and so of the rows that a crash may repeat.
  static constexpr std::size_t kBatchRows = 1000;
  static constexpr std::size_t kBatchBytes = 512 * 1024;
  /// After so many refusals in a row the engine is taken to refuse everything: batches are set
  /// aside whole, with back-off in between.
  static constexpr int kRefusalsInARow = 8;

  struct Options {
    std::string backend;                 // its name in the configuration and in the ledger
    std::uint32_t rowsPerSecond = 2000;  // rate limit of draining a backlog
    std::chrono::seconds gather{0};      // rows are collected for this long before a batch is sent
    // For tests; empty: the system's clocks and random numbers.
    std::function<Date()> clock{};
    std::function<Instant()> monotonicClock{};
    std::function<double()> random{};  // from 0 to 1; the jitter of the back-off
  };

  /// `source` and `engine` must outlive this.
  Exporter(Options options, ExportSource& source, ExportEngine& engine);

  /// The condition of the next step; without `at` and `uponRows` there is none.
  struct Next {
    std::optional<Instant> at;  // call `step` again at this time
    bool uponRows = false;      // and as soon as the store's extent has grown
  };
  /// Sends one batch if one is due. `extent` is the durable part of the store: no row after it is
  /// sent, because a power cut could still take it.
  [[nodiscard]] Next step(const DurableExtent& extent);

  /// A copy of the present state. Any thread.
  [[nodiscard]] ExportStatus status() const QUARVEL_EXCLUDES(mutex_);

 private:
  /// Reads the cursors, anew when another store took the place of the known one.
  [[nodiscard]] Outcome findPosition();
  /// Whether durable rows lie after the cursors.
  [[nodiscard]] bool hasRows(const DurableExtent& extent) const;
  Next idle();  // no rows: disconnects once kDisconnectAfter is over
  Next exportBatch(const DurableExtent& extent);
  /// Records the outcome of a batch and says when the next one is due.
  Next conclude(const ExportBatch& batch, const Delivery& delivery);
  /// Returns the number of refused rows to set aside now; 0 when smaller batches are tried first.
  [[nodiscard]] std::size_t setAside(const Delivery& delivery);
  /// Moves the cursor and adds to the ledger, through the store's writer.
  [[nodiscard]] Outcome record(const ExportBatch& batch, const Delivery& delivery,
                               std::size_t setAside);
  Next backOff(std::string reason, std::optional<std::chrono::seconds> askedFor);
  void noteSuccess();  // ends the back-off

  const Options options_;
  ExportSource& source_;
  ExportEngine& engine_;

  std::string storeID_;  // empty before the first position
  StoreIDs exportedThrough_;
  std::size_t batchRows_ = kBatchRows;  // halved by a refusal, doubled by success
  int refusalsInARow_ = 0;
  std::chrono::milliseconds backOff_ = kFirstBackOff;
  Instant notBefore_{};  // back-off, and the rate limit of draining
  bool gathering_ = false;
  bool idle_ = true;
  std::optional<Instant> disconnectAt_;

  mutable Mutex mutex_;
  ExportStatus status_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
