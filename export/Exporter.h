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

/// What one backend has to tell of itself.
struct ExportStatus {
  std::string backend;
  StoreIDs exportedThrough;
  std::uint64_t exportedRows = 0;  // since the service started
  std::uint64_t refusedRows = 0;   // set aside since then
  std::uint64_t wakeUps = 0;       // of its thread since then
  std::optional<Date> acknowledgedAt;
  std::optional<std::string> error;  // why it does not get on now
  std::optional<Date> nextAttempt;   // while it backs off
};

/// Carries a store's rows to one engine: a batch at a time, the next only once the engine has
/// acknowledged one and the store's writer has moved the cursor. So whatever happens at any point
/// repeats one batch at most, under the same names. Never gives up: it backs off from 1 second to 5
/// minutes. What the engine will never take is set aside, with a line in the ledger, after halving
/// the batch down to the row that it does not like.
///
/// Has no thread: `step` is called when there is something to do. Only `status` may be called from
/// another thread.
class Exporter {
 public:
  using Instant = std::chrono::steady_clock::time_point;

  static constexpr std::chrono::seconds kFirstBackOff{1};
  static constexpr std::chrono::minutes kLongestBackOff{5};
  /// What an engine may ask for at most.
  static constexpr std::chrono::hours kLongestAskedFor{1};
  /// How long an engine with nothing to do keeps its connection.
  static constexpr std::chrono::seconds kRestAfter{30};
  static constexpr std::size_t kBatchRows = 1000;
  static constexpr std::size_t kBatchBytes = 512 * 1024;
  /// So many rows refused one by one, and none taken, and the rest of a batch is not tried singly.
  static constexpr int kRefusalsInARow = 8;

  struct Options {
    std::string backend;
    std::uint32_t rowsPerSecond = 2000;
    std::chrono::seconds gather{0};  // how long rows are collected before a batch is sent
    // For tests; empty: the system's clocks, and a generator.
    std::function<Date()> clock{};
    std::function<Instant()> monotonicClock{};
    std::function<double()> random{};  // from 0 to 1, spreads a fleet's attempts
  };

  /// `source` and `engine` must outlive this.
  Exporter(Options options, ExportSource& source, ExportEngine& engine);

  struct Next {
    std::optional<Instant> at;  // call `step` again then
    bool uponRows = false;      // and as soon as there are more rows
  };
  /// Does what is due. `extent` is how far the store is safe: no row beyond is sent.
  [[nodiscard]] Next step(const DurableExtent& extent);

  [[nodiscard]] ExportStatus status() const QUARVEL_EXCLUDES(mutex_);

 private:
  [[nodiscard]] Outcome locate();
  [[nodiscard]] bool hasRows(const DurableExtent& extent) const;
  Next idle();
  Next exportBatch(const DurableExtent& extent);
  Next concluded(const ExportBatch& batch, const Delivery& delivery);
  /// How many of the rows that were refused are now set aside; with none, fewer are tried at once.
  [[nodiscard]] std::size_t setAside(const Delivery& delivery);
  [[nodiscard]] Outcome record(const ExportBatch& batch, const Delivery& delivery,
                               std::size_t setAside);
  Next backOff(std::string reason, std::optional<std::chrono::seconds> askedFor);
  void getsOn();

  const Options options_;
  ExportSource& source_;
  ExportEngine& engine_;

  std::string storeID_;
  StoreIDs exportedThrough_;
  std::size_t batchRows_ = kBatchRows;  // halved by refusals, doubled by success
  int refusalsInARow_ = 0;
  std::chrono::milliseconds backOff_ = kFirstBackOff;
  Instant notBefore_{};  // back-off, and the share of a backlog's draining
  bool gathering_ = false;
  bool idle_ = true;
  std::optional<Instant> restAt_;

  mutable Mutex mutex_;
  ExportStatus status_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
