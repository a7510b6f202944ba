#include "store/TelemetryStore.h"

#include <dlfcn.h>
#include <fmt/format.h>
#include <gmock/gmock.h>
#include <sys/stat.h>

#include <atomic>
#include <ctime>
#include <fstream>

#include "store/StoreQueue.h"
#include "store/database/Sqlite.h"
#include "store/database/StoreFile.h"
#include "tests/Interposer.h"
#include "tests/LogRecorder.h"
#include "tests/store/StoreFixture.h"

namespace quarvel::testing {
namespace {

using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::Field;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using namespace std::chrono_literals;

// The time that the device has slept, for `clock_gettime` below.
std::atomic<std::chrono::seconds> asleep{0s};

class StoreTest : public StoreFixture {
 protected:
  StoreTest() { LogRecorder::take(); }

  using StoreFixture::send;
  static Outcome send(TelemetryStore& store, std::int64_t number) {
    return send(store, Payload(Dictionary{{"n", number}}));
  }
  static void sendAndAwait(TelemetryStore& store, std::int64_t number) {
    ASSERT_TRUE(send(store, number));
    awaitStored(store);
  }
  std::uintmax_t fileBytes() const { return std::filesystem::file_size(path_); }
  static std::filesystem::perms mode(const std::filesystem::path& path) {
    return std::filesystem::status(path).permissions();
  }
  /// Makes a fault in a file that no process has open.
  void overwrite(std::streamoff at, const std::string& bytes) const {
    std::fstream(path_, std::ios::in | std::ios::out | std::ios::binary).seekp(at) << bytes;
  }

