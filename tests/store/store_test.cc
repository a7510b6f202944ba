#include "store/TelemetryStore.h"

#include <dlfcn.h>
#include <gmock/gmock.h>
#include <sys/stat.h>

#include <atomic>
#include <ctime>
#include <fstream>
#include <future>
#include <thread>

#include "store/StoreQueue.h"
#include "store/database/Sqlite.h"
#include "store/database/StoreFile.h"
#include "tests/LogRecorder.h"
#include "tests/store/FileCalls.h"
#include "tests/store/StoreFixture.h"

namespace quarvel::testing {
namespace {

using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::Field;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using namespace std::chrono_literals;

// How long the device has slept, as told to this program.
std::atomic<std::chrono::seconds> asleep{0s};

class StoreTest : public StoreFixture {
 protected:
  StoreTest() { LogRecorder::take(); }

  static Payload payload(std::int64_t number) { return Payload(Dictionary{{"n", number}}); }
  using StoreFixture::send;
  static Outcome send(TelemetryStore& store, std::int64_t number) {
    return send(store, payload(number));
  }
  static void sendAndAwait(TelemetryStore& store, std::int64_t number) {
    ASSERT_TRUE(send(store, number));
    awaitStored(store);
  }
  std::uintmax_t fileBytes() const { return std::filesystem::file_size(path_); }
};

MATCHER_P2(Dropped, reason, rows, "") {
  return arg.dropped[reason] == static_cast<std::uint64_t>(rows);
}
MATCHER(IsBalanced, "accepted = stored + waiting + dropped") {
  return arg.accepted == arg.stored + arg.waiting + arg.dropped.sum();
}

TEST_F(StoreTest, SaysWhatItIsAndGoesOnWhereItEnded) {
  const mode_t mask = umask(0077);
  auto store = open();
  umask(mask);
  struct stat status {};
  ASSERT_EQ(stat(path_.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777, 0640U);
  EXPECT_EQ(value("PRAGMA application_id"), std::to_string(0x51525654));
  EXPECT_EQ(value("PRAGMA user_version"), "1");
  EXPECT_EQ(value("PRAGMA journal_mode"), "wal");
  const std::string storeID = value("SELECT value FROM meta WHERE key = 'store_id'");
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
  EXPECT_EQ(value("SELECT value FROM meta WHERE key = 'store_id'"), storeID);
  EXPECT_THAT(rows("SELECT id, payload FROM message ORDER BY id"),
              ElementsAre(R"(1|{"n":1})", R"(2|{"n":2})"));
  EXPECT_FALSE(std::filesystem::exists(path_.string() + "-wal")) << "a closed store is one file";
}

// A store that cannot be used is left alone, and the reason says what to do.
TEST_F(StoreTest, RefusesWhatIsNotItsOwnAndSaysWhatToDo) {
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

TEST_F(StoreTest, OneWithAWrongBitInItsHeaderIsKeptAsideAndItsRowsAreInTheNewOne) {
  auto store = open();
  ASSERT_TRUE(send(*store, 1));
  store.reset();
  {
    std::fstream file(path_, std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(68);
    file << '\x11';  // one bit of the application's id: 0x51
  }
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

TEST_F(StoreTest, CorruptionMetLaterLosesNoRowOnItsWay) {
  Date now{0us};
  TelemetryStore::Options options{.ageing = 0ms, .clock = [&now] { return now; }};
  auto store = open(options);
  for (int i = 0; i < 20'000; ++i) ASSERT_TRUE(send(*store, i));
  store.reset();
  {
    std::fstream file(path_, std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(40 * 4096);
    file << std::string(40 * 4096, '\x5a');
  }
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

TEST_F(StoreTest, OneTransactionTakesWhatGatheredAndNoMoreThan1024Rows) {
  FileCalls& files = FileCalls::watch(directory_);
  auto store = open({.queueRows = 4000});
  const int before = files.counts().commits;
  for (int i = 0; i < 3; ++i) sendAndAwait(*store, i);
  EXPECT_EQ(files.counts().commits, before + 3) << "alone, a row is committed at once";

  files.hold();
  ASSERT_TRUE(send(*store, 3));
  Await([&] { return files.holdsOne(); });
  for (int i = 0; i < 2500; ++i) ASSERT_TRUE(send(*store, i));
  files.release();
  awaitStored(*store);
  EXPECT_EQ(files.counts().commits, before + 3 + 1 + 3);
}

TEST(StoreQueueTest, HoldsAsManyRowsAsAreCommittedInAFewMilliseconds) {
  StoreQueue queue(2048, std::size_t{1} << 30);
  const auto fill = [&queue] {
    std::size_t rows = 0;
    while (queue.pushIfRoom(AnalyticsEventRow{Payload(), Date{}}, {"event"})) ++rows;
    return rows;
  };
  const auto commit = [&queue](std::chrono::nanoseconds each) {
    StoreBatch batch;
    ASSERT_EQ(queue.take(batch, std::nullopt), StoreQueue::Take::rows);
    StoreQueue::Tally tally;
    for (const StoreRow& row : batch.rows()) tally.add(row);
    queue.committed(tally, each * static_cast<std::int64_t>(tally.rows));
  };
  const auto rowsAfter = [&](std::chrono::nanoseconds each, int commits) {
    std::size_t rows = 0;
    for (; commits > 0; --commits) {
      commit(each);
      rows = fill();
    }
    return rows;
  };
  EXPECT_EQ(fill(), 2048U);
  EXPECT_EQ(rowsAfter(1us, 1), 2048U);
  EXPECT_NEAR(static_cast<double>(rowsAfter(10us, 30)), 400, 20);
  // Seconds that a full disk took are no measure of what comes then.
  EXPECT_EQ(rowsAfter(100ms, 30), 128U);
  EXPECT_EQ(rowsAfter(1us, 20), 2048U);
}

TEST_F(StoreTest, HoldsSendersBackWhenSoManyBytesWait) {
  const Payload large(Dictionary{{"text", std::string(100'000, 'x')}});
  FileCalls& files = FileCalls::watch(directory_);
  auto store = open({.queueBytes = 1'000'000});
  files.hold();
  std::thread sender([&] {
    for (int i = 0; i < 300; ++i) ASSERT_TRUE(send(*store, large));
  });
  Await([&] { return store->counters().waiting == 10; });
  addSession(*store);  // is not held back
  EXPECT_EQ(store->counters().waiting, 10U);
  files.release();
  sender.join();
  store->close();
  EXPECT_EQ(store->counters().stored, 300U);
}

TEST_F(StoreTest, AFullDiskDelaysRowsAndLosesNone) {
  FileCalls& files = FileCalls::watch(directory_);
  auto store = open({.queueRows = 50});
  files.inject(FileCalls::fullDisk());
  std::thread sender([&] {
    for (int i = 0; i < 200; ++i) ASSERT_TRUE(send(*store, i));
  });
  Await([&] { return files.failedCalls() >= 3; });
  Await([&] { return store->counters().waiting == 50; });
  EXPECT_THAT(LogRecorder::takeErrors(), ElementsAre(AllOf(HasSubstr("fails"), HasSubstr("full"))))
      << "one line however often it is tried";
  files.lift();
  sender.join();
  store->close();
  EXPECT_THAT(store->counters(), AllOf(IsBalanced(), Field(&StoreCounters::stored, 200)));
  EXPECT_EQ(
      value(
          "SELECT count(*) || ' ' || max(id) || ' ' || sum(payload ->> 'n' = id - 1) FROM message"),
      "200 200 200");
}

TEST_F(StoreTest, ClosingOnAFullDiskCountsWhatIsLost) {
  FileCalls& files = FileCalls::watch(directory_);
  auto store = open({.queueRows = 5});
  sendAndAwait(*store, 0);
  files.inject(FileCalls::fullDisk());
  for (int i = 1; i <= 5; ++i) ASSERT_TRUE(send(*store, i));
  auto flushed = flush(*store, 1);
  auto heldBack = std::async(std::launch::async, [&] { return send(*store, 6); });
  Await([&] { return files.failedCalls() >= 1; });
  store->close();

  EXPECT_THAT(flushed.get()->description(), HasSubstr("quarvel.store 2"));
  const Outcome refused = heldBack.get();
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code, static_cast<std::int64_t>(StoreErrorCode::closed));
  EXPECT_THAT(store->counters(),
              AllOf(IsBalanced(), Field(&StoreCounters::stored, 1),
                    Dropped(StoreDrop::storeClosed, 5), Dropped(StoreDrop::refused, 1)));
  EXPECT_THAT(LogRecorder::takeErrors(), ElementsAre(HasSubstr("fails"), HasSubstr("5 are lost")));
}

TEST_F(StoreTest, AFlushCoversEverythingBeforeItWithOneSync) {
  FileCalls& files = FileCalls::watch(directory_);
  auto store = open({.sync = 24h, .clock = [] { return Date{5us}; }});
  const std::int64_t session = addSession(*store);
  for (int i = 0; i < 100; ++i) sendAndAwait(*store, i);
  const int unsynced = files.counts().logSyncs;
  EXPECT_LE(unsynced, 1) << "only a new log's head is synced";

  std::promise<std::vector<std::string>> seen;
  ASSERT_TRUE(send(*store, 100));
  ASSERT_TRUE(store->flush(session, [&](const std::optional<Error>& error) {
    EXPECT_EQ(error, std::nullopt);
    seen.set_value(rows("SELECT flushed_at, (SELECT count(*) FROM message) FROM agent_session"));
  }));
  EXPECT_THAT(seen.get_future().get(), ElementsAre("5|101"));
  EXPECT_GT(files.counts().logSyncs, unsynced);
}

TEST_F(StoreTest, RowsAreCommittedWhileTheMediumIsSlow) {
  FileCalls& files = FileCalls::watch(directory_);
  auto store = open({.sync = 24h, .logPages = 24});
  const std::int64_t session = addSession(*store);
  for (int i = 0; i < 3; ++i) sendAndAwait(*store, i);

  files.hold(FileCalls::Purpose::sync);
  auto flushed = flush(*store, session);
  Await([&] { return files.holdsOne(); });
  for (int i = 3; i < 6; ++i) sendAndAwait(*store, i);
  EXPECT_EQ(value("SELECT count(*) FROM message"), "6");
  EXPECT_EQ(flushed.wait_for(0s), std::future_status::timeout) << "it is not on the medium";
  auto flushedToo = flush(*store, session);
  files.release();
  EXPECT_EQ(flushed.get(), std::nullopt);
  EXPECT_EQ(flushedToo.get(), std::nullopt) << "what came meanwhile has a sync of its own";
  EXPECT_EQ(files.counts().unsynced, 0);

  // Moving the log into the file begins with a sync.
  files.hold(FileCalls::Purpose::sync);
  int sent = 6;
  while (!files.holdsOne()) sendAndAwait(*store, sent++);
  for (int i = 0; i < 3; ++i) sendAndAwait(*store, sent++);
  EXPECT_EQ(value("SELECT count(*) FROM message"), std::to_string(sent));
  files.release();
  store.reset();
  EXPECT_EQ(value("SELECT count(*) FROM message"), std::to_string(sent));
}

TEST_F(StoreTest, SyncsWithEachCommitOrOnceTheIntervalIsOver) {
  FileCalls& files = FileCalls::watch(directory_);
  auto store = open({.sync = 0ms});
  sendAndAwait(*store, 0);
  const FileCalls::Counts before = files.counts();
  for (int i = 0; i < 20; ++i) sendAndAwait(*store, i);
  EXPECT_EQ(files.counts().logSyncs - before.logSyncs, 20);
  store.reset();

  FileCalls::watch(directory_);
  store = open({.sync = 200ms});
  sendAndAwait(*store, 0);
  const int commits = files.counts().commits;
  // The new log's head, and what nobody asked for but the interval.
  Await([&] { return files.counts().logSyncs >= 2; });
  EXPECT_EQ(files.counts().commits, commits) << "a sync writes nothing";
}

TEST_F(StoreTest, ClosesOnceWithEverythingSafeAndRefusesAfterwards) {
  FileCalls& files = FileCalls::watch(directory_);
  auto store = open({.sync = 24h, .queueRows = 4000});
  files.hold();
  for (int i = 0; i < 3000; ++i) ASSERT_TRUE(send(*store, i));
  std::thread other([&] { store->close(); });
  Await([&] { return !store->isOpen(); });
  const Outcome late = send(*store, 3000);
  files.release();
  store->close();
  other.join();

  ASSERT_FALSE(late);
  EXPECT_EQ(late.error().domain, kStoreErrorDomain);
  EXPECT_FALSE(store->flush(1, [](const auto&) { FAIL() << "was refused"; }));
  EXPECT_THAT(store->counters(), AllOf(IsBalanced(), Field(&StoreCounters::stored, 3000),
                                       Dropped(StoreDrop::refused, 1)));
  EXPECT_EQ(value("SELECT count(*) FROM message"), "3000");
  EXPECT_GE(files.counts().logSyncs, 2);
}

TEST_F(StoreTest, ARowThatNoStoreCouldTakeHoldsUpNobody) {
  auto store = open();
  const Outcome refused =
      send(*store, Payload(Dictionary{{"text", std::string(kMostRowBytes, 'x')}}));
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code, static_cast<std::int64_t>(StoreErrorCode::tooLarge));
  ASSERT_TRUE(send(*store, 1));
  store->close();
  EXPECT_THAT(store->counters(), AllOf(IsBalanced(), Field(&StoreCounters::stored, 1),
                                       Dropped(StoreDrop::refused, 1)));
}

TEST_F(StoreTest, ManySendersLoseNothingAndEachKeepsItsOrder) {
  constexpr int kSenders = 4;
  constexpr int kRows = 5000;
  auto store = open({.queueRows = 512});
  std::vector<std::thread> senders;
  for (int sender = 0; sender < kSenders; ++sender) {
    senders.emplace_back([&store, sender] {
      for (int i = 0; i < kRows; ++i) {
        ASSERT_TRUE(send(*store, Payload(Dictionary{{"n", i}, {"sender", sender}})));
      }
    });
  }
  for (std::thread& sender : senders) sender.join();
  store->close();
  EXPECT_THAT(store->counters(),
              AllOf(IsBalanced(), Field(&StoreCounters::stored, kSenders * kRows)));
  EXPECT_EQ(value("SELECT count(*) FROM (SELECT payload ->> 'n' AS n, row_number()"
                  " OVER (PARTITION BY payload ->> 'sender' ORDER BY id) AS nth FROM message) "
                  "WHERE n = nth - 1"),
            std::to_string(kSenders * kRows));
}

TEST_F(StoreTest, AFileThatIsTakenAwayIsPutBackWithAllThatWasInIt) {
  auto store = open();
  for (int i = 1; i <= 100; ++i) sendAndAwait(*store, i);
  const std::string storeID = value("SELECT value FROM meta WHERE key = 'store_id'");
  std::filesystem::remove_all(directory_);
  sendAndAwait(*store, 101);
  sendAndAwait(*store, 102);
  struct stat status {};
  ASSERT_EQ(stat(directory_.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777, 0750U);
  EXPECT_EQ(value("SELECT count(*) FROM message"), "102");

  // Another store stands there: what was in the first comes into it, as far as ids are free.
  const std::filesystem::path away = directory_.string() + "-away";
  std::filesystem::rename(directory_, away);
  std::filesystem::create_directory(directory_);
  open().reset();
  for (int i = 103; i <= 110; ++i) sendAndAwait(*store, i);
  store->close();
  std::filesystem::remove_all(away);
  EXPECT_EQ(value("SELECT count(*) || ' ' || max(payload ->> 'n') FROM message"), "110 110");
  EXPECT_EQ(value("SELECT value FROM meta WHERE key = 'store_id'"), storeID);
  EXPECT_EQ(value("PRAGMA integrity_check"), "ok");
  EXPECT_THAT(store->counters(), AllOf(IsBalanced(), Field(&StoreCounters::stored, 110)));
}

TEST_F(StoreTest, OpensLaterWhenTheDiskHasNoRoomAtFirst) {
  auto store = open();
  EXPECT_EQ(addSession(*store), 1);
  store.reset();

  FileCalls& files = FileCalls::watch(directory_);
  files.inject(FileCalls::fullDisk());
  store = open({.firstBackOff = 1ms});
  EXPECT_THAT(store->state().problem.value_or(""), HasSubstr("quarvel.store"));
  const std::int64_t second = addSession(*store);
  ASSERT_TRUE(store->addMessage({second, 1, "client", "service", 1, 2, payload(1)}));
  auto flushed = flush(*store, second);
  Await([&] { return files.failedCalls() >= 3; });
  files.lift();
  EXPECT_EQ(flushed.get(), std::nullopt);
  EXPECT_EQ(store->state().problem, std::nullopt);
  store->close();
  EXPECT_THAT(rows("SELECT m.agent_session, s.id, s.flushed_at > 0 FROM message m, agent_session s"
                   " WHERE s.id > 1"),
              ElementsAre("2|2|1"));
}

// Nobody else can end the reader's transaction. So the disk holds, and once it has ended all goes
// on.
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
  EXPECT_GT(fileBytes(), kBound * 3 / 4) << "no more goes than must";
  const StoreCounters counters = store->counters();
  EXPECT_THAT(counters, AllOf(IsBalanced(), Field(&StoreCounters::accepted, 22'000)));
  EXPECT_EQ(value("SELECT (SELECT count(*) FROM message) + (SELECT count(*) FROM power_event)"),
            std::to_string(counters.stored));
  // The ages at which the tables begin are those of one and the same cut.
  EXPECT_EQ(value("SELECT max(id) FROM message"), "20000");
  EXPECT_EQ(value("SELECT abs((SELECT min(sent_at) FROM message) - (SELECT min(recorded_at) FROM "
                  "power_event))"
                  " <= 1100000"),
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
  flush(*store, addSession(*store)).wait();
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

TEST_F(StoreRetentionTest, AClockSetByTenYearsEmptiesNothing) {
  const Date noon{20'000 * 24h};
  FileCalls& files = FileCalls::watch(directory_);
  for (const auto step : {3650 * 24h, -3650 * 24h}) {
    now_ = noon;
    auto store = open(options());
    const std::uint64_t before = store->counters().stored;
    for (int i = 0; i < 10; ++i) sendAndAwait(*store, i);
    // Set while a row is written, so that the clock is looked at once after it.
    for (const Date set : {noon + step, noon}) {
      files.hold();
      ASSERT_TRUE(send(*store, 10));
      Await([&] { return files.holdsOne(); });
      now_ = set;
      files.release();
      awaitStored(*store);
    }
    store->close();
    EXPECT_EQ(store->counters().stored, before + 12);
    EXPECT_THAT(LogRecorder::takeErrors(), ::testing::IsEmpty());
  }
}

// Beginning in 1970 with each start, until it is told the time.
TEST_F(StoreRetentionTest, RowsOfADeviceWithoutAClockLiveAsLongAsOthers) {
  const Date noon{20'000 * 24h};
  const auto run = [&](std::initializer_list<Date> dates) {
    now_ = *dates.begin();
    auto store = open(options());
    if (now_.load() < noon - 24h) flush(*store, addSession(*store)).wait();
    for (const Date date : dates) {
      now_ = date;
      for (int i = 0; i < 3; ++i) sendAndAwait(*store, i);
    }
    return store;
  };
  const auto firstMessage = [this] { return value("SELECT min(id) FROM message"); };
  run({noon - 24h});
  auto store = run({Date{0us}});
  now_ = noon;  // and nothing comes any more
  store.reset();
  run({Date{5s}, noon + 2h});
  run({noon + 3h});

  store = run({noon + 13 * 24h + 1h});
  Await([&] { return firstMessage() == "4"; });
  EXPECT_EQ(value("SELECT count(*) FROM agent_session"), "2");
  store.reset();
  store = run({noon + 14 * 24h + 1h});
  Await([&] { return firstMessage() == "7"; });
  EXPECT_EQ(value("SELECT count(*) FROM agent_session"), "1");
  store.reset();
  store = run({noon + 14 * 24h + 3h});
  Await([&] { return firstMessage() == "13"; });
  EXPECT_EQ(value("SELECT count(*) FROM agent_session"), "0");
  EXPECT_EQ(value("SELECT count(*) FROM meta WHERE key LIKE 'clock%'"), "0");
}

TEST_F(StoreRetentionTest, AClockThatWasAheadHoldsNoRowBackLongerThanOthers) {
  const Date noon{20'000 * 24h};
  now_ = noon;
  auto store = open(options());
  sendAndAwait(*store, 1);
  now_ = noon + 3650 * 24h;
  sendAndAwait(*store, 2);
  for (const Date date : {noon + 1825 * 24h, noon + 1h, noon + 14 * 24h + 2h}) {
    store.reset();
    now_ = date;
    store = open(options());
    sendAndAwait(*store, 3);
  }
  for (int i = 6; i <= 8; ++i) sendAndAwait(*store, i);
  Await([&] { return value("SELECT group_concat(id) FROM message") == "2,3,5,6,7,8"; });
}

TEST_F(StoreRetentionTest, ADeviceThatSleptHasNotSetItsClock) {
  auto store = open(options());
  sendAndAwait(*store, 1);
  const auto nights = 14 * 24h + 1s;
  asleep = asleep.load() + nights;
  now_ = now_.load() + nights;
  sendAndAwait(*store, 2);
  Await([&] { return value("SELECT min(id) FROM message") == "2"; });
}

// Rows are to be removed for their age, but others come first, and then the clock is found to be
// set.
TEST_F(StoreRetentionTest, AClockSetBeforeOldRowsWereRemovedRemovesNothing) {
  const Date noon{20'000 * 24h};
  std::atomic<int> looks = -1;  // counted once the first row is being written
  TelemetryStore::Options options = this->options();
  options.clock = [&, set = noon + 3650 * 24h] {
    // After the first row, at the second one's writing and after it.
    return looks < 0 || looks++ < 2 ? noon : set;
  };
  FileCalls& files = FileCalls::watch(directory_);
  auto store = open(options);
  for (int i = 0; i < 10; ++i) sendAndAwait(*store, i);
  files.hold();
  ASSERT_TRUE(send(*store, 10));
  Await([&] { return files.holdsOne(); });
  ASSERT_TRUE(send(*store, 11));
  looks = 0;
  files.release();
  Await([&] { return looks >= 3; });
  for (int i = 0; i < 100; ++i) {
    ASSERT_EQ(store->counters().dropped.sum(), 0U);
    std::this_thread::sleep_for(1ms);
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
