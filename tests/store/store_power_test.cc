#include <fcntl.h>
#include <fmt/format.h>
#include <gmock/gmock.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <optional>
#include <random>
#include <sstream>

#include "base/Files.h"
#include "store/database/Sqlite.h"
#include "tests/Interposer.h"
#include "tests/LogRecorder.h"
#include "tests/store/StoreFixture.h"

namespace quarvel::testing {
namespace {

using namespace std::chrono_literals;

/// Walks through a record of changes and makes images of the medium after a power cut. One thread.
///
/// An image holds all changes from before the beginning of a sync that has ended. Any other change
/// of a file may be missing, whether or not newer ones are there, and any part of a write, in
/// sectors of 512 bytes. The first few changes of names are there: journaling file systems keep
/// their order. After a failed sync the changes before it are never durable: the system has dropped
/// the pages that it could not write.
class PowerCut {
 public:
  using Change = Interposer::Change;
  using Kind = Change::Kind;

  explicit PowerCut(const std::vector<Change>& record) : record_(record), next_(record.begin()) {}

  /// Goes on to the moment after the next change; false at the end.
  bool advance() {
    if (next_ == record_.end()) return false;
    const Change& change = *next_++;
    if (change.path.ends_with("-shm")) return true;  // shared memory never reaches a medium
    switch (change.kind) {
      case Kind::mark:
        promised_ = change.offset;
        break;
      case Kind::create:
        files_.emplace_back();
        [[fallthrough]];
      case Kind::rename:
      case Kind::remove:
        pendingNames_.emplace_back(&change, files_.size() - 1);
        applyName(names_, change, files_.size() - 1);
        break;
      case Kind::write:
      case Kind::truncate:
        files_[names_.at(change.path)].pending.push_back({&change});
        break;
      case Kind::sync:
        if (const auto file = names_.find(change.path); file != names_.end()) {
          syncFile(files_[file->second], change);
        } else if (!change.failed) {
          safeNames_ = names_;
          pendingNames_.clear();
        }
        break;
    }
    return true;
  }

  enum class Survival { everything, nothing, anything };
  /// Names and contents of the files.
  using Image = std::map<std::string, std::string>;
  [[nodiscard]] Image image(Survival survival, std::mt19937& random) const {
    const auto oneOf = [&random](std::size_t count) { return random() % count; };
    Names names = safeNames_;
    std::size_t kept = pendingNames_.size();
    if (survival == Survival::nothing) kept = 0;
    if (survival == Survival::anything) kept = oneOf(kept + 1);
    for (std::size_t i = 0; i < kept; ++i) {
      applyName(names, *pendingNames_[i].first, pendingNames_[i].second);
    }
    Image image;
    for (const auto& [name, number] : names) {
      std::string content = files_[number].safe;
      // Some of the time, one file is all there and another is not.
      const std::size_t tendency = oneOf(4);
      for (const Pending& pending : files_[number].pending) {
        const std::size_t fate = tendency < 2 ? tendency : oneOf(3);
        const bool isAnything = survival == Survival::anything;
        if (pending.safe || survival == Survival::everything || (isAnything && fate == 1)) {
          apply(content, *pending.change);
        } else if (isAnything && fate == 2) {
          applyTorn(content, *pending.change, random);
        }
      }
      image.emplace(std::filesystem::path(name).filename(), std::move(content));
    }
    return image;
  }
  /// The promise at this moment.
  [[nodiscard]] off_t promised() const { return promised_; }

 private:
  struct Pending {
    const Change* change;
    bool dropped = false;  // by a sync that failed
    bool safe = false;
  };
  struct File {
    std::string safe;
    std::vector<Pending> pending;
  };
  using Names = std::map<std::string, std::size_t>;

