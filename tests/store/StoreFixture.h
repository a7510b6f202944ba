#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <future>
#include <map>
#include <stdexcept>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "base/Value.h"
#include "store/TelemetryStore.h"
#include "tests/TemporaryDirectory.h"

namespace quarvel::testing {

/// The longest wait of a test.
inline constexpr std::chrono::seconds kNever{60};

/// Waits for a condition.
template <class Condition>
void Await(Condition condition) {
  const auto never = std::chrono::steady_clock::now() + kNever;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > never) {
      ADD_FAILURE() << "waited in vain";
      throw std::runtime_error("the test cannot go on");
    }
    std::this_thread::sleep_for(std::chrono::microseconds(100));
  }
}
/// Waits for the value of a future.
template <class Future>
auto Get(Future&& future) {
  Await(
      [&future] { return future.wait_for(std::chrono::seconds(0)) == std::future_status::ready; });
  return future.get();
}

/// Whether the harnesses run for as long as a night allows.
inline bool IsNightly() {
  const char* nightly = std::getenv("QUARVEL_NIGHTLY");
  return nightly != nullptr && std::string_view(nightly) == "1";
}

/// A directory of its own for each test, and the content of its store, read as another program
/// does.
class StoreFixture : public ::testing::Test {
 protected:
  /// `memory`: in memory, where the system has a file system for that.
  explicit StoreFixture(bool memory = false);
  ~StoreFixture() override;

  /// Files by name.
  using Files = std::map<std::string, std::string>;
  /// Makes these the only files in the directory.
  void put(const Files& files) const;
  [[nodiscard]] Files files() const;

  [[nodiscard]] std::unique_ptr<TelemetryStore> open(TelemetryStore::Options options = {}) const;
  /// The rows of a query, columns joined by "|" and NULL as "-".
  [[nodiscard]] std::vector<std::string> rows(const std::string& query) const;
  [[nodiscard]] std::string value(const std::string& query) const;
  [[nodiscard]] std::string storeID() const {
    return value("SELECT value FROM meta WHERE key = 'store_id'");
  }
  void execute(const std::string& statements) const { (void)rows(statements); }

  /// A message of no agent session.
  static Outcome send(TelemetryStore& store, const Payload& payload);
  static void awaitStored(const TelemetryStore& store) {
    Await([&store] { return store.counters().waiting == 0; });
  }
  static std::int64_t addSession(TelemetryStore& store, std::int64_t sessionID = 1,
                                 const Payload& userInfo = {});
  /// Begins to flush an agent session.
  static std::future<std::optional<Error>> flush(TelemetryStore& store, std::int64_t session);

 private:
  const TemporaryDirectory made_;

 protected:
  const std::filesystem::path directory_ = made_.path();
  const std::filesystem::path path_ = directory_ / "telemetry.db";
};

}  // namespace quarvel::testing
