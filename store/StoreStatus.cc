#include "store/StoreStatus.h"

#include <filesystem>
#include <string>
#include <system_error>
#include <utility>

#include "platform/Counters.h"
#include "store/database/StoreFile.h"

namespace quarvel {

namespace {

Value TextOrNil(std::optional<std::string> text) {
  return text ? Value(*std::move(text)) : Value();
}

Dictionary DescribeCounters(const StoreCounters& counters) {
  Dictionary dropped;
  for (std::size_t i = 0; i < kStoreDrops; ++i) {
    const auto reason = static_cast<StoreDrop>(i);
    dropped.set(StoreDropName(reason), counters.dropped[reason]);
  }
  return {{"accepted", counters.accepted},
          {"stored", counters.stored},
          {"waiting", counters.waiting},
          {"dropped", std::move(dropped)}};
}

std::uint64_t BytesOf(const std::filesystem::path& file) {
  std::error_code failure;
  const std::uintmax_t bytes = std::filesystem::file_size(file, failure);
  return failure ? 0 : bytes;
}

List SetAside(const std::filesystem::path& store) {
  List files;
  for (const auto& file : StoresSetAside(store)) files.emplace_back(file.string());
  return files;
}

Dictionary DescribeStore(const TelemetryStore& store) {
  return {{"path", store.path().string()},
          {"bytes", BytesOf(store.path())},
          {"wal_bytes", BytesOf(store.path().string() + "-wal")},
          {"rows", store.counters().stored},
          {"set_aside", SetAside(store.path())},
          {"error", TextOrNil(store.state().problem)}};
}

}  // namespace

void DescribeInStatus(Status& status, const std::shared_ptr<const TelemetryStore>& store,
                      const Gauges& gauges) {
  status.add([store, &gauges] {
    const auto now = [&gauges](Gauge gauge) {
      return gauges[static_cast<std::size_t>(gauge)].load();
    };
    const TelemetryStore::State state = store->state();
    return Dictionary{
        {"clients", now(Gauge::clients)},
        {"sessions", now(Gauge::sessions)},
        {"started_sessions", now(Gauge::startedSessions)},
        {"counters", DescribeCounters(store->counters())},
        {"store_queue", Dictionary{{"rows", state.queuedRows}, {"bytes", state.queuedBytes}}}};
  });
  status.addSection("store", [store] { return DescribeStore(*store); });
}

}  // namespace quarvel
