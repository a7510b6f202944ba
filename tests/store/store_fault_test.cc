#include <fmt/format.h>
#include <gmock/gmock.h>

#include <cstdlib>

#include "store/database/Sqlite.h"
#include "tests/Interposer.h"
#include "tests/LogRecorder.h"
#include "tests/store/StoreFixture.h"

namespace quarvel::testing {
namespace {

using namespace std::chrono_literals;
using Purpose = Interposer::Purpose;

/// Makes each call of a store for its files fail, one after the other, once or from then on.
class FaultTest : public StoreFixture {
 protected:
  FaultTest() : StoreFixture(true) {}

  TelemetryStore::Options options() const {
    return {.sync = sync_, .maximumBytes = 100'000, .logPages = 6, .firstBackOff = 1ms};
  }
  void begin(const Files& found) {
    put(found);
    LogRecorder::take();
    sent_ = 0;
  }
  void send(TelemetryStore& store, int rows) {
    for (int i = 0; i < rows; ++i) {
      ASSERT_TRUE(StoreFixture::send(
          store, Payload(Dictionary{{"n", ++sent_}, {"text", std::string(1500, 'x')}})));
    }
  }

  /// A store that a killed process has left behind, with a write-ahead log.
  Files leftBehind() {
    begin({});
    auto store = open(options());
    send(*store, 20);
    awaitStored(*store);
    Files left = files();
    left.erase("telemetry.db-shm");
    return left;
  }

  /// Runs a store with one fault. Returns whether a call failed.
  bool live(const Files& found, const Interposer::Fault& fault) {
    begin(found);
    Interposer& calls = Interposer::watch(directory_);
    calls.inject(fault);
    TelemetryStore::Options own = options();
    own.path = path_;
    auto opened = TelemetryStore::open(own);
    if (!opened) {
      EXPECT_THAT(opened.error().description(), ::testing::StartsWith("quarvel.store"));
      calls.lift();
      opened = open(own);
      if (opened.value() == nullptr) return true;
    }
    TelemetryStore& store = *opened.value();
    const std::int64_t session = addSession(store);
    send(store, 10);
    auto flushed = flush(store, session);
    Await([&] {
      return store.counters().waiting == 0 || calls.failedCalls() > 4 ||
             (!fault.forever && calls.failedCalls() > 0);
    });
    calls.lift();
    awaitStored(store);
    EXPECT_EQ(Get(flushed), std::nullopt);
    // Again, so that a fault that no call has met yet may hit the closing.
    if (calls.failedCalls() == 0) calls.inject(fault);
    send(store, 2);
    store.close();
    const bool struck = calls.failedCalls() > 0;
    calls.lift();
    Interposer::watch({});
    inspect(store.counters(), found.empty() ? 0 : 20);
    return struck;
  }

  void inspect(const StoreCounters& counters, std::uint64_t before) {
    const std::uint64_t lost = counters.dropped[StoreDrop::storeClosed];
    EXPECT_EQ(counters.accepted, before + 12);
    EXPECT_EQ(counters.accepted, counters.stored + counters.dropped.sum());
    EXPECT_LE(lost, 2U) << "only rows that came when the store was closed";
    EXPECT_EQ(counters.accepted, counters.stored + lost + counters.dropped[StoreDrop::retention]);
    SqliteConnection connection;
    ASSERT_TRUE(connection.open(path_)) << connection.message();
    EXPECT_EQ(connection.text("SELECT group_concat(integrity_check) FROM pragma_integrity_check"),
              "ok");
    // A commit whose sync fails is not counted, but its rows may be there.
    const auto accountedFor = static_cast<std::uint64_t>(
        connection
            .integer("SELECT (SELECT count(*) FROM message) +"
                     " ifnull((SELECT value FROM meta WHERE key = 'dropped.retention'), 0)")
            .value_or(0));
    EXPECT_GE(accountedFor, counters.accepted - lost);
    EXPECT_LE(accountedFor, counters.accepted);
    EXPECT_GE(connection.integer("SELECT max(payload ->> 'n') FROM message"), 12 - lost);
    EXPECT_EQ(connection.integer("SELECT count(flushed_at) FROM agent_session"), 1);
    for (const auto& entry : std::filesystem::directory_iterator(directory_)) {
      EXPECT_THAT(entry.path().string(), ::testing::Not(::testing::HasSubstr("corrupt")));
    }
  }

  std::chrono::milliseconds sync_ = 0ms;
  std::int64_t sent_ = 0;
};

TEST_F(FaultTest, AtNoCallIsARowLostOrTheServiceStuck) {
  struct Mode {
    const char* name;
    Interposer::Fault fault;
  };
  const Mode modes[] = {
      {"EIO once", {.error = EIO}},
      {"EIO from then on", {.error = EIO, .forever = true}},
      {"no room once", {.error = ENOSPC, .only = Purpose::write}},
      {"no room from then on", {.error = ENOSPC, .forever = true, .only = Purpose::write}},
      {"interrupted", {.error = EINTR}},
      {"a short write", {.error = 0, .only = Purpose::write}},
      {"no descriptor once", {.error = EMFILE, .only = Purpose::open}},
      {"no descriptor from then on", {.error = EMFILE, .forever = true, .only = Purpose::open}},
  };
  const Files found = leftBehind();
  struct Beginning {
    const char* name;
    const Files& found;
    std::chrono::milliseconds sync;
  };
  // Commits that do not sync by themselves have flushes synced beside the writer.
  const Files none;
  const Beginning beginnings[] = {{"a new store", none, 0ms},
                                  {"a store left behind", found, 0ms},
                                  {"a new store, flushed", none, 24h},
                                  {"a store left behind, flushed", found, 24h}};
  // Under valgrind, which takes forty times as long, every fourth.
  const std::size_t step = std::getenv("QUARVEL_VALGRIND") == nullptr ? 1 : 4;
  std::size_t points = 0;
  for (const Beginning& beginning : beginnings) {
    sync_ = beginning.sync;
    for (const Mode& mode : modes) {
      std::size_t at = 0;
      for (Interposer::Fault fault = mode.fault;; fault.at = at += step) {
        SCOPED_TRACE(fmt::format("{}, {}, call {}", beginning.name, mode.name, at));
        if (!live(beginning.found, fault)) break;
        ASSERT_FALSE(HasFailure()) << fmt::format("{}", fmt::join(LogRecorder::takeErrors(), "\n"));
      }
      fmt::print("faults, {}, {}: {} calls\n", beginning.name, mode.name, at);
      points += at / step;
    }
  }
  fmt::print("harness: faults of the store: {} points\n", points);
  EXPECT_GT(points, 500U);
}

}  // namespace
}  // namespace quarvel::testing
