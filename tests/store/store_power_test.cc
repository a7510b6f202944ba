#include <fcntl.h>
#include <fmt/format.h>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <optional>
#include <random>

#include "base/Files.h"
#include "store/database/Sqlite.h"
#include "tests/Interposer.h"
#include "tests/LogRecorder.h"
#include "tests/store/PowerCut.h"
#include "tests/store/StoreFixture.h"

namespace quarvel::testing {
namespace {

using namespace std::chrono_literals;

std::size_t ImagesWanted() {
  const char* nightly = std::getenv("QUARVEL_NIGHTLY");
  return nightly != nullptr && std::string_view(nightly) == "1" ? 100'000 : 5'000;
}

/// Cuts the power at every moment of some runs of the store, and opens the files that are left.
///
/// Each row holds its number; the marks of a record tell up to which number rows are promised.
class PowerTest : public StoreFixture {
 protected:
  PowerTest() : StoreFixture(true) {}

  using Record = std::vector<Interposer::Change>;

  /// The work on a store between its opening and its end.
  struct Run {
    const char* name;
    TelemetryStore::Options options;
    void (*work)(PowerTest& test);
  };
  static const std::vector<Run>& runs();

  void start() { store_ = open(options_); }
  void send(int rows, std::size_t length = 20) {
    for (int i = 0; i < rows; ++i) {
      ASSERT_TRUE(StoreFixture::send(
          *store_, Payload(Dictionary{{"n", ++sent_}, {"text", std::string(length, 'x')}})));
    }
  }
  void awaitStored() { StoreFixture::awaitStored(*store_); }
  void flush() { Get(StoreFixture::flush(*store_, addSession(*store_))); }
  /// Everything sent so far must survive.
  void promise() { files_->mark(sent_); }
  void failNextSync() { files_->inject({.error = EIO, .only = Interposer::Purpose::sync}); }
  void end() {
    store_.reset();
    promise();
  }

  Record record(const Run& run) {
    put({});
    options_ = run.options;
    sent_ = 0;
    files_ = &Interposer::watch(directory_);
    files_->record();
    start();
    run.work(*this);
    end();
    Record record = files_->takeRecord();
    Interposer::watch({});
    return record;
  }

  /// Opens the store that the files of an image make. Returns the damage, none when there is none.
  std::optional<std::string> broken(const PowerCut::Image& image, off_t promised) {
    put(image);
    LogRecorder::take();
    store_ = open(options_);
    if (store_ == nullptr) return "it cannot be opened";
    const std::int64_t counted = static_cast<std::int64_t>(store_->counters().stored);
    sent_ = -2;
    send(1);
    store_.reset();
    if (const auto errors = LogRecorder::takeErrors(); !errors.empty()) return errors.front();
    SqliteConnection connection;
    if (!connection.open(path_)) return connection.message();
    const auto found =
        connection.text("SELECT group_concat(integrity_check) FROM pragma_integrity_check");
    if (found != "ok") return found.value_or(connection.message());
    const auto rows = connection.text(
        "SELECT count(*) || ' ' || ifnull(max(payload ->> 'n'), 0) || ' ' ||"
        " ifnull(max(payload ->> 'n') - min(payload ->> 'n') + 1, 0)"
        " FROM message WHERE payload ->> 'n' > 0");
    std::int64_t count = 0;
    std::int64_t last = 0;
    std::int64_t span = 0;
    std::istringstream(rows.value_or("")) >> count >> last >> span;
    if (last < promised) return fmt::format("row {} is promised, {} is the last", promised, last);
    if (span != count) return fmt::format("{} rows of {} are there", count, span);
    if (counted != count) return fmt::format("{} rows are counted, {} are there", counted, count);
    return std::nullopt;
  }

