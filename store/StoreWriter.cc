#include "store/StoreWriter.h"

#include <utility>
#include <variant>

#include "platform/Log.h"
#include "store/database/StoreFile.h"

namespace quarvel {

namespace {

using std::chrono::steady_clock;

constexpr std::size_t kRowsPerCommit = 1024;
/// An error that lasts may be the connection's: it is opened anew after so many attempts.
constexpr int kAttemptsPerConnection = 4;

}  // namespace

StoreWriter::StoreWriter(Options options, std::unique_ptr<StoreDatabase> database,
                         const std::optional<Error>& failure, StoreQueue& queue)
    : options_(std::move(options)),
      queue_(queue),
      health_(options_.database.path, queue),
      durability_(options_.sync, options_.backOff, health_),
      ageing_({options_.database.path, options_.maximumAge, options_.ageing, options_.clock}, queue,
              durability_, health_) {
  if (database) {
    use(std::move(database));
  } else {
    health_.failed(*failure);
  }
}

void StoreWriter::run() {
  // A killed process may have left commits in the log that are not durable. Only durable rows are
  // exported.
  if (database_ && !options_.database.bounds.remoteBackends.empty()) {
    waitForSync();
    durability_.syncNow();
    closeIfCorrupt();
  }
  StoreBatch batch;
  for (;;) {
    pollSync();
    switch (queue_.take(batch, nextDeadline())) {
      case StoreQueue::Take::rows:
        write(batch);
        batch.clear();
        break;
      case StoreQueue::Take::called:
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
  if (ageing_.isDue() || isSuspect_ || !erasures_.empty()) return Instant{};
  return durability_.nextSync();
}

void StoreWriter::atDeadline() {
  // A new file is begun at once. Should that fail, the next rows try again.
  if (std::exchange(isSuspect_, false) && !database_) (void)reopen(true);
  erase();
  ageing_.removeStep();
  closeIfCorrupt();
}

void StoreWriter::pollSync() {
  durability_.takeSyncResult();
  closeIfCorrupt();
  // An erasure moves the log itself.
  if (!erasures_.empty()) return;
  durability_.beginSyncIfDue();
  closeIfCorrupt();
}

void StoreWriter::waitForSync() {
  durability_.waitForSync();
  closeIfCorrupt();
}

void StoreWriter::write(const StoreBatch& batch) {
  const std::size_t rows = batch.rows().size();
  for (std::size_t first = 0; first < rows;) {
    std::size_t last = first;
    StoreQueue::Tally tally;
    while (last < rows && tally.rows < kRowsPerCommit) {
      const StoreRow& row = batch.rows()[last++];
      tally.add(row);
      // An erasure does not take rows that were added after its request.
      if (std::holds_alternative<ErasureRow>(row)) break;
    }
    const Instant began = steady_clock::now();
    if (!gaveUp_) ageing_.makeRoom(tally.bytes);
    closeIfCorrupt();
    if (gaveUp_ || !writeRows(batch, first, last)) {
      loseRows(batch, first);
      return;
    }
    queue_.committed(tally, steady_clock::now() - began);
    completeRows(batch, first, last, std::nullopt);
    pollSync();
    erase();
    first = last;
  }
  restoreFileIfGone();
  const Date now = options_.clock();
  ageing_.checkClock(now);
  closeIfCorrupt();
  ageing_.ageIfDue(now);
  closeIfCorrupt();
}

bool StoreWriter::writeRows(const StoreBatch& batch, std::size_t first, std::size_t last) {
  BackOff backOff(options_.backOff);
  bool closing = false;
  for (int attempts = 1; !tryToWrite(batch, first, last); ++attempts) {
    health_.failed(database_ ? database_->error() : health_.failure());
    closeIfCorrupt();
    if (closing) return false;
    closing = queue_.waitForClose(steady_clock::now() + backOff.next());
    pollSync();
    if (database_) database_->checkpoint();
    if (attempts % kAttemptsPerConnection == 0) close();
  }
  health_.succeeded();
  return true;
}

bool StoreWriter::tryToWrite(const StoreBatch& batch, std::size_t first, std::size_t last) {
  if (!database_ && !reopen(std::exchange(isSuspect_, false))) return false;
  const bool full = needsFullCommit(batch, last);
  if (full) waitForSync();
  if (!database_) return false;
  const auto synchronous =
      full ? StoreDatabase::Synchronous::full : StoreDatabase::Synchronous::normal;
  if (!database_->write(batch, first, last, synchronous, options_.clock(),
                        queue_.counters().dropped)) {
    return false;
  }
  if (full) {
    durability_.noteAllDurable();
  } else {
    durability_.noteUnsynced(batch.queuedAt);
  }
  return true;
}

bool StoreWriter::needsFullCommit(const StoreBatch& batch, std::size_t last) const {
  return durability_.everyCommitSyncs() || (batch.isLast && last == batch.rows().size());
}

void StoreWriter::completeRows(const StoreBatch& batch, std::size_t first, std::size_t last,
                               const std::optional<Error>& error) {
  for (std::size_t i = first; i < last; ++i) {
    const StoreRow& row = batch.rows()[i];
    const auto* completion = StoreBatch::completion(row);
    if (!error && std::holds_alternative<FlushRow>(row)) {
      durability_.completeWhenDurable(*completion);
    } else if (completion != nullptr) {
      (*completion)(error);
    }
    const auto* erasure = std::get_if<ErasureRow>(&row);
    if (erasure != nullptr && error) erasure->completion(*error);
    if (erasure != nullptr && !error) erasures_.push_back({*erasure, database_->lastIDs()});
  }
}

void StoreWriter::loseRows(const StoreBatch& batch, std::size_t first) {
  gaveUp_ = true;
  StoreQueue::Tally tally;
  for (std::size_t i = first; i < batch.rows().size(); ++i) tally.add(batch.rows()[i]);
  queue_.lost(tally);
  completeRows(batch, first, batch.rows().size(), health_.failure());
}

void StoreWriter::erase() {
  ZQ_FUNCTION("StoreWriter::erase");
  if (erasures_.empty()) return;
  waitForSync();
  if (!database_ && !reopen(false)) return endErasure(health_.failure());
  if (erasures_.empty()) return;
  const ErasureSelection& selection = erasures_.front().wanted.selection;
  if (!erasure_) {
    erasure_ = database_->erasure(selection, erasures_.front().through, options_.clock());
    if (std::holds_alternative<ErasureSelection::All>(selection.what)) {
      RemoveStoresSetAside(options_.database.path);
    }
  }
  const auto progress = erasure_->step();
  queue_.droppedFromStore(StoreDrop::erased, erasure_->takeCounted());
  durability_.noteUnsynced();
  switch (progress) {
    case Erasure::Progress::more:
      return;
    case Erasure::Progress::failed:
      health_.failed(database_->error());
      closeIfCorrupt();
      if (erasure_) endErasure(health_.failure());
      return;
    case Erasure::Progress::done:
      break;
  }
  const std::int64_t rows = erasure_->rows();
  ZQ_LOG(nullptr, standard, "{} rows were erased ({}).{}", rows, selection.description(),
         erasure_->logRemains() ? " A reader keeps the log that still holds them." : "");
  endErasure(rows);
}

void StoreWriter::endErasure(const Result<std::int64_t>& rows) {
  erasure_.reset();
  if (erasures_.empty()) return;
  const ErasureRow ended = std::move(erasures_.front().wanted);
  erasures_.pop_front();
  ended.completion(rows);
}

bool StoreWriter::reopen(bool isSuspect) {
  StoreDatabase::Options options = options_.database;
  options.knownIDs = knownIDs_;
  options.knownDrops = queue_.counters().dropped;
  auto database = StoreDatabase::open(options, options_.clock(), isSuspect);
  if (!database) {
    health_.failedAgain(database.error());
    return false;
  }
  use(std::move(database.value()));
  database_->placeProvisionalSessions(*lastEarlierSession_);
  return true;
}

void StoreWriter::use(std::unique_ptr<StoreDatabase> database) {
  database_ = std::move(database);
  database_->onSyncDone([this] { queue_.call(); });
  durability_.setDatabase(database_.get());
  ageing_.setDatabase(database_.get());
  if (!lastEarlierSession_) lastEarlierSession_ = database_->lastIDs()[StoreTable::agentSession];
  queue_.restart(database_->storedAtOpening(), database_->dropsAtOpening());
}

void StoreWriter::closeIfCorrupt() {
  if (!health_.takeFailed() || !database_ || !database_->isCorrupt()) return;
  endErasure(health_.failure());
  close();
  isSuspect_ = true;
}

void StoreWriter::close() {
  erasure_.reset();
  if (database_) knownIDs_ = database_->lastIDs();
  durability_.setDatabase(nullptr);
  ageing_.setDatabase(nullptr);
  database_.reset();
}

void StoreWriter::restoreFileIfGone() {
  ZQ_FUNCTION("StoreWriter::putBackIfTakenAway");
  if (!database_ || !database_->fileIsGone()) return;
  const Outcome restored = database_->restoreFile(options_.database.path, options_.clock());
  if (!restored) {
    // The open descriptor is the only way to its rows: the file stays open and takes more rows.
    health_.failed(restored.error());
    return closeIfCorrupt();
  }
  ZQ_LOG(nullptr, error, "The telemetry store {} was taken away: all that was in it is put back.",
         options_.database.path.string());
  close();
  if (reopen(false)) health_.succeeded();
}

void StoreWriter::finish() {
  ZQ_FUNCTION("StoreWriter::finish");
  while (!erasures_.empty()) {
    endErasure(StoreError(StoreErrorCode::closed, "The store was closed before all was erased."));
  }
  const StoreDrops drops = queue_.counters().dropped;
  waitForSync();
  ageing_.checkClock(options_.clock());
  closeIfCorrupt();
  if (database_ && !gaveUp_) {
    if (database_->write({}, 0, 0, StoreDatabase::Synchronous::full, options_.clock(), drops)) {
      durability_.noteAllDurable();
    } else {
      health_.failed(database_->error());
      closeIfCorrupt();
    }
  }
  if (durability_.hasUnsynced()) {
    waitForSync();
    durability_.syncNow();
    closeIfCorrupt();
  }
  durability_.failFlushes(health_.failure());
  restoreFileIfGone();
  if (const std::uint64_t lost = drops[StoreDrop::storeClosed]; lost > 0) {
    ZQ_LOG(nullptr, error, "The telemetry store {} was closed while it took no rows: {} are lost.",
           options_.database.path.string(), lost);
  }
  ageing_.reportRemoved();
  close();
}

}  // namespace quarvel
