#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <string>

namespace quarvel {

/// The tables that rows come into, all keyed by `id`.
enum class StoreTable : std::uint8_t { agentSession, message, analyticsEvent, powerEvent };

inline constexpr std::array kAllStoreTables{StoreTable::agentSession, StoreTable::message,
                                            StoreTable::analyticsEvent, StoreTable::powerEvent};
/// Those whose rows are counted from acceptance to storage.
inline constexpr std::array kCountedStoreTables{StoreTable::message, StoreTable::analyticsEvent,
                                                StoreTable::powerEvent};

/// One `T` for each table.
template <class T>
class PerStoreTable {
 public:
  constexpr T& operator[](StoreTable table) { return each_[static_cast<std::size_t>(table)]; }
  const T& operator[](StoreTable table) const { return each_[static_cast<std::size_t>(table)]; }
  bool operator==(const PerStoreTable&) const = default;

 private:
  std::array<T, kAllStoreTables.size()> each_{};
};

[[nodiscard]] constexpr const char* StoreTableName(StoreTable table) {
  constexpr std::array kNames{"agent_session", "message", "analytics_event", "power_event"};
  return kNames[static_cast<std::size_t>(table)];
}

/// The last id given in each table. Ids are never given twice, also when the newest row is gone: a
/// row's name and the cursors of the backends rest on that. So they also count every row that ever
/// came.
using StoreIDs = PerStoreTable<std::int64_t>;

/// As far as ids go.
[[nodiscard]] constexpr StoreIDs AllStoreIDs() {
  StoreIDs ids;
  for (const StoreTable table : kAllStoreTables) {
    ids[table] = std::numeric_limits<std::int64_t>::max();
  }
  return ids;
}

/// How far a store is safe from a power cut. What lies beyond may yet be lost, and its ids given to
/// other rows.
struct DurableExtent {
  std::string storeID;
  StoreIDs lastIDs;

  bool operator==(const DurableExtent&) const = default;
};

/// From here on are the ids of agent sessions that were added while nobody knew which ids the file
/// has given; they are placed behind those when it is opened.
inline constexpr std::int64_t kProvisionalSessions = std::int64_t{1} << 62;

/// The key in `meta` under which a table's last id is kept once rows of it have been removed.
[[nodiscard]] inline std::string LastIDKey(StoreTable table) {
  return std::string("last_id.") + StoreTableName(table);
}

}  // namespace quarvel
