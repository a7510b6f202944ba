#pragma once

#include <optional>
#include <utility>

#include "base/Mutex.h"
#include "base/Value.h"

namespace quarvel {

/// A dictionary that several queues share: each sees the others' merges. Owned through a
/// `shared_ptr` or as a member. Every operation may be called from any thread and takes its one
/// lock for the length of a copy.
class SharedDictionary {
 public:
  /// An empty dictionary.
  SharedDictionary() = default;
  /// Begins with the entries of `dictionary`.
  explicit SharedDictionary(Dictionary dictionary) : dictionary_(std::move(dictionary)) {}

  /// Adds the entries of `other`; a new value replaces an old one.
  void merge(const Dictionary& other) {
    const MutexLock lock(mutex_);
    dictionary_.merge(other);
  }
  /// All entries as of now; later merges do not show in the copy.
  [[nodiscard]] Dictionary copy() const {
    const MutexLock lock(mutex_);
    return dictionary_;
  }
  /// A copy of the value under `key`, if there is one.
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
