#pragma once

#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "base/Mutex.h"
#include "base/Payload.h"
#include "base/Value.h"

namespace quarvel {

/// A message in the history: the one-entry dictionary of its message id and its enriched payload,
/// which shares the payload's block.
struct SentMessage {
  std::string messageID;
  Payload payload;
};

/// Everything one run of a session carried, in order, under a lock of its own: messages,
/// orientation entries, and in front the user information once a summary was made.
class PayloadHistory {
 public:
  using Entry = std::variant<SentMessage, Dictionary>;

  void append(Entry entry) {
    const MutexLock lock(mutex_);
    entries_.push_back(std::move(entry));
  }
  void insertAtFront(Dictionary dictionary) {
    const MutexLock lock(mutex_);
    entries_.insert(entries_.begin(), std::move(dictionary));
  }
  [[nodiscard]] bool empty() const {
    const MutexLock lock(mutex_);
    return entries_.empty();
  }
  /// Calls `visit` with each entry in order, under the lock: short work only.
  template <class Visitor>
  void forEach(Visitor&& visit) const {
    const MutexLock lock(mutex_);
    for (const Entry& entry : entries_) visit(entry);
  }

 private:
  mutable Mutex mutex_;
  std::vector<Entry> entries_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
