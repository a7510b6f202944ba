#pragma once

#include <chrono>
#include <optional>
#include <utility>
#include <vector>

#include "base/Mutex.h"

namespace quarvel {

/// Items that other threads hand to a test, in order.
template <class T>
class Collected {
 public:
  void add(T item) {
    const MutexLock lock(mutex_);
    items_.push_back(std::move(item));
    added_.notifyAll();
  }
  /// Waits for the next item; none after 30 seconds, which is far longer than any item takes.
  std::optional<T> next() {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    const MutexLock lock(mutex_);
    while (items_.empty()) {
      if (!added_.waitUntil(mutex_, deadline)) return std::nullopt;
    }
    std::optional<T> item(std::move(items_.front()));
    items_.erase(items_.begin());
    return item;
  }
  /// All items so far.
  std::vector<T> take() {
    const MutexLock lock(mutex_);
    return std::exchange(items_, {});
  }
  std::size_t size() {
    const MutexLock lock(mutex_);
    return items_.size();
  }

 private:
  Mutex mutex_;
  ConditionVariable added_;
  std::vector<T> items_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
