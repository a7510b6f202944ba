#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <vector>

#include "base/Value.h"
#include "platform/linux/store/TelemetryStore.h"

namespace quarvel::testing {

/// A directory of its own for each test, and what its store holds, as another program reads it.
class StoreFixture : public ::testing::Test {
 protected:
  /// `memory`: on a medium that costs nothing, when there is one.
  explicit StoreFixture(bool memory = false);
  ~StoreFixture() override;

  [[nodiscard]] std::unique_ptr<TelemetryStore> open(TelemetryStore::Options options = {}) const;
  /// The rows of a query, columns joined by "|" and NULL as "-".
  [[nodiscard]] std::vector<std::string> rows(const std::string& query) const;
  [[nodiscard]] std::string value(const std::string& query) const;
  void execute(const std::string& statements) const;

  const std::filesystem::path directory_;
  const std::filesystem::path path_ = directory_ / "telemetry.db";
};

/// Waits until it is so.
template <class Condition>
void Await(Condition condition) {
  while (!condition()) std::this_thread::sleep_for(std::chrono::microseconds(100));
}

}  // namespace quarvel::testing
