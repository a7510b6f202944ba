#include <gmock/gmock.h>

#include <algorithm>
#include <fstream>
#include <future>
#include <thread>

#include "store/database/Erasure.h"
#include "tests/Interposer.h"
#include "tests/export/ExportFixture.h"

namespace quarvel::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using namespace std::chrono_literals;

class ErasureTest : public ExportFixture {
 protected:
  void addSecret(std::int64_t sessionID, int count) {
    const auto session = addSession(*store_, sessionID, Payload(Dictionary{{"App", "secret"}}));
    for (int i = 0; i < count; ++i) {
      // So long that some rows have pages of their own.
      const Payload payload(Dictionary{{"secret", std::string(i % 10 == 0 ? 9000 : 90, 's')}});
      ASSERT_TRUE(store_->addMessage({session, sessionID, "client", "music", 1, 2, payload}));
    }
  }
  /// Begins to erase.
  std::future<Result<std::int64_t>> erase(const ErasureSelection& selection) {
    auto erased = std::make_shared<std::promise<Result<std::int64_t>>>();
    EXPECT_TRUE(store_->erase(selection, [erased](const auto& rows) { erased->set_value(rows); }));
    return erased->get_future();
  }
  [[nodiscard]] bool filesHold(const std::string& text) const {
    return std::ranges::any_of(
        files(), [&text](const auto& file) { return file.second.find(text) != std::string::npos; });
  }
};

TEST_F(ErasureTest, LeavesNothingOfWhatWasErasedInTheFilesAndOneLineInTheLedger) {
  begin();
  addMessages(2000);
  addSecret(4102, 1500);
  addMessages(2000);
  ASSERT_TRUE(filesHold("secret") || store_->counters().waiting > 0);
  EXPECT_EQ(Get(erase({4102})).value(), 1501);
  EXPECT_FALSE(filesHold("secret"));
  EXPECT_EQ(value("SELECT count(*) FROM message"), "4000");
  EXPECT_THAT(rows("SELECT backend, table_name, first_id, rows, bytes > 100000, outcome FROM "
                   "export_log"),
              ElementsAre("store|*|-|1501|1|erased: session 4102"));
  const StoreCounters counters = store_->counters();
  EXPECT_EQ(counters.dropped[StoreDrop::erased], 1500U);
  EXPECT_EQ(counters.accepted, counters.stored + counters.dropped.sum());
  begin();
  EXPECT_EQ(store_->counters(), counters) << "as before the restart";
}

TEST_F(ErasureTest, ErasesByDateAndKeepsTheSessionsOfWhatRemains) {
  begin();
  addSecret(1, 10);
  addMessages(5);
  ASSERT_TRUE(store_->addAnalyticsEvent("old", Payload()));
  // Kept for a later message, and for its later flush.
  const std::int64_t open = addSession(*store_, 2);
  const std::int64_t flushed = addSession(*store_, 3);
  runFor(1h);
  ASSERT_EQ(Get(flush(*store_, flushed)), std::nullopt);
  ASSERT_TRUE(store_->addMessage({open, 2, "c", "s", 1, 2, Payload()}));
  ASSERT_TRUE(store_->addPowerEvent(1, "new", Payload()));
  awaitStored(*store_);
  EXPECT_EQ(Get(erase({date() - 1min})).value(), 10 + 1 + 5 + 1);
  EXPECT_THAT(rows("SELECT session_id FROM agent_session"), ElementsAre("2", "3"));
  EXPECT_THAT(rows("SELECT session_id FROM message"), ElementsAre("2"));
  EXPECT_EQ(value("SELECT (SELECT count(*) FROM analytics_event) || (SELECT count(*) FROM "
                  "power_event)"),
            "01");
}

// An engine would take a row with an old id for a repeat.
TEST_F(ErasureTest, GivesNoIdTwiceAndExportsLaterRows) {
  begin();
  engine_.answer = RecordingEngine::down;
  addMessages(10);
  runFor(1s);
  std::ofstream(path_.string() + ".corrupt-1") << "secret";
  std::ofstream(path_.string() + ".corrupt-1-wal") << "secret";
  EXPECT_EQ(Get(erase({})).value(), 10);
  EXPECT_FALSE(filesHold("secret")) << "in a store that was set aside";
  EXPECT_EQ(Get(erase({})).value(), 0) << "but its line is in the ledger";
  begin();
  engine_.answer = RecordingEngine::takeAll;
  addMessages(3);
  runFor(1h);
  EXPECT_EQ(engine_.taken, names(11, 13));
  EXPECT_THAT(rows("SELECT rows FROM export_log WHERE backend = 'store'"), ElementsAre("10", "0"));
}

TEST_F(ErasureTest, TakesRowsMeanwhileAndErasesNoneOfThem) {
  begin();
  addMessages(20'000);
  auto erased = erase({});
  addMessages(5000);
  EXPECT_EQ(Get(erased).value(), 20'000);
  EXPECT_EQ(value("SELECT min(id) || ' ' || count(*) FROM message"), "20001 5000");
}

TEST_F(ErasureTest, WorksWithoutTheService) {
  begin();
  addSecret(1, 700);
  store_->close();
  {
    SqliteConnection connection;
    ASSERT_TRUE(connection.open(path_));
    Erasure erasure(connection, {}, date());
    while (erasure.step() == Erasure::Progress::more) continue;
    EXPECT_EQ(erasure.rows(), 701);
  }
  EXPECT_FALSE(filesHold("secret"));
  begin();
  EXPECT_EQ(store_->counters().dropped[StoreDrop::erased], 700U);
  addMessages(1);
  EXPECT_EQ(value("SELECT id FROM message"), "701");
}

TEST_F(ErasureTest, AStoreClosedMeanwhileSaysThatItWasNotFinished) {
  begin();
  addMessages(5000);
  Interposer& files = Interposer::watch(directory_);
  begin();
  files.hold();
  auto erased = erase({});
  Await([&] { return files.holdsOne(); });
  std::thread closing([this] { store_->close(); });
  Await([this] { return !store_->isOpen(); });
  files.release();
  closing.join();
  const auto result = Get(erased);
  ASSERT_FALSE(result);
  EXPECT_THAT(result.error().description(), ::testing::HasSubstr("before all was erased"));
}

}  // namespace
}  // namespace quarvel::testing
