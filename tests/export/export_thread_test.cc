#include "export/ExportThread.h"

#include <gmock/gmock.h>

#include "export/Exporters.h"
#include "tests/device/Collected.h"
#include "tests/store/StoreFixture.h"

namespace quarvel::testing {
namespace {

using namespace std::chrono_literals;

constexpr std::int64_t kDisconnected = 0;

/// Reports the ids of the rows that it takes. While `hangs`, a delivery waits until it is stopped.
class HangingEngine : public ExportEngine {
 public:
  struct Seen {
    Collected<std::int64_t> taken, hung;  // `kDisconnected` counts as taken
    std::atomic<bool> hangs = false;
  };
  explicit HangingEngine(Seen& seen) : seen_(seen) {}

  Delivery deliver(const ExportBatch& batch) override {
    const MutexLock lock(mutex_);
    if (seen_.hangs && !stopped_) seen_.hung.add(batch.rows.front().id);
    while (seen_.hangs && !stopped_) changed_.wait(mutex_);
    if (stopped_) return {.remainder = Delivery::Remainder::stopped};
    for (const ExportRow& row : batch.rows) seen_.taken.add(row.id);
    return {.taken = batch.rows.size()};
  }
  void disconnect() override { seen_.taken.add(kDisconnected); }
  void stop() override { setStopped(true); }
  void resume() override { setStopped(false); }

 private:
  void setStopped(bool stopped) {
    const MutexLock lock(mutex_);
    stopped_ = stopped;
    changed_.notifyAll();
  }

  Seen& seen_;
  Mutex mutex_;
  ConditionVariable changed_;
  bool stopped_ QUARVEL_GUARDED_BY(mutex_) = false;
};

class ExportThreadTest : public StoreFixture {
 protected:
  void start(bool exports = true) {
    std::vector<Exporters::Backend> backends;
    backends.push_back({{"dead", 1'000'000}, std::make_unique<HangingEngine>(dead_)});
    backends.push_back({{"alive", 1'000'000}, std::make_unique<HangingEngine>(alive_)});
    exporters_.emplace(*store_, std::move(backends), exports);
  }
  void addMessage() { ASSERT_TRUE(send(*store_, Payload())); }

  std::unique_ptr<TelemetryStore> store_ = open({.sync = 0ms, .remoteBackends = {"dead", "alive"}});
  HangingEngine::Seen dead_, alive_;
  std::optional<Exporters> exporters_;
};

TEST_F(ExportThreadTest, ADeadEngineDelaysNeitherAnotherNorTheEnd) {
  dead_.hangs = true;
  start();
  for (std::int64_t id = 1; id <= 3; ++id) {
    addMessage();
    EXPECT_EQ(alive_.taken.next(), id);
  }
  EXPECT_EQ(dead_.hung.next(), 1);
  // Each row wakes it up when it is stored, and again when the cursor is.
  EXPECT_LE(exporters_->threads().back()->status().wakeUps, 10U) << "it polls";
  ExportThread& hanging = *exporters_->threads().front();
  hanging.stop();
  EXPECT_TRUE(hanging.awaitEnd(std::chrono::steady_clock::now() + 30s));
  EXPECT_EQ(value("SELECT count(*) FROM backend_cursor WHERE backend = 'dead'"), "0");
}

TEST_F(ExportThreadTest, HeldItHoldsNoRowAndReleasedItGoesOn) {
  alive_.hangs = true;
  start();
  ExportThread& thread = *exporters_->threads().back();
  addMessage();
  EXPECT_EQ(alive_.hung.next(), 1);
  thread.hold();
  thread.hold();
  alive_.hangs = false;
  addMessage();
  thread.release();
  EXPECT_EQ(alive_.taken.next(), kDisconnected);
  EXPECT_EQ(alive_.taken.size(), 0U);
  thread.release();
  EXPECT_EQ(alive_.taken.next(), 1);
  EXPECT_EQ(alive_.taken.next(), 2);
}

// Rows left when the service was started with `export = false`.
TEST_F(ExportThreadTest, WithoutConsentAtTheStartNoRowLeaves) {
  addMessage();
  awaitStored(*store_);
  start(/*exports=*/false);
  EXPECT_EQ(alive_.taken.next(), kDisconnected) << "it must be held before its first row";
  EXPECT_EQ(alive_.taken.size(), 0U);
  exporters_->setExports(true);
  EXPECT_EQ(alive_.taken.next(), 1);
}

}  // namespace
}  // namespace quarvel::testing
