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
#include "platform/linux/store/StoreDatabase.h"
#include "platform/linux/store/StoreQueue.h"

namespace quarvel {

/// The store's one writer: takes batches from the queue and commits them, syncs what would wait for
/// a sync too long, keeps the file within its bounds. Owned by the store; everything runs on the
/// store's thread.
class StoreWriter {
 public:
  struct Options {
    StoreDatabase::Options database;
    std::chrono::milliseconds sync{1000};
    std::chrono::days maximumAge{14};
    std::function<Date()> clock;
  };

  /// `queue` must outlive the writer.
  StoreWriter(Options options, std::unique_ptr<StoreDatabase> database, StoreQueue& queue);

  /// Works until the queue is closed and empty, then closes the database.
  void run();

 private:
  using Instant = StoreQueue::Instant;

  /// At most one line a minute.
  class Minutely {
   public:
    bool due();

   private:
    std::optional<Instant> last_;
  };

  /// What is next to do if no rows come.
  [[nodiscard]] std::optional<Instant> nextDeadline() const;
  void atDeadline();
  void write(const StoreBatch& batch);
  /// Commits rows, however long that takes; false when the store was closed before it could.
  bool writeRows(const StoreBatch& batch, std::size_t first, std::size_t last);
  [[nodiscard]] bool tryToWrite(const StoreBatch& batch, std::size_t first, std::size_t last);
  [[nodiscard]] bool needsFullCommit(const StoreBatch& batch, std::size_t first,
                                     std::size_t last) const;
  void completeFlushes(const StoreBatch& batch, std::size_t first, std::size_t last,
                       const std::optional<Error>& error);
  void lose(const StoreBatch& batch, std::size_t first);
  void syncTail();
  void makeRoom(const StoreQueue::Tally& incoming);
  /// One step of retention. False when there is nothing more to do.
  bool retain(std::uint64_t incomingBytes, std::optional<Date> expired);
  void reportRemoved(bool now);
  [[nodiscard]] Error databaseError() const;
  /// Reports, and begins a new file when this one turns out to be corrupt.
  void failed(Error error);
  [[nodiscard]] bool reopen();
  void finish();

  const Options options_;
  const std::chrono::milliseconds syncAfter_;
  StoreQueue& queue_;
  std::unique_ptr<StoreDatabase> database_;  // null while a new file could not be begun
  Error failure_;                            // of the last attempt
  Minutely failureLine_;
  bool gaveUp_ = false;  // the store was closed while it took no rows
  std::optional<Instant>
      unsyncedSince_;      // when the oldest row was queued that a power cut would take
  bool retaining_ = true;  // there may be rows to remove
  bool ageing_ = true;     // ... because of their age
  Instant nextAgeing_;
  std::uint64_t removedNotExported_ = 0;  // and not yet reported
  Minutely removedLine_;
};

}  // namespace quarvel
