#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <numeric>
#include <string>

namespace quarvel {

/// Why an accepted message or event is not in the store. The status and the platform's counters use
/// the same reasons.
enum class StoreDrop : std::uint8_t {
  // Before the row reached the store. Counted since the store was made.
  noAgentSession,   // the row's session found no backend
  testServiceType,  // messages of the service type "test" are not sent
  noSuchSession,    // the message named a session that does not exist
  serviceEnded,     // the row had not reached the store when the service ended
  // After the row was stored. Counted since the store was made.
  retention,  // older than the store keeps rows, or beyond its size
  erased,     // by an erasure
  damaged,    // the file was corrupt, and the row could not be read from it
  // Refused by the store. Counted since the opening: no file could take the count.
  refused,      // the sender got an error
  storeClosed,  // the disk was full until the store was closed
};

/// The number of reasons.
inline constexpr std::size_t kStoreDrops = 9;

/// The name of a reason in the status and, as `dropped.<name>`, in the table `meta`.
[[nodiscard]] constexpr const char* StoreDropName(StoreDrop reason) {
  constexpr std::array<const char*, kStoreDrops> kNames{
      "no_agent_session", "test",    "no_such_session", "service_ended", "retention",
      "erased",           "damaged", "refused",         "store_closed"};
  return kNames[static_cast<std::size_t>(reason)];
}
/// The key of a reason in `meta`.
[[nodiscard]] inline std::string StoreDropKey(StoreDrop reason) {
  return std::string("dropped.") + StoreDropName(reason);
}

/// Written to `meta` by the store's writer with its next commit.
inline constexpr std::array kDropsBeforeStore{StoreDrop::noAgentSession, StoreDrop::testServiceType,
                                              StoreDrop::noSuchSession, StoreDrop::serviceEnded};
/// Written to `meta` in the transaction that removes the rows.
inline constexpr std::array kDropsFromStore{StoreDrop::retention, StoreDrop::erased,
                                            StoreDrop::damaged};

/// A count for each reason. A plain value.
class StoreDrops {
 public:
  /// The rows dropped for one reason.
  std::uint64_t& operator[](StoreDrop reason) { return each_[static_cast<std::size_t>(reason)]; }
  std::uint64_t operator[](StoreDrop reason) const {
    return each_[static_cast<std::size_t>(reason)];
  }
  /// The rows dropped for any reason.
  [[nodiscard]] std::uint64_t sum() const {
    return std::accumulate(each_.begin(), each_.end(), std::uint64_t{0});
  }
  bool operator==(const StoreDrops&) const = default;

 private:
  std::array<std::uint64_t, kStoreDrops> each_{};  // in the order of `StoreDrop`
};

/// The messages and events that the service has accepted since the store was made. Always:
/// accepted = stored + waiting + dropped. A plain value.
struct StoreCounters {
  std::uint64_t accepted = 0;  // messages and events, since the store was made
  std::uint64_t stored = 0;    // in the database now
  std::uint64_t waiting = 0;   // in the store's queue, or accepted and not queued yet
  StoreDrops dropped;          // accepted, and lost for a known reason

  bool operator==(const StoreCounters&) const = default;
};

}  // namespace quarvel