  void syncFile(File& file, const Change& sync) const {
    for (Pending& pending : file.pending) {
      if (pending.change >= record_.data() + sync.begun) break;
      if (sync.failed && !pending.safe) pending.dropped = true;
      if (!sync.failed && !pending.dropped) pending.safe = true;
    }
    const auto firstUnsafe = std::ranges::find(file.pending, false, &Pending::safe);
    std::for_each(file.pending.begin(), firstUnsafe,
                  [&file](const Pending& pending) { apply(file.safe, *pending.change); });
    file.pending.erase(file.pending.begin(), firstUnsafe);
  }
  static void applyName(Names& names, const Change& change, std::size_t created) {
    if (change.kind == Kind::create) {
      names[change.path] = created;
    } else if (auto old = names.extract(change.path); old && change.kind == Kind::rename) {
      names[change.text] = old.mapped();
    }
  }
  static void apply(std::string& content, const Change& change) {
    const auto offset = static_cast<std::size_t>(change.offset);
    if (change.kind == Kind::truncate) return content.resize(offset);
    content.resize(std::max(content.size(), offset + change.text.size()));
    content.replace(offset, change.text.size(), change.text);
  }
  static void applyTorn(std::string& content, const Change& change, std::mt19937& random) {
    constexpr std::size_t kSector = 512;
    if (change.kind == Kind::truncate) return;
    const auto begin = static_cast<std::size_t>(change.offset);
    const std::size_t end = begin + change.text.size();
    for (std::size_t at = begin, next = 0; at < end; at = next) {
      next = std::min((at / kSector + 1) * kSector, end);
      if (random() % 2 != 0) continue;
      content.resize(std::max(content.size(), next));
      content.replace(at, next - at, change.text, at - begin, next - at);
    }
  }

  const std::vector<Change>& record_;
  std::vector<Change>::const_iterator next_;
  off_t promised_ = 0;
  std::vector<File> files_;
  Names names_;      // as the program sees them
  Names safeNames_;  // as they are on the medium
  std::vector<std::pair<const Change*, std::size_t>> pendingNames_;
};

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
  static const Run kRuns[];

  void start() { store_ = open(options_); }
  void send(int rows, std::size_t length = 20) {
    for (int i = 0; i < rows; ++i) {
      ASSERT_TRUE(StoreFixture::send(
          *store_, Payload(Dictionary{{"n", ++sent_}, {"text", std::string(length, 'x')}})));
    }
  }
  void sendAndAwait(int rows) {
    send(rows);
    awaitStored(*store_);
  }
  /// Everything sent so far must survive.
  void promise() { files_->mark(sent_); }
  void flushAndPromise() {
    Get(flush(*store_, addSession(*store_)));
    promise();
  }
  void awaitSyncAndPromise() {
    Await([this] { return files_->counts().unsynced == 0; });
    promise();
  }
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
    std::int64_t count = 0, last = 0, span = 0;
    std::istringstream(rows.value_or("")) >> count >> last >> span;
    if (last < promised) return fmt::format("row {} is promised, {} is the last", promised, last);
    if (span != count) return fmt::format("{} rows of {} are there", count, span);
    if (counted != count) return fmt::format("{} rows are counted, {} are there", counted, count);
    return std::nullopt;
  }

