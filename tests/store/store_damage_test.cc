#include <fmt/format.h>
#include <gmock/gmock.h>

#include <algorithm>
#include <functional>
#include <random>

#include "store/database/StoreFile.h"
#include "tests/LogRecorder.h"
#include "tests/store/StoreFixture.h"

namespace quarvel::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using namespace std::chrono_literals;

constexpr std::size_t kPage = 4096;
constexpr int kRows = 3'000;

/// Stores whose files are damaged.
class DamageTest : public StoreFixture {
 protected:
  DamageTest() : StoreFixture(true) { LogRecorder::take(); }

  static void send(TelemetryStore& store, std::int64_t number) {
    ASSERT_TRUE(
        StoreFixture::send(store, Payload(Dictionary{{"n", number}, {"route", "BuiltInSpeaker"}})));
  }
  void fill() {
    auto store = open();
    for (int i = 0; i < 20; ++i) addSession(*store, i);
    for (int i = 1; i <= kRows; ++i) send(*store, i);
    awaitStored(*store);
    leftBehind_ = files();
    leftBehind_.erase("telemetry.db-shm");
    store.reset();
    closed_ = files();
  }
  std::int64_t intactRows() {
    return std::stoll(
        value("SELECT count(*) FROM message WHERE payload = '{\"n\":' || id ||"
              " ',\"route\":\"BuiltInSpeaker\"}' AND category = 1 AND type = 2"));
  }

  Files closed_, leftBehind_;
};

using Random = std::mt19937;
struct Damage {
  const char* name;
  void (*inflict)(std::string& content, Random& random);
};

void Flip(std::string& content, Random& random) {
  content[random() % content.size()] ^= static_cast<char>(1U << random() % 8);
}
char* RandomPage(std::string& content, Random& random) {
  return &content[random() % (content.size() / kPage) * kPage];
}

const Damage kDamages[] = {
    {"a bit flipped", Flip},
    {"ten bits flipped",
     [](auto& content, auto& random) {
       for (int i = 0; i < 10; ++i) Flip(content, random);
     }},
    {"a page overwritten",
     [](auto& content, auto& random) {
       std::generate_n(RandomPage(content, random), kPage, std::ref(random));
     }},
    {"a page of zeros",
     [](auto& content, auto& random) { std::fill_n(RandomPage(content, random), kPage, '\0'); }},
    {"cut short", [](auto& content, auto& random) { content.resize(random() % content.size()); }},
};

TEST_F(DamageTest, AStoreAlwaysOpensAndKeepsReadableRows) {
  fill();
  const int cases = IsNightly() ? 4'000 : 200;
  Random random(20'260'131);
  for (const Damage& damage : kDamages) {
    int setAside = 0;
    std::int64_t kept = 0;
    for (int i = 0; i < cases; ++i) {
      SCOPED_TRACE(fmt::format("{} {}", damage.name, i));
      // Every fourth is a store that was left behind, with its log, and either of them is damaged.
      Files found = i % 4 == 0 ? leftBehind_ : closed_;
      damage.inflict(found[i % 8 == 0 ? "telemetry.db-wal" : "telemetry.db"], random);
      put(found);
      auto store = open();
      ASSERT_NE(store, nullptr);
      send(*store, 0);
      awaitStored(*store);
      store->close();
      const StoreCounters counters = store->counters();
      EXPECT_EQ(counters.accepted, counters.stored + counters.dropped.sum());
      for (const auto& file : StoresSetAside(path_)) {
        ++setAside;
        EXPECT_EQ(files()[file.filename()], found["telemetry.db"])
            << "a file that is set aside stays as it is";
        EXPECT_EQ(value("SELECT count(*) FROM message"), std::to_string(counters.stored));
        EXPECT_EQ(value("PRAGMA integrity_check"), "ok");
      }
      EXPECT_EQ(value("SELECT count(*) FROM message"
                      " WHERE payload = '{\"n\":0,\"route\":\"BuiltInSpeaker\"}'"),
                "1");
      kept += intactRows();
      if (HasFailure()) return;
    }
    fmt::print(
        "harness: damage, {}: {} stores opened, {} of them set aside, {:.1f} % of the rows kept\n",
        damage.name, cases, setAside,
        100.0 * static_cast<double>(kept) / (static_cast<double>(cases) * kRows));
  }
}

TEST_F(DamageTest, OnlyTheRowsOfADamagedPageAreLostAndNamesStay) {
  fill();
  const std::string storeID = this->storeID();
  // The middle leaf of the table of messages: header byte 13, cells counted in bytes 3 and 4.
  std::string& content = closed_["telemetry.db"];
  std::vector<std::size_t> leaves;
  const auto cells = [bytes = reinterpret_cast<const unsigned char*>(content.data())](auto page) {
    const auto* head = bytes + page * kPage;
    return head[0] == 13 ? head[3] * 256 + head[4] : 0;
  };
  for (std::size_t page = 1; page < content.size() / kPage; ++page) {
    if (cells(page) > 40) leaves.push_back(page);
  }
  ASSERT_GT(leaves.size(), 20U);
  const std::size_t page = leaves[leaves.size() / 2];
  const auto lost = static_cast<std::uint64_t>(cells(page));
  content.replace(page * kPage, kPage, kPage, '\x5a');
  put(closed_);
  auto store = open();
  EXPECT_EQ(store->counters().dropped[StoreDrop::damaged], lost);
  EXPECT_EQ(store->counters().stored, kRows - lost);
  EXPECT_EQ(addSession(*store), 21);
  send(*store, kRows + 1);
  store.reset();
  EXPECT_EQ(intactRows(), static_cast<std::int64_t>(kRows + 1 - lost));
  EXPECT_EQ(value("SELECT count(*) FROM agent_session"), "21");
  EXPECT_EQ(this->storeID(), storeID);
  // The counters hold after a restart, and nothing is salvaged twice.
  LogRecorder::take();
  store = open();
  EXPECT_EQ(store->counters().accepted, kRows + 1U);
  EXPECT_EQ(store->counters().dropped[StoreDrop::damaged], lost);
  EXPECT_THAT(LogRecorder::takeErrors(), ::testing::IsEmpty());
}

}  // namespace
}  // namespace quarvel::testing
