#include "store/StoreAgeing.h"

#include <ctime>
#include <utility>

#include "platform/Log.h"

namespace quarvel {

namespace {

using std::chrono::steady_clock;

/// A clock that drifts, or is slewed, stays far below this.
constexpr std::chrono::minutes kClockMayDrift{5};
/// Steps of a few milliseconds before a batch: it waits for well under a second.
constexpr int kStepsPerCommit = 16;

/// Goes on while the device sleeps, as the clock does; the monotonic clock stops.
std::chrono::nanoseconds SinceBoot() {
  timespec time{};
  ::clock_gettime(CLOCK_BOOTTIME, &time);
  return std::chrono::seconds{time.tv_sec} + std::chrono::nanoseconds{time.tv_nsec};
}

}  // namespace

StoreAgeing::StoreAgeing(Options options, StoreQueue& queue, StoreDurability& durability,
                         StoreHealth& health)
    : options_(std::move(options)),
      queue_(queue),
      durability_(durability),
      health_(health),
      agedAt_(steady_clock::now()),
      clockSeenAt_(SinceBoot()),
      clockSeen_(options_.clock()) {}

void StoreAgeing::checkClock(Date now) {
  ZQ_FUNCTION("StoreWriter::watchClock");
  const auto passed = SinceBoot() - clockSeenAt_;
  const auto step = (now - std::exchange(clockSeen_, now)) - passed;
  clockSeenAt_ += passed;
  if (std::chrono::abs(step) > kClockMayDrift) {
    ZQ_LOG(nullptr, standard,
           "The clock was set by {} s: no row is removed for its age until it has run on for a "
           "while, and those stored since the service started count as new.",
           std::chrono::floor<std::chrono::seconds>(step).count());
    expired_.reset();
    clockWasSet_ = true;
    clockMarkIsDue_ = true;
  }
  if (!clockMarkIsDue_ || database_ == nullptr) return;
  if (!database_->retention().markClockSet(now)) return health_.failed(database_->error());
  clockMarkIsDue_ = false;
  durability_.noteUnsynced();
}

void StoreAgeing::ageIfDue(Date now) {
  if (steady_clock::now() < agedAt_ + options_.interval) return;
  agedAt_ = steady_clock::now();
  expired_.reset();
  const bool hasRunOn = !std::exchange(clockWasSet_, clockMarkIsDue_);
  if (!hasRunOn || database_ == nullptr) return;
  expired_ = database_->retention().expiry(now, now - options_.maximumAge);
  if (!expired_) return health_.failed(database_->error());
  removing_ = true;
}

void StoreAgeing::removeStep() {
  if (!removing_ || remove(0, expired_)) return;
  removing_ = false;
  expired_.reset();
}

void StoreAgeing::makeRoom(std::uint64_t incomingBytes) {
  int steps = 0;
  while (remove(incomingBytes, std::nullopt)) {
    if (++steps < kStepsPerCommit) continue;
    removing_ = true;
    return;
  }
}

bool StoreAgeing::remove(std::uint64_t incomingBytes,
                         const std::optional<Retention::Expiry>& expired) {
  if (database_ == nullptr) return false;
  const auto progress = database_->retention().step(incomingBytes, expired);
  if (progress == Retention::Progress::failed) health_.failed(database_->error());
  const auto removed = database_->retention().takeRemoved();
  if (removed.rows > 0) {
    queue_.droppedFromStore(StoreDrop::retention, removed.rows);
    removedNotExported_ += removed.notExported;
    if (removedNotExported_ > 0 && removedLine_.isDue()) reportRemoved();
    durability_.noteUnsynced();
  }
  return progress == Retention::Progress::more;
}

void StoreAgeing::reportRemoved() {
  ZQ_FUNCTION("StoreWriter::reportRemoved");
  if (removedNotExported_ == 0) return;
  ZQ_LOG(nullptr, error,
         "The telemetry store {} is full or too old: {} rows were removed that no backend has had.",
         options_.path.string(), std::exchange(removedNotExported_, 0));
}

}  // namespace quarvel
