#include "export/ExportThread.h"

#include <gmock/gmock.h>

#include "tests/device/Collected.h"
#include "tests/store/StoreFixture.h"

namespace quarvel::testing {
namespace {

using namespace std::chrono_literals;

/// Tells what it takes, unless it hangs: then it does so until it is stopped.
class HangingEngine : public ExportEngine {
 public:
  struct Seen {
    Collected<std::int64_t> taken, hung;
    std::atomic<bool> hangs = false;
  };
  explicit HangingEngine(Seen& seen) : seen_(seen) {}

  Delivery deliver(const ExportBatch& batch) override {
    const MutexLock lock(mutex_);
    if (seen_.hangs && !stopped_) seen_.hung.add(batch.rows.front().id);
    while (seen_.hangs && !stopped_) changed_.wait(mutex_);
    if (stopped_) return {.rest = Delivery::Rest::stopped};
    for (const ExportRow& row : batch.rows) seen_.taken.add(row.id);
    return {.taken = batch.rows.size()};
  }
  void rest() override {}
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
  ~ExportThreadTest() override { store_->followDurableExtent({}); }

  ExportThread& exporter(const std::string& backend, HangingEngine::Seen& seen) {
    store_->followDurableExtent({});  // the store's thread reads the list
    threads_.push_back(std::make_unique<ExportThread>(
        Exporter::Options{backend, 1'000'000}, std::make_unique<HangingEngine>(seen), *store_));
    threads_.back()->start();
    store_->followDurableExtent([this](const DurableExtent& extent) {
      for (const auto& thread : threads_) thread->extend(extent);
    });
    return *threads_.back();
  }
  void addMessage() { ASSERT_TRUE(send(*store_, Payload())); }

  std::unique_ptr<TelemetryStore> store_ = open({.sync = 0ms, .remoteBackends = {"dead", "alive"}});
  std::vector<std::unique_ptr<ExportThread>> threads_;
};

TEST_F(ExportThreadTest, ADeadEngineDelaysNeitherAnotherNorTheEnd) {
  HangingEngine::Seen dead;
  HangingEngine::Seen alive;
  dead.hangs = true;
  ExportThread& hanging = exporter("dead", dead);
  exporter("alive", alive);
  for (std::int64_t id = 1; id <= 3; ++id) {
    addMessage();
    EXPECT_EQ(alive.taken.next(), id);
  }
  EXPECT_EQ(dead.hung.next(), 1);
  hanging.stop();
  EXPECT_TRUE(hanging.awaitEnd(std::chrono::steady_clock::now() + 30s));
  EXPECT_EQ(value("SELECT count(*) FROM backend_cursor WHERE backend = 'dead'"), "0");
}

TEST_F(ExportThreadTest, HeldItHasNoRowInItsHandsAndReleasedItGoesOn) {
  HangingEngine::Seen seen;
  seen.hangs = true;
  ExportThread& thread = exporter("alive", seen);
  addMessage();
  EXPECT_EQ(seen.hung.next(), 1);
  thread.hold();
  thread.hold();
  seen.hangs = false;
  addMessage();
  thread.release();
  EXPECT_EQ(seen.taken.size(), 0U);
  thread.release();
  EXPECT_EQ(seen.taken.next(), 1);
  EXPECT_EQ(seen.taken.next(), 2);
}

TEST_F(ExportThreadTest, SleepsWhileNothingComes) {
  HangingEngine::Seen seen;
  ExportThread& thread = exporter("alive", seen);
  addMessage();
  EXPECT_EQ(seen.taken.next(), 1);
  std::uint64_t before = 0;
  do {
    before = thread.status().wakeUps;
    std::this_thread::sleep_for(200ms);
  } while (thread.status().wakeUps != before);
  std::this_thread::sleep_for(1s);
  EXPECT_EQ(thread.status().wakeUps, before);
}

}  // namespace
}  // namespace quarvel::testing
