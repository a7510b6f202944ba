// Compares the store with bare SQLite: durable rows a second through the store's queue, from one
// and from four threads, and through a loop of SQLite inserts, 1,024 to a transaction.

#include <fmt/format.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "base/Json.h"
#include "store/TelemetryStore.h"
#include "store/database/Sqlite.h"
#include "store/database/Tables.h"

namespace quarvel {
namespace {

constexpr int kRows = 400'000;
constexpr int kRowsPerCommit = 1024;
constexpr int kRounds = 5;
constexpr int kPayload = ParameterOf(kMessageTable, "payload");

void Check(bool ok, const char* what) {
  if (ok) return;
  std::fprintf(stderr, "store-bench: %s failed\n", what);
  std::exit(1);
}

Payload SamplePayload() {
  return Payload(Dictionary{{"zqreporting_timestamp", 791558701.25},
                            {"route", "BuiltInSpeaker"},
                            {"sample_rate", 48000},
                            {"channels", 2},
                            {"io_buffer_ms", 21.333333},
                            {"overloads", 0},
                            {"interrupted", false},
                            {"client", "com.example.player"},
                            {"volume", 0.625},
                            {"codec", "aac-lc"},
                            {"bitrate", 256000},
                            {"start_latency_ms", 37}});
}

struct Cost {
  double rate;       // rows a second, from the first row to the closed, synced file
  double processor;  // microseconds of processor a row, all threads together
};

Cost Measure(const std::function<void(const std::filesystem::path&)>& work) {
  std::string name = (std::filesystem::temp_directory_path() / "store-bench-XXXXXX").string();
  Check(mkdtemp(name.data()) != nullptr, "mkdtemp");
  const auto begin = std::chrono::steady_clock::now();
  const std::clock_t processorBegin = std::clock();
  work(std::filesystem::path(name) / "telemetry.db");
  const std::chrono::duration<double> elapsed = std::chrono::steady_clock::now() - begin;
  const double processor =
      static_cast<double>(std::clock() - processorBegin) * 1e6 / CLOCKS_PER_SEC;
  std::filesystem::remove_all(name);
  return {kRows / elapsed.count(), processor / kRows};
}

void ThroughStore(const std::filesystem::path& path, const Payload& payload, int senders) {
  TelemetryStore::Options options;
  options.path = path;
  auto opened = TelemetryStore::open(std::move(options));
  Check(opened.ok(), "open");
  TelemetryStore& store = *opened.value();
  std::vector<std::thread> threads;
  for (int sender = 0; sender < senders; ++sender) {
    threads.emplace_back([&] {
      for (int i = 0; i < kRows / senders; ++i) {
        Check(store.addMessage({1, 1, "tarnwick.quarvel", "music_session", 3, 1, payload}).ok(),
              "add");
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  store.close();
  Check(store.counters().stored == kRows, "store");
}

void BareLoop(const std::filesystem::path& path, const Payload& payload) {
  // The store makes the tables; all the rest is SQLite alone.
  TelemetryStore::Options options;
  options.path = path;
  Check(TelemetryStore::open(std::move(options)).ok(), "open");
  const std::string json = JsonText(payload);
  SqliteConnection connection;
  SqliteStatement insert;
  Check(connection.open(path) && connection.execute("PRAGMA synchronous = NORMAL") &&
            connection.prepare(insert, InsertSql(kMessageTable)),
        "prepare");
  int parameter = 1;
  for (const StoreColumn& column : kMessageTable.columns) {
    if (column.kind == StoreColumn::Kind::text) {
      insert.bind(++parameter, std::string_view("music_session"));
    } else {
      insert.bind(++parameter, std::int64_t{1});
    }
  }
  for (int row = 0; row < kRows;) {
    const int last = std::min(row + kRowsPerCommit, kRows);
    Check(connection.execute("BEGIN IMMEDIATE"), "begin");
    for (; row < last; ++row) Check(insert.bind(kPayload, json).run(), "insert");
    Check(connection.execute("COMMIT"), "commit");
    if (connection.logPages() >= 1000) connection.checkpoint();  // SQLite's own habit
  }
  connection.checkpointAtClose();
}

double Median(std::vector<Cost> costs, double Cost::*figure) {
  std::ranges::sort(costs, {}, figure);
  return costs[costs.size() / 2].*figure;
}

void Run() {
  const Payload payload = SamplePayload();
  struct Way {
    const char* name;
    std::function<void(const std::filesystem::path&)> work;
    std::vector<Cost> costs;
  };
  Way ways[] = {
      {"bare loop, 1,024 rows a commit", [&](const auto& path) { BareLoop(path, payload); }, {}},
      {"store, 1 sender", [&](const auto& path) { ThroughStore(path, payload, 1); }, {}},
      {"store, 4 senders", [&](const auto& path) { ThroughStore(path, payload, 4); }, {}}};
  for (int round = 0; round < kRounds; ++round) {
    for (Way& way : ways) way.costs.push_back(Measure(way.work));
  }
  const double floor = Median(ways[0].costs, &Cost::rate);
  fmt::print("{} rows of {} bytes of JSON, medians of {} rounds\n", kRows, JsonText(payload).size(),
             kRounds);
  for (const Way& way : ways) {
    const double rate = Median(way.costs, &Cost::rate);
    fmt::print("{:<32}{:8.0f} rows/s {:6.2f} of bare {:6.2f} us processor a row\n", way.name, rate,
               rate / floor, Median(way.costs, &Cost::processor));
  }
}

}  // namespace
}  // namespace quarvel

int main() {
  quarvel::Run();
}
