#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <numeric>
#include <string>

namespace quarvel {

/// Why a message or event is not in the store.
enum class StoreDrop : std::uint8_t {
  // Before it reached the store. Counts since the store was made.
  noAgentSession,
  testServiceType,
  noSuchSession,
  serviceEnded,  // it was still on its way to the store
  // After it had been stored. Counts since the store was made.
  retention,
  erased,
  damaged,  // the file was corrupt, and the row could not be read from it
  // The store took no more. Counts since it was opened, there being no place to keep them.
  refused,      // its sender got an error
  storeClosed,  // it waited for a disk that had no room to the end
};

inline constexpr std::size_t kStoreDrops = 9;

/// The name of a reason in the status and, as `dropped.<name>`, in `meta`.
[[nodiscard]] constexpr const char* StoreDropName(StoreDrop reason) {
  constexpr std::array<const char*, kStoreDrops> kNames{
      "no_agent_session", "test",    "no_such_session", "service_ended", "retention",
      "erased",           "damaged", "refused",         "store_closed"};
  return kNames[static_cast<std::size_t>(reason)];
}
[[nodiscard]] inline std::string StoreDropKey(StoreDrop reason) {
  return std::string("dropped.") + StoreDropName(reason);
}

/// Those that the writer keeps in `meta`, with its next commit.
inline constexpr std::array kDropsBeforeStore{StoreDrop::noAgentSession, StoreDrop::testServiceType,
                                              StoreDrop::noSuchSession, StoreDrop::serviceEnded};
/// Those that whoever takes rows out of the store keeps in `meta`, in the same transaction.
inline constexpr std::array kDropsFromStore{StoreDrop::retention, StoreDrop::erased,
                                            StoreDrop::damaged};

class StoreDrops {
 public:
  std::uint64_t& operator[](StoreDrop reason) { return each_[static_cast<std::size_t>(reason)]; }
  std::uint64_t operator[](StoreDrop reason) const {
    return each_[static_cast<std::size_t>(reason)];
  }
  [[nodiscard]] std::uint64_t sum() const {
    return std::accumulate(each_.begin(), each_.end(), std::uint64_t{0});
  }
  bool operator==(const StoreDrops&) const = default;

 private:
  std::array<std::uint64_t, kStoreDrops> each_{};
};

/// What has become of the messages and events that the service accepted, since the store was made.
/// accepted = stored + waiting + dropped.
struct StoreCounters {
  std::uint64_t accepted = 0;
  std::uint64_t stored = 0;   // in the database now
  std::uint64_t waiting = 0;  // in the store's queue, or on their way to it
  StoreDrops dropped;

  bool operator==(const StoreCounters&) const = default;
};

}  // namespace quarvel
