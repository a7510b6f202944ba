#include "export/Exporter.h"

#include <gmock/gmock.h>

#include "export/ExportSettings.h"
#include "export/Exporters.h"
#include "export/otlp/OtlpEngine.h"
#include "tests/LogRecorder.h"
#include "tests/device/Collected.h"
#include "tests/export/ExportFixture.h"

namespace quarvel::testing {
namespace {

using ::testing::AllOf, ::testing::Contains, ::testing::ElementsAre, ::testing::Ge,
    ::testing::HasSubstr, ::testing::IsEmpty, ::testing::Le, ::testing::Optional;
using namespace std::chrono_literals;
using Remainder = Delivery::Remainder;

using Names = std::vector<std::string>;
Names operator+(Names names, const Names& more) {
  names.insert(names.end(), more.begin(), more.end());
  return names;
}

class ExporterTest : public ExportFixture {
 protected:
  /// The engine refuses a batch for ever if it holds one of these rows.
  void refuse(std::int64_t first, std::int64_t last, const char* reason) {
    engine_.answer = [=](const ExportBatch& batch) {
      const auto wrong = [=](const ExportRow& row) { return row.id >= first && row.id <= last; };
      if (std::ranges::none_of(batch.rows, wrong)) return RecordingEngine::takeAll(batch);
      return Delivery{
          .remainder = Remainder::refused, .refused = batch.rows.size(), .reason = reason};
    };
  }
};

TEST_F(ExporterTest, CarriesEveryTableOutOnceInOrderAndSaysSo) {
  begin();
  const Payload info(Dictionary{{"App", "a\"b"}});
  ASSERT_TRUE(store_->addAgentSession({-5, 19, 2.5, true, "token", "client", "music", info}));
  ASSERT_TRUE(store_->addAnalyticsEvent("an.event", Payload(Dictionary{{"x", 1.5}})));
  ASSERT_TRUE(store_->addPowerEvent(-28, "", Payload()));
  std::vector<std::string> json;
  engine_.answer = [&json](const ExportBatch& batch) {
    for (const ExportRow& row : batch.rows) AppendRowJson(json.emplace_back(), batch.table, row);
    return RecordingEngine::takeAll(batch);
  };
  addMessages(2500);
  runFor(1s);
  EXPECT_THAT(json.front(),
              R"({"id":1,"session_id":-5,"client_type":19,"client_version":2.5,"batch_event":true,)"
              R"("hierarchy_token":"token","client_name":"client","service_name":"music",)"
              R"("user_info":{"App":"a\"b"},"opened_at":1700000000000000})");
  EXPECT_THAT(json[2500],
              R"({"id":2500,"agent_session":null,"session_id":7,"client_name":"client",)"
              R"("service_name":"service","category":1,"type":2,"payload":{"n":1},)"
              R"("sent_at":1700000000000000})");
  EXPECT_EQ(engine_.taken, names(1, 1, "agent_session") + names(1, 2500) +
                               names(1, 1, "analytics_event") + names(1, 1, "power_event"));
  EXPECT_THAT(ledger(), ElementsAre("engine|agent_session|1|1|1|acknowledged",
                                    "engine|message|1|1000|1000|acknowledged",
                                    "engine|message|1001|2000|1000|acknowledged",
                                    "engine|message|2001|2500|500|acknowledged",
                                    "engine|analytics_event|1|1|1|acknowledged",
                                    "engine|power_event|1|1|1|acknowledged"));
  EXPECT_EQ(exporter_->status().exportedRows, 2503U);
  EXPECT_THAT(exporter_->status().acknowledgedAt, Optional(AllOf(Ge(date() - 1s), Le(date()))));

  begin();
  engine_.taken.clear();
  runFor(1h);
  EXPECT_THAT(engine_.taken, IsEmpty()) << "after a restart nothing is repeated";
  addMessages(1);
  runFor(1s);
  EXPECT_EQ(engine_.taken, names(2501, 2501));
}

TEST_F(ExporterTest, GathersRowsAndDisconnectsWhenThereAreNoMore) {
  begin({}, 1'000'000, 60s);
  addMessages(1);
  runFor(59s);
  addMessages(1);
  EXPECT_EQ(engine_.deliveries, 0);
  runFor(2s);
  EXPECT_EQ(engine_.deliveries, 1);
  EXPECT_EQ(engine_.taken, names(1, 2));
  runFor(28s);
  EXPECT_EQ(engine_.disconnects, 0) << "the connection is kept for rows that may follow";
  runFor(2s);
  EXPECT_EQ(engine_.disconnects, 1);
  EXPECT_EQ(runFor(1000h), 0);
}

