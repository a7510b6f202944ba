#pragma once

#include <optional>
#include <utility>

#include "base/Mutex.h"
#include "base/Value.h"

namespace quarvel {

/// A dictionary that several queues hold on to: what one merges, the others see.
class SharedDictionary {
 public:
  SharedDictionary() = default;
  explicit SharedDictionary(Dictionary dictionary) : dictionary_(std::move(dictionary)) {}

  void merge(const Dictionary& other) {
    const MutexLock lock(mutex_);
    dictionary_.merge(other);
  }
  [[nodiscard]] Dictionary copy() const {
    const MutexLock lock(mutex_);
    return dictionary_;
  }
  /// A copy of the value under `key`; none when there is none.
  [[nodiscard]] std::optional<Value> find(const Key& key) const {
    const MutexLock lock(mutex_);
    const Value* value = dictionary_.find(key);
    return value == nullptr ? std::nullopt : std::optional(*value);
  }

 private:
  mutable Mutex mutex_;
  Dictionary dictionary_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