  struct Tally {
    std::size_t moments = 0;
    std::size_t images = 0;
    std::size_t broken = 0;
  };
  /// Calls `look` with so many images of each moment, and the promise at it.
  template <class Look>
  static Tally cutEverywhere(const Record& record, std::size_t each, Look look) {
    std::mt19937 random(20'260'131);
    Tally tally;
    for (PowerCut cut(record); cut.advance(); ++tally.moments) {
      for (std::size_t i = 0; i < each; ++i, ++tally.images) {
        const auto survival = static_cast<PowerCut::Survival>(std::min(i, std::size_t{2}));
        SCOPED_TRACE(fmt::format("moment {}, image {}", tally.moments, i));
        if (look(cut.image(survival, random), cut.promised())) continue;
        if (++tally.broken > 5) return tally;
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

// A short log, so that it is moved into the file often.
const PowerTest::Run PowerTest::kRuns[] = {
    {"flushes",
     {.sync = 24h, .logPages = 12},
     [](PowerTest& test) {
       for (int i = 0; i < 5; ++i) {
         test.send(7);
         test.flushAndPromise();
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
         auto flushed = flush(*test.store_, session);
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
         test.sendAndAwait(1);
         test.promise();
       }
     }},
    {"intervals",
     {.sync = 5ms, .logPages = 12},
     [](PowerTest& test) {
       for (int i = 0; i < 5; ++i) {
         for (int burst = 0; burst < 3; ++burst) test.sendAndAwait(2);
         test.awaitSyncAndPromise();
       }
     }},
    {"long rows, removed when they are old",
     {.sync = 24h, .maximumBytes = 120'000, .logPages = 24},
     [](PowerTest& test) {
       for (int i = 0; i < 4; ++i) {
         test.send(4, 9000);
         test.flushAndPromise();
       }
     }},
    {"an interval's sync fails",
     {.sync = 5ms, .logPages = 12, .firstBackOff = 1ms},
     [](PowerTest& test) {
       for (int i = 0; i < 6; ++i) {
         test.sendAndAwait(2);
         test.failNextSync();
         test.sendAndAwait(2);
         test.awaitSyncAndPromise();
       }
     }},
    {"a flush's sync fails beside a reader",
     {.sync = 24h, .logPages = 40, .firstBackOff = 1ms},
     [](PowerTest& test) {
       test.send(3);
       test.flushAndPromise();
       SqliteConnection reader;
       ASSERT_TRUE(reader.open(test.path_));
       ASSERT_TRUE(reader.execute("BEGIN; SELECT count(*) FROM message"));
       for (int i = 0; i < 6; ++i) {
         test.sendAndAwait(2);
         test.failNextSync();
         test.send(2);
         test.flushAndPromise();
       }
       test.end();  // the reader stays until then
     }},
};

TEST_F(PowerTest, NoCutLosesAPromisedRowOrCorruptsTheStore) {
  Tally all;
  for (const Run& run : kRuns) {
    const Record record = this->record(run);
    const std::size_t images = (IsNightly() ? 100'000 : 5'000) / std::size(kRuns);
    const std::size_t each = std::max(images / record.size() + 1, std::size_t{3});
    const auto tally = cutEverywhere(record, each, [&](const auto& image, off_t promised) {
      const auto fault = broken(image, promised);
      EXPECT_EQ(fault, std::nullopt) << run.name;
      return !fault;
    });
    all.images += tally.images;
    all.moments += tally.moments;
    all.broken += tally.broken;
    fmt::print("power cut, {}: {} images of {} moments\n", run.name, tally.images, tally.moments);
  }
  fmt::print("harness: power cut: {} images of {} moments, {} broken\n", all.images, all.moments,
             all.broken);
}

// The damaged file is renamed and a new one filled from it: an interruption loses no readable row.
TEST_F(PowerTest, NoCutLosesARowThatASalvageCanRead) {
  const Run run{"salvage", {.logPages = 12}, replaceADamagedOne};
  const Record record = this->record(run);
  const std::int64_t expected =
      std::stoll(value("SELECT count(*) FROM message WHERE payload ->> 'n' <= 200"));
  ASSERT_GT(expected, 150);
  ASSERT_LT(expected, 200);
  std::size_t images = 0;
  (void)cutEverywhere(record, 6, [&](const auto& image, off_t promised) {
    if (promised != kDamaged) return true;
    ++images;
    put(image);
    store_ = open(options_);
    if (store_ == nullptr) return false;
    store_.reset();
    // All of them where the log of the first run has survived, which still holds the page.
    const auto rows =
        std::stoll(value("SELECT count(*) FROM message WHERE payload ->> 'n' <= 200"));
    EXPECT_GE(rows, expected);
    return rows >= expected;
  });
  fmt::print("harness: power cut, salvage: {} images\n", images);
  EXPECT_GT(images, 100U);
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
  std::size_t found = 0;
  (void)cutEverywhere(record, 20, [&](const PowerCut::Image& image, off_t) {
    const auto replaced = image.find("status.json");
    if (replaced == image.end()) return true;
    ++found;
    const bool isWhole = replaced->second == contents[0] || replaced->second == contents[1];
    EXPECT_TRUE(isWhole) << replaced->second.size() << " bytes";
    return isWhole;
  });
  EXPECT_GT(found, 20U);
}

}  // namespace
}  // namespace quarvel::testing
