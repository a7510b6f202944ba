#pragma once

#include <atomic>
#include <functional>

#include "export/Exporter.h"
#include "tests/store/StoreFixture.h"

namespace quarvel::testing {

/// Records the names of the rows that it takes, and answers each batch with `answer`.
class RecordingEngine : public ExportEngine {
 public:
  static Delivery takeAll(const ExportBatch& batch) { return {.taken = batch.rows.size()}; }
  static Delivery down(const ExportBatch&) {
    return {.remainder = Delivery::Remainder::again, .reason = "no answer"};
  }

  Delivery deliver(const ExportBatch& batch) override {
    ++deliveries;
    const Delivery delivery = answer(batch);
    for (std::size_t i = 0; i < delivery.taken; ++i) taken.push_back(batch.nameOf(batch.rows[i]));
    return delivery;
  }
  void disconnect() override { ++disconnects; }
  void stop() override {}
  void resume() override {}

  std::function<Delivery(const ExportBatch&)> answer = takeAll;
  std::vector<std::string> taken;
  int deliveries = 0;
  int disconnects = 0;
};

/// A store with one remote backend, and an exporter in virtual time.
class ExportFixture : public StoreFixture {
 protected:
  using Instant = Exporter::Instant;
  using Duration = Instant::duration;

  void begin(TelemetryStore::Options options = {}, std::uint32_t rowsPerSecond = 1'000'000,
             std::chrono::seconds gather = {}) {
    exporter_.reset();
    source_.reset();
    options.sync = {};
    options.remoteBackends = {"engine"};
    options.clock = [this] { return date(); };
    store_ = open(options);
    source_.emplace(*store_, path_, "engine");
    exporter_.emplace(Exporter::Options{"engine", rowsPerSecond, gather, [this] { return date(); },
                                        [this] { return now_; }, [this] { return jitter_; }},
                      *source_, engine_);
    next_ = {now_, false};
    Await([this] { return !extent().storeID.empty(); });
  }
  void addMessages(int count, const Payload& payload = Payload(Dictionary{{"n", 1}})) {
    for (int i = 0; i < count; ++i) ASSERT_TRUE(send(*store_, payload));
    awaitStored(*store_);
    extended_ = true;
  }
  DurableExtent extent() {
    DurableExtent extent;
    store_->followDurableExtent([&extent](const DurableExtent& safe) { extent = safe; });
    store_->followDurableExtent({});
    return extent;
  }
  /// Runs the exporter's steps that are due within `duration`; returns the number of wake-ups.
  int runFor(Duration duration) {
    const Instant end = now_ + duration;
    for (int wakeUps = 0;; ++wakeUps) {
      if (next_.uponRows && extended_) next_.at = now_;
      const bool isDue = next_.at && *next_.at <= end;
      const Duration passed = std::max(isDue ? *next_.at : end, now_) - now_;
      now_ += passed;
      date_ = date() + std::chrono::duration_cast<Date::duration>(passed);
      if (!isDue) return wakeUps;
      extended_ = false;
      next_ = exporter_->step(extent());
    }
  }
  std::vector<std::string> names(int first, int last, const std::string& table = "message") const {
    const std::string stem = storeID() + "-" + table;
    std::vector<std::string> names;
    for (int id = first; id <= last; ++id) names.push_back(stem + "-" + std::to_string(id));
    return names;
  }
  std::vector<std::string> ledger() const {
    return rows(
        "SELECT backend, table_name, first_id, last_id, rows, outcome FROM export_log ORDER BY id");
  }

  [[nodiscard]] Date date() const { return date_; }

  RecordingEngine engine_;
  std::unique_ptr<TelemetryStore> store_;
  std::optional<ExportSource> source_;
  std::optional<Exporter> exporter_;
  Instant now_{std::chrono::hours(1)};
  double jitter_ = 1;

 private:
  // The store's writer reads it too.
  std::atomic<Date> date_{Date(std::chrono::seconds(1'700'000'000))};
  Exporter::Next next_;
  bool extended_ = false;
};

}  // namespace quarvel::testing