  struct Tally {
    std::size_t images = 0;
    std::size_t moments = 0;
    std::size_t broken = 0;
  };
  /// Opens so many images of one run, as many for each moment.
  Tally cutEverywhere(const Run& run, std::size_t images) {
    const Record record = this->record(run);
    const std::size_t each = std::max(images / record.size() + 1, std::size_t{3});
    std::mt19937 random(20'260'131);
    Tally tally;
    for (PowerCut cut(record); cut.advance(); ++tally.moments) {
      for (std::size_t i = 0; i < each; ++i, ++tally.images) {
        const auto survival =
            i < 2 ? static_cast<PowerCut::Survival>(i) : PowerCut::Survival::anything;
        const auto fault = broken(cut.image(survival, random), cut.promised());
        if (!fault) continue;
        if (++tally.broken > 5) continue;
        ADD_FAILURE() << run.name << ", moment " << tally.moments << ", image " << i << ": "
                      << *fault;
      }
    }
    return tally;
  }

  static constexpr off_t kDamaged = 1'000'000;  // the mark of a file that has been damaged
  static void replaceADamagedOne(PowerTest& test) {
    test.send(200, 200);
    test.end();
    const int file = ::open(test.path_.c_str(), O_RDWR);
    const std::string page(4096, 'x');
    ASSERT_EQ(::pwrite64(file, page.data(), page.size(), 12 * 4096), 4096);
    ::fsync(file);
    ::close(file);
    test.files_->mark(kDamaged);
    test.start();
    test.send(1);
  }

