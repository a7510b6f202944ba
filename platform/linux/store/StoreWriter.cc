#include "platform/linux/store/StoreWriter.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>
#include <variant>

#include "platform/Log.h"
#include "platform/linux/store/StoreError.h"
#include "platform/linux/store/StoreSchema.h"

namespace quarvel {

namespace {

using std::chrono::steady_clock;

constexpr std::size_t kRowsPerCommit = 1024;
constexpr std::chrono::milliseconds kFirstBackOff{50};
constexpr std::chrono::milliseconds kLongestBackOff{5000};
constexpr std::chrono::hours kAgeingInterval{1};
constexpr int kRetentionStepsPerCommit = 16;

/// Early enough for the sync itself to end in time.
std::chrono::milliseconds SyncAfter(std::chrono::milliseconds sync) {
  return sync - std::min(sync / 4, std::chrono::milliseconds{100});
}

}  // namespace

bool StoreWriter::Minutely::due() {
  const Instant now = steady_clock::now();
  if (last_ && now - *last_ < std::chrono::minutes{1}) return false;
  last_ = now;
  return true;
}

StoreWriter::StoreWriter(Options options, std::unique_ptr<StoreDatabase> database,
                         StoreQueue& queue)
    : options_(std::move(options)),
      syncAfter_(SyncAfter(options_.sync)),
      queue_(queue),
      database_(std::move(database)),
      nextAgeing_(steady_clock::now() + kAgeingInterval) {}

void StoreWriter::run() {
  StoreBatch batch;
  for (;;) {
    switch (queue_.take(batch, nextDeadline())) {
      case StoreQueue::Take::rows:
        write(batch);
        batch.clear();
        break;
      case StoreQueue::Take::deadline:
        atDeadline();
        break;
      case StoreQueue::Take::closed:
        finish();
        return;
    }
  }
}

std::optional<StoreWriter::Instant> StoreWriter::nextDeadline() const {
  if (retaining_) return Instant{};
  if (unsyncedSince_) return *unsyncedSince_ + syncAfter_;
  return std::nullopt;
}

void StoreWriter::atDeadline() {
  if (unsyncedSince_ && steady_clock::now() >= *unsyncedSince_ + syncAfter_) syncTail();
  if (!retaining_) return;
  const auto expired =
      ageing_ ? std::optional(options_.clock() - options_.maximumAge) : std::nullopt;
  if (!retain(0, expired)) retaining_ = ageing_ = false;
}

void StoreWriter::write(const StoreBatch& batch) {
  const std::size_t rows = batch.rows().size();
  for (std::size_t first = 0; first < rows;) {
    const std::size_t last = std::min(first + kRowsPerCommit, rows);
    StoreQueue::Tally tally;
    for (std::size_t i = first; i < last; ++i) tally.add(batch.rows()[i]);
    if (!gaveUp_) makeRoom(tally);
    if (gaveUp_ || !writeRows(batch, first, last)) {
      lose(batch, first);
      return;
    }
    const bool idle = queue_.committed(tally);
    completeFlushes(batch, first, last, std::nullopt);
    if (database_->checkpointIfDue(idle)) unsyncedSince_.reset();
    first = last;
  }
  if (steady_clock::now() >= nextAgeing_) {
    nextAgeing_ = steady_clock::now() + kAgeingInterval;
    retaining_ = ageing_ = true;
  }
}

bool StoreWriter::writeRows(const StoreBatch& batch, std::size_t first, std::size_t last) {
  ZQ_FUNCTION("StoreWriter::writeRows");
  std::chrono::milliseconds backOff = kFirstBackOff;
  bool closing = false;
  while (!tryToWrite(batch, first, last)) {
    failed(database_ ? databaseError() : failure_);
    if (closing) return false;
    closing = queue_.waitForClose(steady_clock::now() + backOff);
    backOff = std::min(backOff * 2, kLongestBackOff);
    if (database_) database_->checkpoint();
  }
  if (backOff != kFirstBackOff) {
    ZQ_LOG(nullptr, standard, "The telemetry store {} takes rows again.",
           options_.database.path.string());
  }
  return true;
}

bool StoreWriter::tryToWrite(const StoreBatch& batch, std::size_t first, std::size_t last) {
  if (!database_ && !reopen()) return false;
  const bool full = needsFullCommit(batch, first, last);
  const auto safety = full ? StoreDatabase::Safety::full : StoreDatabase::Safety::normal;
  if (!database_->write(batch, first, last, safety, options_.clock())) return false;
  if (full) {
    unsyncedSince_.reset();
  } else if (!unsyncedSince_) {
    unsyncedSince_ = batch.queuedAt;
  }
  return true;
}

bool StoreWriter::needsFullCommit(const StoreBatch& batch, std::size_t first,
                                  std::size_t last) const {
  if (batch.isLast && last == batch.rows().size()) return true;
  if (steady_clock::now() >= unsyncedSince_.value_or(batch.queuedAt) + syncAfter_) return true;
  const auto rows = batch.rows().begin();
  return std::any_of(rows + static_cast<std::ptrdiff_t>(first),
                     rows + static_cast<std::ptrdiff_t>(last),
                     [](const StoreRow& row) { return std::holds_alternative<FlushRow>(row); });
}

void StoreWriter::completeFlushes(const StoreBatch& batch, std::size_t first, std::size_t last,
                                  const std::optional<Error>& error) {
  for (std::size_t i = first; i < last; ++i) {
    if (const auto* flush = std::get_if<FlushRow>(&batch.rows()[i])) flush->completion(error);
  }
}

void StoreWriter::lose(const StoreBatch& batch, std::size_t first) {
  gaveUp_ = true;
  StoreQueue::Tally tally;
  for (std::size_t i = first; i < batch.rows().size(); ++i) tally.add(batch.rows()[i]);
  queue_.lost(tally);
  completeFlushes(batch, first, batch.rows().size(), failure_);
}

void StoreWriter::syncTail() {
  unsyncedSince_.reset();
  if (database_->sync()) return;
  failed(StoreError(StoreErrorCode::failed, "the write-ahead log cannot be synced"));
  unsyncedSince_ = steady_clock::now();
}

void StoreWriter::makeRoom(const StoreQueue::Tally& incoming) {
  int steps = 0;
  while (retain(incoming.bytes, std::nullopt)) {
    if (++steps < kRetentionStepsPerCommit) continue;
    retaining_ = true;
    return;
  }
}

bool StoreWriter::retain(std::uint64_t incomingBytes, std::optional<Date> expired) {
  if (!database_) return false;
  const auto progress = database_->retention().step(incomingBytes, expired);
  if (progress == StoreRetention::Progress::failed) failed(databaseError());
  if (!database_) return false;
  const auto removed = database_->retention().takeRemoved();
  if (removed.rows > 0) {
    queue_.droppedByRetention(removed.rows);
    removedNotExported_ += removed.notExported;
    reportRemoved(removedLine_.due());
    if (!unsyncedSince_) unsyncedSince_ = steady_clock::now();
  }
  return progress == StoreRetention::Progress::more;
}

void StoreWriter::reportRemoved(bool now) {
  ZQ_FUNCTION("StoreWriter::reportRemoved");
  if (!now || removedNotExported_ == 0) return;
  ZQ_LOG(nullptr, error,
         "The telemetry store {} is full or too old: {} rows were removed that no backend has had.",
         options_.database.path.string(), std::exchange(removedNotExported_, 0));
}

Error StoreWriter::databaseError() const {
  const bool full = database_->fault() == SqliteFault::diskFull;
  return StoreError(full ? StoreErrorCode::diskFull : StoreErrorCode::failed, database_->message());
}

void StoreWriter::failed(Error error) {
  ZQ_FUNCTION("StoreWriter::failed");
  failure_ = std::move(error);
  if (failureLine_.due()) {
    ZQ_LOG(nullptr, error, "The telemetry store {} fails: {}. Trying again; {} rows wait.",
           options_.database.path.string(), failure_.description(), queue_.counters().waiting);
  }
  if (!database_ || database_->fault() != SqliteFault::corrupt) return;
  const std::string reason = database_->message();
  database_.reset();
  unsyncedSince_.reset();
  if (Outcome aside = SetStoreAside(options_.database.path, options_.clock(), reason); !aside) {
    failure_ = aside.error();
  }
}

bool StoreWriter::reopen() {
  auto database = StoreDatabase::open(options_.database, options_.clock());
  if (!database) {
    failure_ = database.error();
    return false;
  }
  database_ = std::move(database.value());
  queue_.restart(database_->storedAtOpening(), database_->droppedAtOpening());
  return true;
}

void StoreWriter::finish() {
  ZQ_FUNCTION("StoreWriter::finish");
  if (unsyncedSince_) syncTail();
  if (const std::uint64_t lost = queue_.counters().lost; lost > 0) {
    ZQ_LOG(nullptr, error, "The telemetry store {} was closed while it took no rows: {} are lost.",
           options_.database.path.string(), lost);
  }
  reportRemoved(true);
  database_.reset();
}

}  // namespace quarvel
