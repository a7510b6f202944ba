#pragma once

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <optional>
#include <string>
#include <utility>

#include "base/Error.h"
#include "base/Mutex.h"
#include "store/StoreQueue.h"

namespace quarvel {

/// Limits a log line that would repeat to one a minute. One thread.
class MinuteLimit {
 public:
  /// Whether the line may be written now; true at most once in 60 s, and the first time.
  [[nodiscard]] bool isDue() {
    const auto now = std::chrono::steady_clock::now();
    if (last_ && now - *last_ < std::chrono::minutes{1}) return false;
    last_ = now;
    return true;
  }

 private:
  std::optional<std::chrono::steady_clock::time_point> last_;
};

/// The delays between attempts: the first one, then each twice as long up to the longest. One
/// thread.
class BackOff {
 public:
  struct Bounds {
    std::chrono::milliseconds first{50};
    std::chrono::milliseconds longest{5000};
  };
  explicit BackOff(Bounds bounds) : bounds_(bounds) {}

  /// The delay before the next attempt, which is taken to fail until `reset`.
  [[nodiscard]] std::chrono::milliseconds next() {
    delay_ = delay_.count() == 0 ? bounds_.first : std::min(delay_ * 2, bounds_.longest);
    return delay_;
  }
  /// Begins again. Returns whether there was a delay since the last reset.
  bool reset() { return std::exchange(delay_, std::chrono::milliseconds{0}).count() > 0; }

 private:
  const Bounds bounds_;
  std::chrono::milliseconds delay_{0};  // the last one; 0: none yet
};

/// Whether the store works: keeps the last failure, logs the first one of each minute and the
/// recovery. Owned by the `StoreWriter`, as long as it lives. The writer's thread, but for
/// `problem`.
class StoreHealth {
 public:
  /// `path` is the store's, for log lines. `queue` must outlive this.
  StoreHealth(std::filesystem::path path, const StoreQueue& queue)
      : path_(std::move(path)), queue_(queue) {}

  /// Sets the problem, and logs an error line unless one was logged in the last minute.
  void failed(Error error) QUARVEL_EXCLUDES(mutex_);
  /// Ends the problem and logs the recovery; nothing when there was no problem.
  void succeeded() QUARVEL_EXCLUDES(mutex_);
  /// Replaces the last failure without a log line: a retry has failed too.
  void failedAgain(Error error) { failure_ = std::move(error); }
  /// The last failure, also after a recovery. The writer's thread.
  [[nodiscard]] const Error& failure() const { return failure_; }
  /// Whether `failed` was called since the last call of this.
  [[nodiscard]] bool takeFailed() { return std::exchange(hasNewFailure_, false); }

  /// Why the store takes no rows now, or cannot make them durable; none while it works. Any thread.
  [[nodiscard]] std::optional<std::string> problem() const QUARVEL_EXCLUDES(mutex_);

 private:
  void setProblem(std::optional<std::string> problem) QUARVEL_EXCLUDES(mutex_);

  const std::filesystem::path path_;
  const StoreQueue& queue_;
  Error failure_;               // of the last attempt
  bool failing_ = false;        // since `failed`, until `succeeded`
  bool hasNewFailure_ = false;  // since `takeFailed`
  MinuteLimit line_;            // of the error line

  mutable Mutex mutex_;
  std::optional<std::string> problem_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
