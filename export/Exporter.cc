#include "export/Exporter.h"

#include <fmt/format.h>

#include <algorithm>
#include <random>
#include <utility>

#include "base/Utf8.h"
#include "platform/Log.h"

namespace quarvel {

namespace {

using std::chrono::milliseconds;

/// A backlog is drained in this many batches a second, so that draining is smooth.
constexpr std::uint32_t kBatchesPerSecond = 4;
constexpr std::size_t kReasonBytes = 500;  // of a ledger line's reason

Date SystemDate() {
  return std::chrono::floor<std::chrono::microseconds>(std::chrono::system_clock::now());
}

std::function<double()> Generator() {
  return [engine = std::minstd_rand(std::random_device{}())]() mutable {
    return std::uniform_real_distribution<double>(0, 1)(engine);
  };
}

std::string Shorten(const std::string& text) {
  if (text.size() <= kReasonBytes) return text;
  return std::string(Utf8Prefix(text, kReasonBytes)) + "…";
}

ExportRecord::Line LineOf(const ExportBatch& batch, std::size_t first, std::size_t last,
                          std::string outcome) {
  ExportRecord::Line line{batch.rows[first].id, batch.rows[last - 1].id,
                          static_cast<std::int64_t>(last - first), 0, std::move(outcome)};
  for (std::size_t i = first; i < last; ++i) {
    line.bytes += static_cast<std::int64_t>(batch.rows[i].bytes);
  }
  return line;
}

std::string OutcomeOf(const Delivery& delivery) {
  if (delivery.droppedByEngine == 0) return "acknowledged";
  return fmt::format("partly refused: {} of {}: {}", delivery.droppedByEngine, delivery.taken,
                     Shorten(delivery.reason));
}

}  // namespace

Exporter::Exporter(Options options, ExportSource& source, ExportEngine& engine)
    : options_([&options] {
        if (!options.clock) options.clock = SystemDate;
        if (!options.monotonicClock) options.monotonicClock = std::chrono::steady_clock::now;
        if (!options.random) options.random = Generator();
        return std::move(options);
      }()),
      source_(source),
      engine_(engine) {
  status_.backend = options_.backend;
}

Exporter::Next Exporter::step(const DurableExtent& extent) {
  const Instant now = options_.monotonicClock();
  if (now < notBefore_) return {notBefore_, false};
  if (storeID_.empty() || !source_.isCurrent()) {
    if (const Outcome found = findPosition(); !found) {
      return backOff(found.error().description(), std::nullopt);
    }
  }
  if (storeID_ != extent.storeID || !hasRows(extent)) return idle();
  if (idle_ && !gathering_ && options_.gather.count() > 0) {
    gathering_ = true;
    notBefore_ = now + options_.gather;
    return {notBefore_, false};
  }
  gathering_ = false;
  return exportBatch(extent);
}

Outcome Exporter::findPosition() {
  storeID_.clear();
  auto position = source_.position();
  if (!position) return position.error();
  storeID_ = std::move(position.value().storeID);
  exportedThrough_ = position.value().exportedThrough;
  const MutexLock lock(mutex_);
  status_.exportedThrough = exportedThrough_;
  status_.acknowledgedAt = position.value().acknowledgedAt;
  return Success();
}

bool Exporter::hasRows(const DurableExtent& extent) const {
  return std::ranges::any_of(kAllStoreTables, [&](StoreTable table) {
    return exportedThrough_[table] < extent.lastIDs[table];
  });
}

Exporter::Next Exporter::idle() {
  const Instant now = options_.monotonicClock();
  if (!std::exchange(idle_, true)) disconnectAt_ = now + kDisconnectAfter;
  if (disconnectAt_ && now >= *disconnectAt_) {
    engine_.disconnect();
    disconnectAt_.reset();
  }
  return {disconnectAt_, true};
}

Exporter::Next Exporter::exportBatch(const DurableExtent& extent) {
  const std::size_t share = std::max(options_.rowsPerSecond / kBatchesPerSecond, 1U);
  // Sessions come before the messages that refer to them.
  for (const StoreTable table : kAllStoreTables) {
    if (exportedThrough_[table] >= extent.lastIDs[table]) continue;
    auto batch = source_.read(table, {exportedThrough_[table], extent.lastIDs[table],
                                      std::min(batchRows_, share), kBatchBytes});
    if (!batch) return backOff(batch.error().description(), std::nullopt);
    if (batch.value().rows.empty()) {  // they have been removed
      exportedThrough_[table] = extent.lastIDs[table];
      continue;
    }
    idle_ = false;
    notBefore_ = options_.monotonicClock() + milliseconds(batch.value().rows.size() * 1000 /
                                                          std::max(options_.rowsPerSecond, 1U));
    return conclude(batch.value(), engine_.deliver(batch.value()));
  }
  return idle();
}

Exporter::Next Exporter::conclude(const ExportBatch& batch, const Delivery& delivery) {
  if (delivery.taken > 0) refusalsInARow_ = 0;
  const std::size_t aside = setAside(delivery);
  if (delivery.taken + aside > 0) {
    if (const Outcome recorded = record(batch, delivery, aside); !recorded) {
      storeID_.clear();  // the cursor has to be read again
      if (source_.isStopped()) return {notBefore_, false};
      return backOff(recorded.error().description(), std::nullopt);
    }
  }
  switch (delivery.remainder) {
    case Delivery::Remainder::none:
      noteSuccess();
      break;
    case Delivery::Remainder::again:
      if (delivery.taken > 0) backOff_ = kFirstBackOff;
      return backOff(delivery.reason, delivery.after);
    case Delivery::Remainder::refused:
      if (refusalsInARow_ >= kRefusalsInARow) {
        return backOff(delivery.reason, delivery.after);
      }
      break;
    case Delivery::Remainder::stopped:
      break;
  }
  return {notBefore_, false};
}

std::size_t Exporter::setAside(const Delivery& delivery) {
  ZQ_FUNCTION("Exporter::setAside");
  if (delivery.remainder != Delivery::Remainder::refused) return 0;
  if (delivery.refused > 1 && refusalsInARow_ < kRefusalsInARow) {
    batchRows_ = delivery.refused / 2;
    return 0;
  }
  ++refusalsInARow_;
  ZQ_LOG(nullptr, error, "The backend {} will never take {} rows, which stay in the store: {}.",
         options_.backend, delivery.refused, delivery.reason);
  return delivery.refused;
}

Outcome Exporter::record(const ExportBatch& batch, const Delivery& delivery, std::size_t setAside) {
  const std::size_t end = delivery.taken + setAside;
  ExportRecord record{options_.backend, batch.storeID, batch.table, batch.rows[end - 1].id, {}};
  if (delivery.taken > 0) {
    record.lines.push_back(LineOf(batch, 0, delivery.taken, OutcomeOf(delivery)));
  }
  if (setAside > 0) {
    record.lines.push_back(
        LineOf(batch, delivery.taken, end, "refused: " + Shorten(delivery.reason)));
  }
  const std::int64_t lastID = record.lastID;
  Outcome recorded = source_.record(std::move(record));
  if (!recorded) return recorded;
  exportedThrough_[batch.table] = lastID;
  const MutexLock lock(mutex_);
  status_.exportedThrough = exportedThrough_;
  status_.exportedRows += delivery.taken - delivery.droppedByEngine;
  status_.refusedRows += setAside + delivery.droppedByEngine;
  if (delivery.taken > 0) status_.acknowledgedAt = options_.clock();
  return recorded;
}

Exporter::Next Exporter::backOff(std::string reason, std::optional<std::chrono::seconds> askedFor) {
  ZQ_FUNCTION("Exporter::backOff");
  // Jitter between half and the whole: a fleet that lost its engine at one moment must not return
  // to it at one moment.
  milliseconds delay(static_cast<std::int64_t>(static_cast<double>(backOff_.count()) *
                                               (1 + options_.random()) / 2));
  backOff_ = std::min<milliseconds>(backOff_ * 2, kLongestBackOff);
  if (askedFor)
    delay = std::max<milliseconds>(delay, std::min<milliseconds>(*askedFor, kLongestAskedFor));
  notBefore_ = std::max(notBefore_, options_.monotonicClock() + delay);
  const MutexLock lock(mutex_);
  if (status_.error != reason) {
    ZQ_LOG(nullptr, error, "The backend {} takes no rows: {}. It is tried again, first in {} ms.",
           options_.backend, reason, delay.count());
  }
  status_.error = std::move(reason);
  status_.nextAttempt = options_.clock() + delay;
  return {notBefore_, false};
}

void Exporter::noteSuccess() {
  ZQ_FUNCTION("Exporter::noteSuccess");
  backOff_ = kFirstBackOff;
  batchRows_ = std::min(batchRows_ * 2, kBatchRows);
  const MutexLock lock(mutex_);
  if (status_.error) {
    ZQ_LOG(nullptr, standard, "The backend {} takes rows again.", options_.backend);
  }
  status_.error.reset();
  status_.nextAttempt.reset();
}

ExportStatus Exporter::status() const {
  const MutexLock lock(mutex_);
  return status_;
}

}  // namespace quarvel
