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

/// Identifies a message within its session: its codes, and its number (from 1) among the messages
/// with the same names.
struct MessageIdentity {
  std::uint64_t number;    // continues over the session's runs
  std::uint32_t category;  // as the client sent it
  std::uint16_t type;

  /// "category_type_n"
  [[nodiscard]] std::string text() const;
};

/// The history of one run of a session, in order: messages with their enriched payloads,
/// orientation entries and, in front, the user information once a summary was made.
///
/// Shared by the session and by blocks that still condense it after a stop. Every operation may be
/// called from any thread; one lock guards the entries. A message costs 32 bytes beside the block
/// of its payload, which is shared.
class PayloadHistory {
 public:
  /// Adds a message with its enriched payload.
  void append(const MessageIdentity& identity, Payload payload) {
    const MutexLock lock(mutex_);
    entries().emplace_back(SentMessage{identity, std::move(payload)});
  }
  /// Adds an orientation entry.
  void append(Dictionary dictionary) {
    const MutexLock lock(mutex_);
    entries().emplace_back(std::make_unique<const Dictionary>(std::move(dictionary)));
  }
  /// Adds the user information before all other entries.
  void insertAtFront(Dictionary dictionary) {
    const MutexLock lock(mutex_);
    entries().emplace_front(std::make_unique<const Dictionary>(std::move(dictionary)));
  }
  /// Whether no entry was ever added: entries are not removed.
  [[nodiscard]] bool empty() const {
    const MutexLock lock(mutex_);
    return !entries_;
  }
  /// Calls `visitMessage(identity, payload)` or `visitDictionary(dictionary)` for each entry in
  /// order, with the lock held: visitors append to no history.
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

  /// Creates the deque on the first use.
  std::deque<Entry>& entries() QUARVEL_REQUIRES(mutex_) {
    if (!entries_) entries_.emplace();
    return *entries_;
  }

  mutable Mutex mutex_;
  /// Absent without entries: an empty deque costs half a kilobyte, and there may be many sessions.
  std::optional<std::deque<Entry>> entries_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