  Interposer& files_ = Interposer::watch(directory_);
};

MATCHER(IsBalanced, "accepted = stored + waiting + dropped") {
  return arg.accepted == arg.stored + arg.waiting + arg.dropped.sum();
}
MATCHER_P2(Counts, stored, refused, "") {
  return ExplainMatchResult(IsBalanced(), arg, result_listener) && arg.stored == stored &&
         arg.dropped[StoreDrop::refused] == refused;
}

TEST_F(StoreTest, IdentifiesItsFileAndGoesOnAfterARestart) {
  const mode_t mask = umask(0077);
  auto store = open();
  umask(mask);
  EXPECT_EQ(mode(path_), std::filesystem::perms{0640});
  EXPECT_EQ(value("PRAGMA application_id"), std::to_string(0x51525654));
  EXPECT_EQ(value("PRAGMA user_version"), "1");
  EXPECT_EQ(value("PRAGMA journal_mode"), "wal");
  const std::string storeID = this->storeID();
  EXPECT_THAT(storeID,
              MatchesRegex("[0-9a-f]{8}-[0-9a-f]{4}-4[0-9a-f]{3}-[89ab][0-9a-f]{3}-[0-9a-f]{12}"));
  addSession(*store);
  ASSERT_TRUE(send(*store, 1));
  store.reset();
  store = open();
  EXPECT_EQ(addSession(*store), 2);
  ASSERT_TRUE(send(*store, 2));
  EXPECT_EQ(store->counters().accepted, 2U);
  store.reset();
  EXPECT_EQ(this->storeID(), storeID);
  EXPECT_THAT(rows("SELECT id, payload FROM message ORDER BY id"),
              ElementsAre(R"(1|{"n":1})", R"(2|{"n":2})"));
  EXPECT_FALSE(std::filesystem::exists(path_.string() + "-wal")) << "a closed store is one file";
}

// A file that cannot be used stays as it is, and the reason tells the remedy.
TEST_F(StoreTest, RefusesForeignFilesAndTellsTheRemedy) {
  open().reset();
  const auto refusal = [](const std::filesystem::path& path) {
    TelemetryStore::Options options;
    options.path = path;
    const auto store = TelemetryStore::open(options);
    return store ? "opened" : store.error().description();
  };
  execute("PRAGMA user_version = 2");
  EXPECT_THAT(refusal(path_),
              AllOf(HasSubstr("quarvel.store 5"), HasSubstr("version 2"), HasSubstr("Install")));
  EXPECT_EQ(value("PRAGMA user_version"), "2");
  execute("PRAGMA user_version = 1; PRAGMA application_id = 5");
  EXPECT_THAT(refusal(path_), AllOf(HasSubstr("quarvel.store 6"), HasSubstr("another program")));
  EXPECT_THAT(refusal(directory_ / "no" / "telemetry.db"),
              AllOf(HasSubstr("quarvel.store 4"), HasSubstr("Make the directory")));
  EXPECT_THAT(refusal("/sys/telemetry.db"),
              AllOf(HasSubstr("quarvel.store 4"), HasSubstr("Let the service write to /sys")));
  EXPECT_THAT(refusal(directory_), HasSubstr("quarvel.store 4"));
  EXPECT_THAT(LogRecorder::takeErrors(), ::testing::IsEmpty());
}

TEST_F(StoreTest, AFileWithAWrongBitInItsHeaderIsSetAsideAndSalvaged) {
  auto store = open();
  ASSERT_TRUE(send(*store, 1));
  store.reset();
  overwrite(68, "\x11");  // one bit of the application's id: 0x51
  std::ofstream(path_.string() + "-wal") << "left over";
  store = open({.clock = [] { return Date{1'700'000'000s}; }});
  ASSERT_TRUE(send(*store, 2));
  EXPECT_EQ(store->counters().accepted, 2U);
  store.reset();
  EXPECT_EQ(value("SELECT group_concat(payload ->> 'n') FROM message"), "1,2");
  const std::string aside = path_.string() + ".corrupt-20231114T221320.000000Z";
  EXPECT_TRUE(std::filesystem::exists(aside));
  EXPECT_TRUE(std::filesystem::exists(aside + "-wal"));
  EXPECT_THAT(LogRecorder::takeErrors(),
              ElementsAre(HasSubstr(aside), HasSubstr(" rows could be read")));
}

TEST_F(StoreTest, CorruptionMetByTheWriterLosesNoQueuedRow) {
  Date now{0us};
  TelemetryStore::Options options{.ageing = 0ms, .clock = [&now] { return now; }};
  auto store = open(options);
  for (int i = 0; i < 20'000; ++i) ASSERT_TRUE(send(*store, i));
  store.reset();
  overwrite(40 * 4096, std::string(40 * 4096, '\x5a'));
  now += 20 * 24h;  // so that retention will walk over the damage
  store = open(options);
  sendAndAwait(*store, 0);
  Await(
      [&] { return std::filesystem::exists(path_.string() + ".corrupt-19700121T000000.000000Z"); });
  ASSERT_TRUE(send(*store, -1));
  store->close();
  EXPECT_EQ(value("SELECT count(*) FROM message"), std::to_string(store->counters().stored));
  EXPECT_EQ(value("SELECT count(*) FROM message WHERE payload = '{\"n\":-1}' AND id = 20002"), "1");
  EXPECT_THAT(store->counters(), AllOf(IsBalanced(), Field(&StoreCounters::accepted, 20'002)));
  const std::uint64_t damaged = store->counters().dropped[StoreDrop::damaged];
  EXPECT_GT(damaged, 500U);
  EXPECT_LT(damaged, 5'000U) << "of 40 pages of some hundred rows";
}

TEST_F(StoreTest, OneTransactionTakesAllQueuedRowsUpTo1024) {
  auto store = open({.queueRows = 4000});
  const int before = files_.counts().commits;
  for (int i = 0; i < 3; ++i) sendAndAwait(*store, i);
  EXPECT_EQ(files_.counts().commits, before + 3) << "alone, a row is committed at once";
  files_.hold();
  ASSERT_TRUE(send(*store, 3));
  Await([&] { return files_.holdsOne(); });
  for (int i = 0; i < 2500; ++i) ASSERT_TRUE(send(*store, i));
  files_.release();
  awaitStored(*store);
  EXPECT_EQ(files_.counts().commits, before + 3 + 1 + 3);
}

TEST(StoreQueueTest, HoldsAsManyRowsAsAreCommittedInAFewMilliseconds) {
  StoreQueue queue(2048, std::size_t{1} << 30);
  const auto fill = [&queue] {
    std::size_t rows = 0;
    while (queue.pushIfRoom(AnalyticsEventRow{Payload(), Date{}}, {"event"})) ++rows;
    return rows;
  };
  const auto rowsAfter = [&](std::chrono::nanoseconds each, int commits) {
    std::size_t rows = 0;
    for (; commits > 0; --commits, rows = fill()) {
      StoreBatch batch;
      EXPECT_EQ(queue.take(batch, std::nullopt), StoreQueue::Take::rows);
      StoreQueue::Tally tally;
      for (const StoreRow& row : batch.rows()) tally.add(row);
      queue.committed(tally, each * static_cast<std::int64_t>(tally.rows));
    }
    return rows;
  };
  EXPECT_EQ(fill(), 2048U);
  EXPECT_EQ(rowsAfter(1us, 1), 2048U);
  EXPECT_NEAR(static_cast<double>(rowsAfter(10us, 30)), 400, 20);
  // Seconds spent on a full disk leave a bound from which the queue recovers.
  EXPECT_EQ(rowsAfter(100ms, 30), 128U);
  EXPECT_EQ(rowsAfter(1us, 20), 2048U);
}

TEST_F(StoreTest, SendersWaitAtTheBoundOfBytesAndARowThatIsTooLongIsRefused) {
  const Payload large(Dictionary{{"text", std::string(100'000, 'x')}});
  auto store = open({.queueBytes = 1'000'000});
  const auto refused = send(*store, Payload(Dictionary{{"", std::string(kMostRowBytes, 'x')}}));
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code, static_cast<std::int64_t>(StoreErrorCode::tooLarge));
  files_.hold();
  std::thread sender([&] {
    for (int i = 0; i < 300; ++i) ASSERT_TRUE(send(*store, large));
  });
  Await([&] { return store->counters().waiting == 10; });
  addSession(*store);  // does not wait
  EXPECT_EQ(store->counters().waiting, 10U);
  files_.release();
  sender.join();
  store->close();
  EXPECT_THAT(store->counters(), Counts(300U, 1U));
}

TEST_F(StoreTest, AFullDiskDelaysRowsAndLosesNone) {
  constexpr int kSenders = 4;
  constexpr int kRows = 2500;
  auto store = open({.queueRows = 50, .firstBackOff = 1ms, .longestBackOff = 2ms});
  files_.inject(Interposer::fullDisk());
  std::vector<std::thread> senders;
  for (int sender = 0; sender < kSenders; ++sender) {
    senders.emplace_back([&store, sender] {
      for (int i = 0; i < kRows; ++i) {
        ASSERT_TRUE(send(*store, Payload(Dictionary{{"n", i}, {"sender", sender}})));
      }
    });
  }
  // Hours, were the delays not bounded.
  Await([&] { return files_.failedCalls() >= 150; });
  Await([&] { return store->counters().waiting == 50; });
  EXPECT_THAT(LogRecorder::takeErrors(), ElementsAre(AllOf(HasSubstr("fails"), HasSubstr("full"))))
      << "one line for all attempts";
  files_.lift();
  for (std::thread& sender : senders) sender.join();
  store->close();
  EXPECT_THAT(store->counters(), Counts(std::uint64_t{kSenders * kRows}, 0U));
  // Each sender's rows are stored in its order.
  EXPECT_EQ(value("SELECT count(*) FROM (SELECT payload ->> 'n' AS n, row_number()"
                  " OVER (PARTITION BY payload ->> 'sender' ORDER BY id) AS nth FROM message) "
                  "WHERE n = nth - 1"),
            std::to_string(kSenders * kRows));
}

TEST_F(StoreTest, ClosingOnAFullDiskCountsLostRows) {
  auto store = open({.queueRows = 5});
  sendAndAwait(*store, 0);
  files_.inject(Interposer::fullDisk());
  for (int i = 1; i <= 5; ++i) ASSERT_TRUE(send(*store, i));
  auto flushed = flush(*store, 1);
  auto waiting = std::async(std::launch::async, [&] { return send(*store, 6); });
  Await([&] { return files_.failedCalls() >= 1; });
  store->close();
  EXPECT_THAT(Get(flushed)->description(), HasSubstr("quarvel.store 2"));
  const Outcome refused = Get(waiting);
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code, static_cast<std::int64_t>(StoreErrorCode::closed));
  EXPECT_THAT(store->counters(), Counts(1U, 1U));
  EXPECT_EQ(store->counters().dropped[StoreDrop::storeClosed], 5U);
  EXPECT_THAT(LogRecorder::takeErrors(), ElementsAre(HasSubstr("fails"), HasSubstr("5 are lost")));
}

TEST_F(StoreTest, RowsAreCommittedWhileTheMediumIsSlow) {
  auto store = open({.sync = 24h, .logPages = 24, .clock = [] { return Date{5us}; }});
  const std::int64_t session = addSession(*store);
  for (int i = 0; i < 3; ++i) sendAndAwait(*store, i);
  EXPECT_LE(files_.counts().logSyncs, 1) << "only the head of a new log";
  files_.hold(Interposer::Purpose::sync);
  auto flushed = flush(*store, session);
  Await([&] { return files_.holdsOne(); });
  for (int i = 3; i < 6; ++i) sendAndAwait(*store, i);
  EXPECT_EQ(value("SELECT count(*) FROM message"), "6");
  EXPECT_EQ(flushed.wait_for(0s), std::future_status::timeout) << "the row is not durable";
  auto flushedToo = flush(*store, session);
  files_.release();
  EXPECT_EQ(Get(flushed), std::nullopt);
  EXPECT_EQ(Get(flushedToo), std::nullopt) << "a sync does not cover rows from after its beginning";
  EXPECT_EQ(files_.counts().unsynced, 0);
  EXPECT_EQ(value("SELECT flushed_at FROM agent_session"), "5");
  // Moving the log into the file begins with a sync.
  files_.hold(Interposer::Purpose::sync);
  int sent = 6;
  while (!files_.holdsOne()) sendAndAwait(*store, sent++);
  for (int i = 0; i < 3; ++i) sendAndAwait(*store, sent++);
  EXPECT_EQ(value("SELECT count(*) FROM message"), std::to_string(sent));
  files_.release();
  store.reset();
  EXPECT_EQ(value("SELECT count(*) FROM message"), std::to_string(sent));
}

TEST_F(StoreTest, SyncsWithEachCommitOrOnceTheIntervalIsOver) {
  auto store = open({.sync = 0ms});
  sendAndAwait(*store, 0);
  const Interposer::Counts before = files_.counts();
  for (int i = 0; i < 20; ++i) sendAndAwait(*store, i);
  EXPECT_EQ(files_.counts().logSyncs - before.logSyncs, 20);
  store.reset();
  Interposer::watch(directory_);
  store = open({.sync = 400ms});
  sendAndAwait(*store, 0);
  const auto stored = std::chrono::steady_clock::now();
  const int commits = files_.counts().commits;
  // The head of the new log, then the interval's.
  Await([&] { return files_.counts().logSyncs >= 2; });
  EXPECT_LT(std::chrono::steady_clock::now() - stored, 2s) << "400 ms are promised";
  EXPECT_EQ(files_.counts().commits, commits) << "a sync writes nothing";
}

TEST_F(StoreTest, ClosesOnceWithAllRowsDurableAndRefusesLaterOnes) {
  auto store = open({.sync = 24h, .queueRows = 4000});
  files_.hold();
  for (int i = 0; i < 3000; ++i) ASSERT_TRUE(send(*store, i));
  std::thread other([&] { store->close(); });
  Await([&] { return !store->isOpen(); });
  const Outcome late = send(*store, 3000);
  files_.release();
  store->close();
  other.join();
  ASSERT_FALSE(late);
  EXPECT_EQ(late.error().domain, kStoreErrorDomain);
  EXPECT_THAT(store->counters(), Counts(3000U, 1U));
  EXPECT_EQ(files_.counts().unsynced, 0);
}

TEST_F(StoreTest, AFileThatIsRemovedIsRestoredWithAllItsRows) {
  auto store = open();
  for (int i = 1; i <= 100; ++i) sendAndAwait(*store, i);
  const std::string storeID = this->storeID();
  std::filesystem::remove_all(directory_);
  sendAndAwait(*store, 101);
  sendAndAwait(*store, 102);
  EXPECT_EQ(mode(directory_), std::filesystem::perms{0750});
  EXPECT_EQ(value("SELECT count(*) FROM message"), "102");
  // Another store stands there: the rows of the first come into it, where their ids are free.
  const std::filesystem::path away = directory_.string() + "-away";
  std::filesystem::rename(directory_, away);
  std::filesystem::create_directory(directory_);
  open().reset();
  for (int i = 103; i <= 110; ++i) sendAndAwait(*store, i);
  store->close();
  std::filesystem::remove_all(away);
  EXPECT_EQ(value("SELECT count(*) || ' ' || max(payload ->> 'n') FROM message"), "110 110");
  EXPECT_EQ(this->storeID(), storeID);
  EXPECT_EQ(value("PRAGMA integrity_check"), "ok");
  EXPECT_THAT(store->counters(), Counts(110U, 0U));
}

TEST_F(StoreTest, OpensLaterWhenTheDiskHasNoRoomAtFirst) {
  auto store = open();
  EXPECT_EQ(addSession(*store), 1);
  store.reset();
  files_.inject(Interposer::fullDisk());
  store = open({.firstBackOff = 1ms});
  EXPECT_THAT(store->state().problem.value_or(""), HasSubstr("quarvel.store"));
  const std::int64_t second = addSession(*store);
  ASSERT_TRUE(store->addMessage({second, 1, "client", "service", 1, 2, Payload()}));
  auto flushed = flush(*store, second);
  Await([&] { return files_.failedCalls() >= 3; });
  files_.lift();
  EXPECT_EQ(Get(flushed), std::nullopt);
  EXPECT_EQ(store->state().problem, std::nullopt);
  store->close();
  EXPECT_THAT(rows("SELECT m.agent_session, s.id, s.flushed_at > 0 FROM message m, agent_session s"
                   " WHERE s.id > 1"),
              ElementsAre("2|2|1"));
}

// Only the reader can end its transaction. The log keeps its bound until then, and rows wait.
TEST_F(StoreTest, AReaderThatNeverEndsHoldsRowsBackBeforeTheLogFillsTheDisk) {
  const Payload padded(Dictionary{{"text", std::string(2'000, 'x')}});
  auto store = open({.maximumBytes = 1 << 20, .logPages = 16, .firstBackOff = 1ms});
  sendAndAwait(*store, 0);
  SqliteConnection reader;
  ASSERT_TRUE(reader.open(path_));
  ASSERT_TRUE(reader.execute("BEGIN; SELECT count(*) FROM message"));
  std::thread sender([&] {
    for (int i = 0; i < 4'000; ++i) ASSERT_TRUE(send(*store, padded));
  });
  Await([&] { return store->state().problem.has_value(); });
  EXPECT_THAT(*store->state().problem, HasSubstr("end it"));
  EXPECT_LT(std::filesystem::file_size(path_.string() + "-wal"), 6U << 20);
  ASSERT_TRUE(reader.execute("COMMIT"));
  sender.join();
  store->close();
  EXPECT_THAT(store->counters(), AllOf(IsBalanced(), Field(&StoreCounters::accepted, 4'001)));
  EXPECT_EQ(store->state().problem, std::nullopt);
}

TEST_F(StoreTest, AnExportRecordCountsForItsOwnStoreAndTheLedgerKeepsItsBound) {
  open().reset();
  execute(
      "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n WHERE i < 100001)"
      "INSERT INTO export_log SELECT i, 'nats', 'message', i, i, 1, 1, 'exported', i FROM n");
  auto store = open();
  for (const auto& [about, lastID] :
       {std::pair(storeID(), 5), std::pair(std::string("other"), 9)}) {
    ASSERT_TRUE(store->addExport(
        {"nats", about, StoreTable::message, lastID, {{1, lastID, 5, 100, "exported"}}},
        [](const auto& error) { EXPECT_EQ(error, std::nullopt); }));
  }
  store->close();
  EXPECT_THAT(rows("SELECT * FROM backend_cursor"), ElementsAre("nats|message|5"));
  EXPECT_EQ(value("SELECT count(*) || ' ' || max(id) FROM export_log"), "100000 100002");
}

class StoreRetentionTest : public StoreTest {
 protected:
  static constexpr std::uint64_t kBound = 2 << 20;

  void fill(TelemetryStore& store, int rows) {
    const Payload padded(Dictionary{{"text", std::string(400, 'x')}});
    for (int i = 0; i < rows; ++i) {
      now_ = now_.load() + 100ms;
      ASSERT_TRUE(send(store, padded));
      if (i % 10 != 0) continue;
      ASSERT_TRUE(store.addPowerEvent(28, "event", padded));
    }
  }
  TelemetryStore::Options options() {
    return {.maximumBytes = kBound, .ageing = 0ms, .clock = [this] { return now_.load(); }};
  }

  std::atomic<Date> now_{Date{0us}};
};

TEST_F(StoreRetentionTest, TheOldestRowsMakeRoomForNewOnes) {
  auto store = open(options());
  fill(*store, 20'000);
  store->close();
  EXPECT_LE(fileBytes(), kBound);
  EXPECT_GT(fileBytes(), kBound * 3 / 4) << "no more rows are removed than have to be";
  const StoreCounters counters = store->counters();
  EXPECT_THAT(counters, AllOf(IsBalanced(), Field(&StoreCounters::accepted, 22'000)));
  EXPECT_EQ(value("SELECT (SELECT count(*) FROM message) + (SELECT count(*) FROM power_event)"),
            std::to_string(counters.stored));
  // Both tables begin at the same age.
  EXPECT_EQ(value("SELECT max(id) FROM message"), "20000");
  EXPECT_EQ(value("SELECT abs((SELECT min(sent_at) FROM message) - (SELECT min(recorded_at) FROM "
                  "power_event)) <= 1100000"),
            "1");
  EXPECT_EQ(open(options())->counters(), counters) << "as before the restart";
}

TEST_F(StoreRetentionTest, RowsThatNoBackendHasHadGoLastAndAreReported) {
  auto limited = options();
  limited.remoteBackends = {"nats"};
  auto store = open(limited);
  fill(*store, 2000);
  store.reset();
  execute(
      "INSERT INTO backend_cursor VALUES('nats', 'message', 1000), ('nats', 'power_event', 200)");
  store = open(limited);
  fill(*store, 2300);
  store->close();
  EXPECT_GT(store->counters().dropped[StoreDrop::retention], 0U);
  EXPECT_EQ(value("SELECT count(*) FROM message WHERE id > 1000"), "3300");
  EXPECT_EQ(value("SELECT count(*) FROM power_event WHERE id > 200"), "230");
  EXPECT_THAT(LogRecorder::takeErrors(), ::testing::IsEmpty());
  store = open(limited);
  fill(*store, 10'000);
  store->close();
  EXPECT_LE(fileBytes(), kBound);
  EXPECT_THAT(LogRecorder::takeErrors(),
              ::testing::Contains(HasSubstr("rows were removed that no backend has had")));
}

TEST_F(StoreRetentionTest, AFileAboveALoweredBoundShrinks) {
  auto wide = options();
  wide.maximumBytes = 64 << 20;
  auto store = open(wide);
  fill(*store, 20'000);
  store.reset();
  ASSERT_GT(fileBytes(), kBound * 2);
  store = open(options());
  Await([&] { return std::stoull(value("PRAGMA page_count")) * 4096 <= kBound; });
  store.reset();
  EXPECT_LE(fileBytes(), kBound);
}

TEST_F(StoreRetentionTest, RowsPastTheirAgeGoAndTheirIDsAreNotGivenAgain) {
  auto store = open(options());
  Get(flush(*store, addSession(*store)));
  fill(*store, 1000);
  store.reset();
  now_ = Date{14 * 24h + 50s};
  store = open(options());
  sendAndAwait(*store, 1);
  Await([&] { return value("SELECT min(id) FROM message") == "500"; });
  EXPECT_EQ(value("SELECT count(*) FROM agent_session"), "0");
  store.reset();
  now_ = Date{30 * 24h};
  store = open(options());
  sendAndAwait(*store, 2);
  Await([&] { return store->counters().stored == 1; });
  store.reset();
  store = open(options());
  EXPECT_EQ(store->counters().accepted, 1102U);
  ASSERT_TRUE(send(*store, 3));
  EXPECT_EQ(addSession(*store), 2);
  store.reset();
  EXPECT_THAT(rows("SELECT id FROM message"), ElementsAre("1002", "1003"));
}

// A device's clock through some runs of the service. Each step sends three rows.
struct ClockStep {
  std::chrono::hours at;  // before or after a noon
  bool starts = false;    // the service
  int rows = 3;
  const char* left = nullptr;     // steps with rows left, then sessions
  std::chrono::hours slept = 0h;  // by the device, before this step
};
struct ClockCase {
  const char* name;
  std::vector<ClockStep> steps;
  int timesSet;
};
constexpr std::chrono::hours kNoon = 20'000 * 24h;
constexpr std::chrono::hours kYear = 365 * 24h;

const ClockCase kClockCases[] = {
    {"set by ten years and back, forward first and backward first",
     {{0h, true},
      {10 * kYear},
      {0h, false, 3, "1,2,3 0"},
      {0h, true},
      {-10 * kYear},
      {0h, false, 3, "1,2,3,4,5,6 0"}},
     4},
    // It begins in 1970 at each start, with a session, until it is told the time.
    {"no battery",
     {{-24h, true},
      {-kNoon, true},
      {0h, false, 0},
      {-kNoon + 1h, true},
      {2h},
      {3h, true},
      {13 * 24h + 1h, true, 3, "2,3,4,5,6 2"},
      {14 * 24h + 1h, true, 3, "3,4,5,6,7 1"},
      {14 * 24h + 3h, true, 3, "5,6,7,8 0"}},
     2},
    {"ahead by ten years for a day",
     {{0h, true},
      {10 * kYear},
      {5 * kYear, true},
      {1h, true},
      {14 * 24h + 2h, true, 6, "2,3,5,6 0"}},
     1},
    {"fourteen nights' sleep", {{0h, true}, {14 * 24h + 1h, false, 3, "2 0", 14 * 24h + 1h}}, 0},
};

TEST_F(StoreRetentionTest, RowsAgeByAClockThatIsSet) {
  for (const ClockCase& clock : kClockCases) {
    SCOPED_TRACE(clock.name);
    put({});
    LogRecorder::take();
    std::unique_ptr<TelemetryStore> store;
    for (const ClockStep& step : clock.steps) {
      if (step.starts) store.reset();
      asleep = asleep.load() + step.slept;
      now_ = Date{kNoon + step.at};
      if (step.starts) store = open(options());
      if (step.starts && step.at < -24h) Get(flush(*store, addSession(*store)));
      for (int i = 0; i < step.rows; ++i) sendAndAwait(*store, i);
      if (step.left == nullptr) continue;
      SCOPED_TRACE(fmt::format("{} are left", step.left));
      Await([&] {
        return step.left ==
               value(
                   "SELECT (SELECT group_concat((id + 2) / 3) FROM message WHERE id % 3 = 1) ||"
                   " ' ' || (SELECT count(*) FROM agent_session)");
      });
    }
    store.reset();
    EXPECT_EQ(value("SELECT count(*) FROM meta WHERE key LIKE 'clock%'"),
              clock.timesSet == 4 ? "2" : "0");
    int timesSet = 0;
    for (const auto& line : LogRecorder::take()) {
      EXPECT_NE(line.level, LogLevel::error) << line.message;
      timesSet += line.message.find("The clock was set") != std::string::npos ? 1 : 0;
    }
    EXPECT_EQ(timesSet, clock.timesSet);
  }
}

// Rows past their age are found, but before they are removed others come, and the clock was set.
TEST_F(StoreRetentionTest, AClockSetBeforeOldRowsWereRemovedRemovesNothing) {
  const Date noon{20'000 * 24h};
  std::atomic<int> looks = -1;  // counted from the first row on
  TelemetryStore::Options options = this->options();
  options.clock = [&, set = noon + 3650 * 24h] {
    // The first two: after the first row, and at the second one's commit.
    return looks < 0 || looks++ < 2 ? noon : set;
  };
  auto store = open(options);
  for (int i = 0; i < 10; ++i) sendAndAwait(*store, i);
  files_.hold();
  ASSERT_TRUE(send(*store, 10));
  Await([&] { return files_.holdsOne(); });
  ASSERT_TRUE(send(*store, 11));
  looks = 0;
  files_.release();
  Await([&] { return looks >= 3; });
  for (int i = 0; i < 100; ++i) {
    ASSERT_EQ(store->counters().dropped.sum(), 0U);
    std::this_thread::sleep_for(1ms);  // without rows, so that the writer takes steps of removal
  }
}

}  // namespace
}  // namespace quarvel::testing

extern "C" int clock_gettime(clockid_t clock, timespec* time) noexcept {
  using Function = int(clockid_t, timespec*);
  static auto* const real = reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, "clock_gettime"));
  const int result = real(clock, time);
  if (clock == CLOCK_BOOTTIME) time->tv_sec += quarvel::testing::asleep.load().count();
  return result;
}
