#include <gmock/gmock.h>

#include <algorithm>
#include <fstream>
#include <future>

#include "store/database/Erasure.h"
#include "store/database/StoreFile.h"
#include "tests/export/ExportFixture.h"

namespace quarvel::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using namespace std::chrono_literals;

class ErasureTest : public ExportFixture {
 protected:
  static constexpr std::int64_t kErasedSession = 4102;

  void addSecret(std::int64_t sessionID, int count) {
    const std::int64_t session =
        addSession(*store_, sessionID, Payload(Dictionary{{"App", "secret"}}));
    for (int i = 0; i < count; ++i) {
      // So long that some rows have pages of their own.
      const Payload payload(Dictionary{{"secret", std::string(i % 10 == 0 ? 9000 : 90, 's')}});
      ASSERT_TRUE(store_->addMessage({session, sessionID, "client", "music", 1, 2, payload}));
    }
  }
  /// Begins to erase; what comes of it.
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
  addSecret(kErasedSession, 1500);
  addMessages(2000);
  ASSERT_TRUE(filesHold("secret") || store_->counters().waiting > 0);
  EXPECT_EQ(erase({kErasedSession}).get().value(), 1501);
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
  const std::int64_t open = addSession(*store_, 2);
  runFor(1h);
  ASSERT_TRUE(store_->addMessage({open, 2, "c", "s", 1, 2, Payload()}));
  ASSERT_TRUE(store_->addPowerEvent(1, "new", Payload()));
  awaitStored(*store_);
  EXPECT_EQ(erase({date() - 1min}).get().value(), 10 + 1 + 5 + 1);
  EXPECT_THAT(rows("SELECT session_id FROM agent_session"), ElementsAre("2"));
  EXPECT_THAT(rows("SELECT session_id FROM message"), ElementsAre("2"));
  EXPECT_EQ(value("SELECT (SELECT count(*) FROM analytics_event) || (SELECT count(*) FROM "
                  "power_event)"),
            "01");
}

// An id that was given twice would be a repeat to every engine.
TEST_F(ErasureTest, GivesNoIdTwiceAndExportsWhatComesAfter) {
  begin();
  engine_.answer = RecordingEngine::down;
  addMessages(10);
  runFor(1s);
  EXPECT_EQ(erase({}).get().value(), 10);
  EXPECT_EQ(erase({}).get().value(), 0) << "and leaves its line all the same";
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
  EXPECT_EQ(erased.get().value(), 20'000);
  EXPECT_EQ(value("SELECT min(id) || ' ' || count(*) FROM message"), "20001 5000");
}

TEST_F(ErasureTest, WorksOnAStoreThatNobodyHasOpen) {
  begin();
  addSecret(1, 700);
  store_->close();
  std::ofstream(path_.string() + ".corrupt-1") << "secret";
  std::ofstream(path_.string() + ".corrupt-1-wal") << "secret";
  {
    SqliteConnection connection;
    ASSERT_TRUE(connection.open(path_));
    Erasure erasure(connection, {}, date());
    while (erasure.step() == Erasure::Progress::more) continue;
    EXPECT_EQ(erasure.rows(), 701);
  }
  EXPECT_EQ(RemoveStoresSetAside(path_), 2U);
  EXPECT_FALSE(filesHold("secret"));
  begin();
  EXPECT_EQ(store_->counters().dropped[StoreDrop::erased], 700U);
  addMessages(1);
  EXPECT_EQ(value("SELECT id FROM message"), "701");
}

TEST_F(ErasureTest, AClosedStoreSaysThatItWasNotFinished) {
  begin();
  addMessages(5000);
  auto erased = erase({});
  store_->close();
  const auto result = erased.get();
  EXPECT_TRUE(result.ok() ||
              result.error().description().find("before all was erased") != std::string::npos);
}

}  // namespace
}  // namespace quarvel::testing