TEST_F(ExporterTest, DrainsABacklogAtItsShare) {
  begin({}, 100);
  addMessages(1000);
  runFor(5s);
  EXPECT_THAT(engine_.taken.size(), AllOf(Ge(475U), Le(525U)));
  runFor(5s);
  EXPECT_EQ(engine_.taken.size(), 1000U);
}

TEST_F(ExporterTest, AnEngineDownForEightHoursCostsFewWakeUpsAndNoRow) {
  LogRecorder::take();
  begin({.maximumBytes = 8 << 20});
  engine_.answer = RecordingEngine::down;
  int wakeUps = 0;
  for (int minute = 0; minute < 480; ++minute) {
    addMessages(20);
    wakeUps += runFor(1min);
  }
  // 1 + 2 + 4 ... + 256 seconds, then one every five minutes.
  EXPECT_THAT(wakeUps, AllOf(Ge(100), Le(110)));
  EXPECT_THAT(LogRecorder::takeErrors(), ElementsAre(HasSubstr("no answer")));
  EXPECT_THAT(exporter_->status().error, Optional(std::string("no answer")));
  EXPECT_THAT(exporter_->status().nextAttempt, Optional(Ge(date())));
  EXPECT_THAT(source_->backlog(exporter_->status().exportedThrough).value(), 9600);

  engine_.answer = RecordingEngine::takeAll;
  runFor(5min);
  EXPECT_EQ(engine_.taken, names(1, 9600));
  EXPECT_EQ(exporter_->status().error, std::nullopt);
  EXPECT_EQ(source_->backlog(exporter_->status().exportedThrough).value(), 0);
}

TEST_F(ExporterTest, GoesOnBehindRowsThatRetentionHasTaken) {
  begin({.maximumBytes = 4 << 20});
  engine_.answer = RecordingEngine::down;
  const Payload large(Dictionary{{"text", std::string(4000, 'x')}});
  for (int i = 0; i < 20; ++i) addMessages(100, large);
  runFor(1s);
  engine_.answer = RecordingEngine::takeAll;
  const int first = std::stoi(value("SELECT min(id) FROM message"));
  EXPECT_GT(first, 1);
  runFor(10min);
  EXPECT_EQ(engine_.taken, names(first, 2000));
}

