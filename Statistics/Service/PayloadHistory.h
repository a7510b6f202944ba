#pragma once

#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <variant>

#include "base/Mutex.h"
#include "base/Payload.h"
#include "base/Value.h"

namespace quarvel {

/// What names a message within its session: its codes, and how many with their names came before
/// it and with it.
struct MessageIdentity {
  std::uint64_t number;
  std::uint32_t category;
  std::uint16_t type;

  /// "category_type_n"
  [[nodiscard]] std::string text() const;
};

/// Everything one run of a session carried, in order, under a lock of its own: messages with their
/// enriched payloads, whose blocks it shares, orientation entries, and in front the user
/// information once a summary was made. A message costs 32 bytes beside its payload's block.
class PayloadHistory {
 public:
  void append(const MessageIdentity& identity, Payload payload) {
    const MutexLock lock(mutex_);
    entries().emplace_back(SentMessage{identity, std::move(payload)});
  }
  void append(Dictionary dictionary) {
    const MutexLock lock(mutex_);
    entries().emplace_back(std::make_unique<const Dictionary>(std::move(dictionary)));
  }
  void insertAtFront(Dictionary dictionary) {
    const MutexLock lock(mutex_);
    entries().emplace_front(std::make_unique<const Dictionary>(std::move(dictionary)));
  }
  [[nodiscard]] bool empty() const {
    const MutexLock lock(mutex_);
    return !entries_;
  }
  /// Calls `visitMessage(identity, payload)` or `visitDictionary(dictionary)` with each entry in
  /// order, under the lock: short work only.
  template <class VisitMessage, class VisitDictionary>
  void forEach(VisitMessage&& visitMessage, VisitDictionary&& visitDictionary) const {
    const MutexLock lock(mutex_);
    if (!entries_) return;
    for (const Entry& entry : *entries_) {
      if (const auto* message = std::get_if<SentMessage>(&entry)) {
        visitMessage(message->identity, message->payload);
      } else {
        visitDictionary(*std::get<std::unique_ptr<const Dictionary>>(entry));
      }
    }
  }

 private:
  struct SentMessage {
    MessageIdentity identity;
    Payload payload;
  };
  using Entry = std::variant<SentMessage, std::unique_ptr<const Dictionary>>;
  static_assert(sizeof(Entry) <= 32);

  std::deque<Entry>& entries() QUARVEL_REQUIRES(mutex_) {
    if (!entries_) entries_.emplace();
    return *entries_;
  }

  mutable Mutex mutex_;
  /// Made with the first entry: an empty one costs half a kilobyte, and there may be many sessions.
  std::optional<std::deque<Entry>> entries_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