  TelemetryStore::Options options_;
  std::unique_ptr<TelemetryStore> store_;
  Interposer* files_ = nullptr;
  std::int64_t sent_ = 0;
};

const std::vector<PowerTest::Run>& PowerTest::runs() {
  // A short log, so that it is moved into the file often.
  static const std::vector<Run> kRuns = {
      {"flushes",
       {.sync = 24h, .logPages = 12},
       [](PowerTest& test) {
         for (int i = 0; i < 5; ++i) {
           test.send(7);
           test.flush();
           test.promise();
         }
         test.end();
         test.start();
         test.send(3);
       }},
      {"rows that come while the medium is slow",
       {.sync = 24h, .logPages = 12},
       [](PowerTest& test) {
         const std::int64_t session = addSession(*test.store_);
         for (int i = 0; i < 8; ++i) {
           test.send(3);
           const std::int64_t promised = test.sent_;
           test.files_->hold(Interposer::Purpose::sync);
           auto flushed = StoreFixture::flush(*test.store_, session);
           Await([&] { return test.files_->holdsOne(); });
           test.send(2);
           // Unless the writer itself waits for the sync, to begin the log again.
           const auto meanwhile = std::chrono::steady_clock::now() + 20ms;
           Await([&] {
             return test.store_->counters().waiting == 0 ||
                    std::chrono::steady_clock::now() > meanwhile;
           });
           test.files_->release();
           Get(flushed);
           test.files_->mark(promised);
         }
       }},
      {"each commit",
       {.sync = 0ms, .logPages = 12},
       [](PowerTest& test) {
         for (int i = 0; i < 15; ++i) {
           test.send(1);
           test.awaitStored();
           test.promise();
         }
       }},
      {"intervals",
       {.sync = 5ms, .logPages = 12},
       [](PowerTest& test) {
         for (int i = 0; i < 5; ++i) {
           for (int burst = 0; burst < 3; ++burst) {
             test.send(2);
             test.awaitStored();
           }
           Await([&] { return test.files_->counts().unsynced == 0; });
           test.promise();
         }
       }},
      {"long rows, removed when they are old",
       {.sync = 24h, .maximumBytes = 120'000, .logPages = 24},
       [](PowerTest& test) {
         for (int i = 0; i < 4; ++i) {
           test.send(4, 9000);
           test.flush();
           test.promise();
         }
       }},
      {"an interval's sync fails",
       {.sync = 5ms, .logPages = 12, .firstBackOff = 1ms},
       [](PowerTest& test) {
         for (int i = 0; i < 6; ++i) {
           test.send(2);
           test.awaitStored();
           test.failNextSync();
           test.send(2);
           test.awaitStored();
           Await([&] { return test.files_->counts().unsynced == 0; });
           test.promise();
         }
       }},
      {"a flush's sync fails beside a reader",
       {.sync = 24h, .logPages = 40, .firstBackOff = 1ms},
       [](PowerTest& test) {
         test.send(3);
         test.flush();
         SqliteConnection reader;
         ASSERT_TRUE(reader.open(test.path_));
         ASSERT_TRUE(reader.execute("BEGIN; SELECT count(*) FROM message"));
         for (int i = 0; i < 6; ++i) {
           test.send(2);
           test.awaitStored();
           test.failNextSync();
           test.send(2);
           test.flush();
           test.promise();
         }
         test.end();  // the reader stays until then
       }},
  };
  return kRuns;
}

TEST_F(PowerTest, NoCutLosesAPromisedRowOrCorruptsTheStore) {
  Tally all;
  for (const Run& run : runs()) {
    const Tally tally = cutEverywhere(run, ImagesWanted() / runs().size());
    all.images += tally.images;
    all.moments += tally.moments;
    all.broken += tally.broken;
    fmt::print("power cut, {}: {} images of {} moments\n", run.name, tally.images, tally.moments);
  }
  fmt::print("harness: power cut: {} images of {} moments, {} broken\n", all.images, all.moments,
             all.broken);
  EXPECT_EQ(all.broken, 0U);
}

// The damaged file is renamed and a new one filled from it: an interruption loses no readable row.
TEST_F(PowerTest, NoCutLosesARowThatASalvageCanRead) {
  const Run run{"salvage", {.logPages = 12}, replaceADamagedOne};
  const Record record = this->record(run);
  const std::int64_t expected =
      std::stoll(value("SELECT count(*) FROM message WHERE payload ->> 'n' <= 200"));
  ASSERT_GT(expected, 150);
  ASSERT_LT(expected, 200);
  std::mt19937 random(20'260'131);
  std::size_t images = 0;
  std::size_t moments = 0;
  for (PowerCut cut(record); cut.advance();) {
    if (cut.promised() != kDamaged) continue;
    for (int i = 0; i < 6; ++i, ++images) {
      const auto survival = static_cast<PowerCut::Survival>(std::min(i, 2));
      put(cut.image(survival, random));
      store_ = open(options_);
      ASSERT_NE(store_, nullptr);
      store_.reset();
      // All of them where the log of the first run has survived, which still holds the page.
      ASSERT_GE(std::stoll(value("SELECT count(*) FROM message WHERE payload ->> 'n' <= 200")),
                expected)
          << "moment " << moments << ", image " << i;
    }
    ++moments;
  }
  fmt::print("harness: power cut, salvage: {} images of {} moments\n", images, moments);
}

// Files that are replaced in one step: a renamed file without its content would be neither.
TEST_F(PowerTest, AReplacedFileHasTheOldContentOrTheNew) {
  put({});
  Interposer& files = Interposer::watch(directory_);
  files.record();
  const std::filesystem::path file = directory_ / "status.json";
  const std::string contents[] = {std::string(9'000, 'a'), std::string(3'000, 'b')};
  for (const std::string& content : contents) ASSERT_TRUE(ReplaceFile(file.native(), content));
  const Record record = files.takeRecord();
  std::mt19937 random(20'260'131);
  std::size_t found = 0;
  for (PowerCut cut(record); cut.advance();) {
    for (int i = 0; i < 20; ++i) {
      const auto image = cut.image(static_cast<PowerCut::Survival>(std::min(i, 2)), random);
      const auto replaced = image.find("status.json");
      if (replaced == image.end()) continue;
      ++found;
      ASSERT_TRUE(replaced->second == contents[0] || replaced->second == contents[1])
          << replaced->second.size() << " bytes";
    }
  }
  EXPECT_GT(found, 20U);
}

}  // namespace
}  // namespace quarvel::testing