TEST_F(ExporterTest, BackOffFollowsTheJitterAndTheEnginesWish) {
  const struct {
    double jitter;
    std::optional<std::chrono::seconds> asked;
    std::chrono::seconds took;  // by the engine, and no part of the back-off
    std::chrono::milliseconds expected;
  } cases[] = {{1, {}, 0s, 1s},   {0, {}, 0s, 500ms}, {1, {}, 10s, 1s},
               {1, 90s, 0s, 90s}, {1, 0s, 0s, 1s},    {1, 86'400s, 0s, 3600s}};
  for (const auto& [jitter, asked, took, expected] : cases) {
    SCOPED_TRACE(expected.count());
    begin();
    jitter_ = jitter;
    engine_.answer = [this, &asked = asked, &took = took](const ExportBatch&) {
      now_ += took;
      return Delivery{.remainder = Remainder::again, .reason = "busy", .after = asked};
    };
    addMessages(1);
    runFor(0s);
    engine_.answer = RecordingEngine::takeAll;
    const int before = engine_.deliveries;
    runFor(expected - 1ms);
    EXPECT_EQ(engine_.deliveries, before);
    runFor(1ms);
    EXPECT_EQ(engine_.deliveries, before + 1);
  }
}

TEST_F(ExporterTest, TakenRowsOfABatchAreNotSentAgain) {
  begin();
  addMessages(10);
  engine_.answer = [](const ExportBatch&) {
    return Delivery{.taken = 4, .remainder = Remainder::again, .reason = "full"};
  };
  runFor(1ms);
  engine_.answer = RecordingEngine::takeAll;
  runFor(1s);
  EXPECT_EQ(engine_.taken, names(1, 10));
  engine_.answer = [](const ExportBatch& batch) {
    return Delivery{.taken = batch.rows.size(), .reason = "too old", .droppedByEngine = 2};
  };
  addMessages(5);
  runFor(1s);
  EXPECT_THAT(ledger(),
              ElementsAre("engine|message|1|4|4|acknowledged", "engine|message|5|10|6|acknowledged",
                          "engine|message|11|15|5|partly refused: 2 of 5: too old"));
  EXPECT_EQ(exporter_->status().refusedRows, 2U);
}

TEST_F(ExporterTest, ARefusedRowIsSetAsideAlone) {
  begin();
  addMessages(1000);
  refuse(778, 778, "bad row");
  runFor(1s);
  EXPECT_EQ(engine_.taken, names(1, 777) + names(779, 1000));
  EXPECT_LE(engine_.deliveries, 30);
  EXPECT_THAT(ledger(), Contains("engine|message|778|778|1|refused: bad row"));
  EXPECT_EQ(value("SELECT count(*) FROM message WHERE id = 778"), "1") << "it stays in the store";
  EXPECT_EQ(exporter_->status().refusedRows, 1U);
}

TEST_F(ExporterTest, AnEngineThatRefusesEverythingIsNotAskedRowByRow) {
  begin();
  addMessages(3000);
  refuse(1, 3000, "nonsense");
  runFor(1s);
  const int firstSecond = engine_.deliveries;
  EXPECT_LE(firstSecond, 25);
  runFor(1h);
  EXPECT_LE(engine_.deliveries, firstSecond + 20) << "attempts must back off";
  engine_.answer = RecordingEngine::takeAll;
  runFor(10min);
  EXPECT_EQ(value("SELECT sum(rows) FROM export_log"), "3000");
}

TEST_F(ExporterTest, ACrashRepeatsOneBatchAtMost) {
  begin();
  addMessages(3000);
  engine_.answer = [this](const ExportBatch& batch) {
    if (batch.rows.front().id == 1001) store_->close();
    return RecordingEngine::takeAll(batch);
  };
  runFor(1ms);
  engine_.answer = RecordingEngine::takeAll;
  begin();
  addMessages(0);
  runFor(1s);
  EXPECT_EQ(engine_.taken, names(1, 2000) + names(1001, 3000));
}

TEST_F(ExporterTest, AStoreThatTakesThePlaceOfAnotherIsExportedFromItsBeginning) {
  begin();
  addMessages(10);
  runFor(1s);
  store_->close();
  for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(path_.string() + suffix);
  store_ = open({.sync = 0ms});
  source_.emplace(*store_, path_, "engine");
  engine_.taken.clear();
  addMessages(3);
  runFor(1s);
  EXPECT_EQ(engine_.taken, names(1, 3));
}

TEST_F(ExporterTest, RowsThatAPowerCutMayTakeAreNotSent) {
  begin();
  addMessages(10);
  DurableExtent safe = extent();
  safe.lastIDs[StoreTable::message] = 4;
  (void)exporter_->step(safe);
  now_ += 1s;
  (void)exporter_->step(safe);
  EXPECT_EQ(engine_.taken, names(1, 4));
}

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

TEST(OtlpDeliveryTest, OnlyAStatusAboutTheRowsRefusesThem) {
  for (const int status : {0, 301, 401, 403, 404, 405, 407, 408, 415, 429, 502, 503, 504}) {
    const Delivery delivery = DeliveryFromResponse({.status = status, .retryAfter = 7s}, 3);
    EXPECT_EQ(delivery.remainder, Remainder::again) << status;
    EXPECT_EQ(delivery.taken + delivery.refused, 0U) << status;
    EXPECT_EQ(delivery.after.has_value(), status != 0) << status;
  }
  for (const int status : {400, 413, 422, 500, 501}) {
    const Delivery delivery = DeliveryFromResponse({.status = status}, 3);
    EXPECT_EQ(delivery.remainder, Remainder::refused) << status;
    EXPECT_EQ(delivery.refused, 3U) << status;
  }
  EXPECT_EQ(DeliveryFromResponse({.status = 200, .body = "<html>"}, 3).remainder, Remainder::again);
}

TEST(ExportDeviceTest, NameFitsIntoASubjectAndALabel) {
  EXPECT_EQ(DeviceName("car-7", "other"), "car-7");
  EXPECT_EQ(DeviceName("", "Kitchen_2.local lan*\xc3\xa9>"), "Kitchen_2-local-lan----");
  for (const char* useless : {"", "localhost"}) {
    EXPECT_THAT(DeviceName("", useless), ::testing::MatchesRegex("unnamed|[0-9a-f]+"));
  }
}

}  // namespace
}  // namespace quarvel::testing
