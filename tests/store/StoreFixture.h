#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "base/Value.h"
#include "store/TelemetryStore.h"
#include "tests/TemporaryDirectory.h"

namespace quarvel::testing {

/// Waits until it is so.
template <class Condition>
void Await(Condition condition) {
  while (!condition()) std::this_thread::sleep_for(std::chrono::microseconds(100));
}

/// A directory of its own for each test, and what its store holds, as another program reads it.
class StoreFixture : public ::testing::Test {
 protected:
  /// `memory`: on a medium that costs nothing, when there is one.
  explicit StoreFixture(bool memory = false);
  ~StoreFixture() override;

  /// Files by name.
  using Files = std::map<std::string, std::string>;
  /// Has these files in the directory and nothing else.
  void put(const Files& files) const;
  [[nodiscard]] Files files() const;

  [[nodiscard]] std::unique_ptr<TelemetryStore> open(TelemetryStore::Options options = {}) const;
  /// The rows of a query, columns joined by "|" and NULL as "-".
  [[nodiscard]] std::vector<std::string> rows(const std::string& query) const;
  [[nodiscard]] std::string value(const std::string& query) const;
  void execute(const std::string& statements) const;

  /// A message of no agent session.
  static Outcome send(TelemetryStore& store, const Payload& payload);
  static void awaitStored(const TelemetryStore& store) {
    Await([&store] { return store.counters().waiting == 0; });
  }
  static std::int64_t addSession(TelemetryStore& store, std::int64_t sessionID = 1,
                                 const Payload& userInfo = {});
  /// Begins to flush an agent session; what comes of it.
  static std::future<std::optional<Error>> flush(TelemetryStore& store, std::int64_t session);

 private:
  const TemporaryDirectory made_;

 protected:
  const std::filesystem::path directory_ = made_.path();
  const std::filesystem::path path_ = directory_ / "telemetry.db";
};

}  // namespace quarvel::testing
