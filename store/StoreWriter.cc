#include "store/StoreWriter.h"

#include <fmt/format.h>

#include <algorithm>
#include <ctime>
#include <iterator>
#include <utility>
#include <variant>

#include "platform/Log.h"
#include "store/database/StoreError.h"

namespace quarvel {

namespace {

using std::chrono::steady_clock;

constexpr std::size_t kRowsPerCommit = 1024;
constexpr std::chrono::milliseconds kLongestBackOff{5000};
constexpr std::chrono::minutes kClockMayDrift{5};
constexpr int kRetentionStepsPerCommit = 16;
constexpr int kAttemptsPerConnection = 4;

/// Runs while the device sleeps, as the clock does and the monotonic one does not.
std::chrono::nanoseconds SinceBoot() {
  timespec time{};
  ::clock_gettime(CLOCK_BOOTTIME, &time);
  return std::chrono::seconds{time.tv_sec} + std::chrono::nanoseconds{time.tv_nsec};
}

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
                         const std::optional<Error>& failure, StoreQueue& queue)
    : options_(std::move(options)),
      syncAfter_(SyncAfter(options_.sync)),
      queue_(queue),
      agedAt_(steady_clock::now()),
      clockSeenAt_(SinceBoot()),
      clockSeen_(options_.clock()) {
  if (database) {
    adopt(std::move(database));
  } else {
    failed(*failure);
  }
}

void StoreWriter::run() {
  // What a killed process left in the log may not be on the medium yet.
  if (database_ && !options_.database.bounds.remoteBackends.empty()) syncHere();
  StoreBatch batch;
  for (;;) {
    attendMedium();
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
  if (retaining_ || isSuspect_ || !erasures_.empty()) return Instant{};
  // The end of what is under way calls.
  if (!database_ || database_->isUnderWay()) return std::nullopt;
  if (!flushes_.empty()) return syncNotBefore_;
  if (unsyncedSince_) return std::max(*unsyncedSince_ + syncAfter_, syncNotBefore_);
  return std::nullopt;
}

void StoreWriter::atDeadline() {
  // A new file is begun at once; should that fail, it is tried again when rows come.
  if (std::exchange(isSuspect_, false) && !database_) (void)reopen(true);
  erase();
  if (!retaining_) return;
  if (retain(0, expired_)) return;
  retaining_ = false;
  expired_.reset();
}

void StoreWriter::write(const StoreBatch& batch) {
  const std::size_t rows = batch.rows().size();
  for (std::size_t first = 0; first < rows;) {
    std::size_t last = first;
    StoreQueue::Tally tally;
    while (last < rows && tally.rows < kRowsPerCommit) {
      const StoreRow& row = batch.rows()[last++];
      tally.add(row);
      // What was added after an erasure was asked for is none of its rows.
      if (std::holds_alternative<ErasureRow>(row)) break;
    }
    const Instant began = steady_clock::now();
    if (!gaveUp_) makeRoom(tally);
    if (gaveUp_ || !writeRows(batch, first, last)) {
      lose(batch, first);
      return;
    }
    queue_.committed(tally, steady_clock::now() - began);
    complete(batch, first, last, std::nullopt);
    attendMedium();
    erase();
    first = last;
  }
  putBackIfTakenAway();
  const Date now = options_.clock();
  watchClock(now);
  if (steady_clock::now() >= agedAt_ + options_.ageing) beginAgeing(now);
}

void StoreWriter::watchClock(Date now) {
  ZQ_FUNCTION("StoreWriter::watchClock");
  const auto passed = SinceBoot() - clockSeenAt_;
  const auto step = (now - std::exchange(clockSeen_, now)) - passed;
  clockSeenAt_ += passed;
  if (step < -kClockMayDrift || step > kClockMayDrift) {
    ZQ_LOG(nullptr, standard,
           "The clock was set by {} s: no row is removed for its age until it has run on for a "
           "while, and those stored since the service started count as new.",
           std::chrono::floor<std::chrono::seconds>(step).count());
    expired_.reset();
    clockWasSet_ = true;
    clockMarkIsDue_ = true;
  }
  if (!clockMarkIsDue_ || !database_) return;
  if (!database_->retention().clockWasSet(now)) return failed(databaseError());
  clockMarkIsDue_ = false;
  if (!unsyncedSince_) unsyncedSince_ = steady_clock::now();
}

void StoreWriter::beginAgeing(Date now) {
  agedAt_ = steady_clock::now();
  expired_.reset();
  const bool hasRunOn = !std::exchange(clockWasSet_, clockMarkIsDue_);
  if (!hasRunOn || !database_) return;
  expired_ = database_->retention().expiry(now, now - options_.maximumAge);
  if (!expired_) return failed(databaseError());
  retaining_ = true;
}

bool StoreWriter::writeRows(const StoreBatch& batch, std::size_t first, std::size_t last) {
  std::chrono::milliseconds backOff = options_.firstBackOff;
  bool closing = false;
  for (int attempts = 1; !tryToWrite(batch, first, last); ++attempts) {
    failed(database_ ? databaseError() : failure_);
    if (closing) return false;
    closing = queue_.waitForClose(steady_clock::now() + backOff);
    backOff = std::min(backOff * 2, kLongestBackOff);
    attendMedium();
    if (database_) database_->checkpoint();
    // What does not go away by itself may be the connection's.
    if (attempts % kAttemptsPerConnection == 0) close();
  }
  succeeded();
  return true;
}

bool StoreWriter::tryToWrite(const StoreBatch& batch, std::size_t first, std::size_t last) {
  if (!database_ && !reopen(std::exchange(isSuspect_, false))) return false;
  const bool full = needsFullCommit(batch, last);
  if (full) settle();
  if (!database_) return false;
  const auto safety = full ? StoreDatabase::Safety::full : StoreDatabase::Safety::normal;
  if (!database_->write(batch, first, last, safety, options_.clock(), queue_.counters().dropped)) {
    return false;
  }
  if (full) {
    allIsSafe();
  } else if (!unsyncedSince_) {
    unsyncedSince_ = batch.queuedAt;
  }
  return true;
}

bool StoreWriter::needsFullCommit(const StoreBatch& batch, std::size_t last) const {
  return options_.sync.count() == 0 || (batch.isLast && last == batch.rows().size());
}

void StoreWriter::followDurableExtent(std::function<void(const DurableExtent&)> follower) {
  MutexLock lock(following_);
  extentFollower_ = std::move(follower);
  if (extentFollower_) extentFollower_(extent_);
}

void StoreWriter::attendMedium() {
  takeSafe();
  // An erasure moves the log itself.
  if (!database_ || database_->isUnderWay() || !erasures_.empty()) return;
  if (!database_->beginCheckpointIfDue()) {
    const Instant now = steady_clock::now();
    const bool isDue = !flushes_.empty() || (unsyncedSince_ && now >= *unsyncedSince_ + syncAfter_);
    if (!isDue || now < syncNotBefore_) return;
    database_->beginSync();
  }
  coveredSince_ = std::exchange(unsyncedSince_, std::nullopt);
  coveredFlushes_ = std::exchange(flushes_, {});
  takeSafe();
}

void StoreWriter::takeSafe() {
  const auto safe = database_ ? database_->takeSafe() : std::nullopt;
  if (!safe) return;
  if (safe->all) {
    if (std::exchange(syncBackOff_, std::chrono::milliseconds{0}).count() > 0) succeeded();
    return isSafe(safe->ids);
  }
  uncover();
  if (!safe->syncFailed) return;
  syncBackOff_ = std::clamp(syncBackOff_ * 2, options_.firstBackOff, kLongestBackOff);
  syncNotBefore_ = steady_clock::now() + syncBackOff_;
  failed(databaseError());
}

/// What was under way has made nothing safe.
void StoreWriter::uncover() {
  if (coveredSince_) unsyncedSince_ = std::exchange(coveredSince_, std::nullopt);
  std::swap(flushes_, coveredFlushes_);
  std::ranges::move(coveredFlushes_, std::back_inserter(flushes_));
  coveredFlushes_.clear();
}

void StoreWriter::settle() {
  if (!database_) return;
  database_->awaitMedium();
  takeSafe();
}

void StoreWriter::isSafe(const StoreIDs& ids) {
  coveredSince_.reset();
  completeFlushes(coveredFlushes_, std::nullopt);
  MutexLock lock(following_);
  DurableExtent extent{database_->storeID(), ids};
  if (extent == extent_) return;
  extent_ = std::move(extent);
  if (extentFollower_) extentFollower_(extent_);
}

void StoreWriter::allIsSafe() {
  unsyncedSince_.reset();
  completeFlushes(flushes_, std::nullopt);
  isSafe(database_->lastIDs());
}

void StoreWriter::completeFlushes(std::vector<Flush>& flushes, const std::optional<Error>& error) {
  for (const Flush& completion : std::exchange(flushes, {})) completion(error);
}

void StoreWriter::complete(const StoreBatch& batch, std::size_t first, std::size_t last,
                           const std::optional<Error>& error) {
  for (std::size_t i = first; i < last; ++i) {
    const StoreRow& row = batch.rows()[i];
    const auto* completion = StoreBatch::completion(row);
    const bool waitsForSync = !error && unsyncedSince_ && std::holds_alternative<FlushRow>(row);
    if (waitsForSync) {
      flushes_.push_back(*completion);
    } else if (completion != nullptr) {
      (*completion)(error);
    }
    const auto* erasure = std::get_if<ErasureRow>(&row);
    if (erasure != nullptr && error) erasure->completion(*error);
    if (erasure != nullptr && !error) erasures_.push_back({*erasure, database_->lastIDs()});
  }
}

void StoreWriter::erase() {
  ZQ_FUNCTION("StoreWriter::erase");
  if (erasures_.empty()) return;
  settle();
  if (!database_ && !reopen(false)) return endErasure(failure_);
  if (!erasure_) {
    erasure_ = database_->erasure(erasures_.front().wanted.selection, erasures_.front().through,
                                  options_.clock());
  }
  const auto progress = erasure_->step();
  queue_.droppedFromStore(StoreDrop::erased, erasure_->takeCounted());
  if (!unsyncedSince_) unsyncedSince_ = steady_clock::now();
  switch (progress) {
    case Erasure::Progress::more:
      return;
    case Erasure::Progress::failed:
      failed(databaseError());
      if (erasure_) endErasure(failure_);
      return;
    case Erasure::Progress::done:
      break;
  }
  const std::int64_t rows = erasure_->rows();
  ZQ_LOG(nullptr, standard, "{} rows were erased ({}).{}", rows,
         erasures_.front().wanted.selection.description(),
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

void StoreWriter::lose(const StoreBatch& batch, std::size_t first) {
  gaveUp_ = true;
  StoreQueue::Tally tally;
  for (std::size_t i = first; i < batch.rows().size(); ++i) tally.add(batch.rows()[i]);
  queue_.lost(tally);
  complete(batch, first, batch.rows().size(), failure_);
}

void StoreWriter::syncHere() {
  settle();
  if (!database_) return;
  if (database_->sync()) {
    succeeded();
    return allIsSafe();
  }
  failed(databaseError());
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

bool StoreWriter::retain(std::uint64_t incomingBytes,
                         const std::optional<Retention::Expiry>& expired) {
  if (!database_) return false;
  const auto progress = database_->retention().step(incomingBytes, expired);
  if (progress == Retention::Progress::failed) failed(databaseError());
  if (!database_) return false;
  const auto removed = database_->retention().takeRemoved();
  if (removed.rows > 0) {
    queue_.droppedFromStore(StoreDrop::retention, removed.rows);
    removedNotExported_ += removed.notExported;
    if (removedNotExported_ > 0) reportRemoved(removedLine_.due());
    if (!unsyncedSince_) unsyncedSince_ = steady_clock::now();
  }
  return progress == Retention::Progress::more;
}

void StoreWriter::putBackIfTakenAway() {
  ZQ_FUNCTION("StoreWriter::putBackIfTakenAway");
  if (!database_ || !database_->wasTakenAway()) return;
  const Outcome back = database_->putBack(options_.database.path, options_.clock());
  if (!back) {
    // Its rows are in memory of nobody but this file: it stays open, and rows go on into it.
    return failed(back.error());
  }
  ZQ_LOG(nullptr, error, "The telemetry store {} was taken away: all that was in it is put back.",
         options_.database.path.string());
  close();
  if (reopen(false)) succeeded();
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
  failing_ = true;
  setProblem(failure_.description());
  if (failureLine_.due()) {
    ZQ_LOG(nullptr, error, "The telemetry store {} fails: {}. Trying again; {} rows wait.",
           options_.database.path.string(), failure_.description(), queue_.counters().waiting);
  }
  if (!database_ || database_->fault() != SqliteFault::corrupt) return;
  endErasure(failure_);
  close();
  isSuspect_ = true;
}

void StoreWriter::succeeded() {
  ZQ_FUNCTION("StoreWriter::succeeded");
  if (!std::exchange(failing_, false)) return;
  setProblem(std::nullopt);
  ZQ_LOG(nullptr, standard, "The telemetry store {} takes rows again.",
         options_.database.path.string());
}

void StoreWriter::setProblem(std::optional<std::string> problem) {
  MutexLock lock(problemMutex_);
  problem_ = std::move(problem);
}

std::optional<std::string> StoreWriter::problem() const {
  MutexLock lock(problemMutex_);
  return problem_;
}

void StoreWriter::close() {
  erasure_.reset();
  if (database_) knownIDs_ = database_->lastIDs();
  database_.reset();
  uncover();
  unsyncedSince_.reset();
}

void StoreWriter::adopt(std::unique_ptr<StoreDatabase> database) {
  database_ = std::move(database);
  database_->onMediumsAnswer([this] { queue_.call(); });
  if (!lastEarlierSession_) lastEarlierSession_ = database_->lastIDs()[StoreTable::agentSession];
  queue_.restart(database_->storedAtOpening(), database_->dropsAtOpening());
}

bool StoreWriter::reopen(bool isSuspect) {
  StoreDatabase::Options options = options_.database;
  options.knownIDs = knownIDs_;
  options.knownDrops = queue_.counters().dropped;
  auto database = StoreDatabase::open(options, options_.clock(), isSuspect);
  if (!database) {
    failure_ = database.error();
    return false;
  }
  adopt(std::move(database.value()));
  database_->placeProvisionalSessions(*lastEarlierSession_);
  return true;
}

void StoreWriter::finish() {
  ZQ_FUNCTION("StoreWriter::finish");
  while (!erasures_.empty()) {
    endErasure(StoreError(StoreErrorCode::closed, "The store was closed before all was erased."));
  }
  const StoreDrops drops = queue_.counters().dropped;
  settle();
  watchClock(options_.clock());
  if (database_ && !gaveUp_) {
    if (database_->write({}, 0, 0, StoreDatabase::Safety::full, options_.clock(), drops)) {
      allIsSafe();
    } else {
      failed(databaseError());
    }
  }
  if (unsyncedSince_ || !flushes_.empty()) syncHere();
  completeFlushes(flushes_, failure_);
  putBackIfTakenAway();
  if (const std::uint64_t lost = drops[StoreDrop::storeClosed]; lost > 0) {
    ZQ_LOG(nullptr, error, "The telemetry store {} was closed while it took no rows: {} are lost.",
           options_.database.path.string(), lost);
  }
  reportRemoved(true);
  close();
}

}  // namespace quarvel
