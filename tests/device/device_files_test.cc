#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <future>
#include <thread>

#include "device/NotificationCenter.h"
#include "device/OrientationFiles.h"
#include "device/PreferencesStore.h"
#include "tests/LogRecorder.h"
#include "tests/TemporaryDirectory.h"
#include "tests/device/Collected.h"

// Notifications, orientations and preferences: all of them are files that other programs write.

namespace quarvel {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using testing::LogRecorder;
using ::testing::Optional;
using ::testing::SizeIs;
namespace fs = std::filesystem;

class DeviceFilesTest : public ::testing::Test {
 protected:
  void SetUp() override { LogRecorder::take(); }
  void TearDown() override { watch.reset(); }

  TemporaryDirectory directory;
  std::unique_ptr<DirectoryWatch> watch = std::make_unique<DirectoryWatch>();
};

/// A queue whose blocks run when the test says so.
class HandQueue final : public WorkQueue {
 public:
  [[nodiscard]] std::string_view label() const override { return "test"; }
  void async(Block block) override { blocks_.add(std::make_shared<Block>(std::move(block))); }
  void after(std::chrono::milliseconds, Block block) override { async(std::move(block)); }
  [[nodiscard]] bool isCurrent() const override { return false; }

  /// Waits for a block and runs it. False when none came.
  [[nodiscard]] bool runNext() {
    const auto block = blocks_.next();
    if (block) (**block)();
    return block.has_value();
  }
  [[nodiscard]] std::size_t waiting() { return blocks_.size(); }

 private:
  Collected<std::shared_ptr<Block>> blocks_;
};

class NotificationsTest : public DeviceFilesTest {
 protected:
  HandQueue queue;
  NotificationCenter center{directory.path() / "notify", *watch};
};

TEST_F(NotificationsTest, EachWayOfTouchingAFilePosts) {
  const std::string file = directory.path() / "notify/one";
  const std::vector<std::pair<const char*, std::function<void()>>> ways{
      {"made", [&] { directory.write("notify/one", ""); }},
      {"written", [&] { directory.write("notify/one", "news"); }},
      {"opened and closed", [&] { ::close(::open(file.c_str(), O_WRONLY)); }},
      {"touched by path", [&] { utimensat(AT_FDCWD, file.c_str(), nullptr, 0); }},
      {"replaced", [&] { fs::rename(directory.write("new", ""), file); }},
  };
  NotificationToken one = 0;
  NotificationToken again = 0;
  NotificationToken other = 0;
  std::vector<NotificationToken> called;
  const auto record = [&called](NotificationToken token) { called.push_back(token); };
  ASSERT_EQ(center.add("one", one, queue, record), 0);
  ASSERT_EQ(center.add("one", again, queue, record), 0);
  ASSERT_EQ(center.add("other", other, queue, record), 0);
  for (const auto& [name, touch] : ways) {
    SCOPED_TRACE(name);
    called.clear();
    touch();
    ASSERT_TRUE(queue.runNext());
    ASSERT_TRUE(queue.runNext());
    EXPECT_EQ(called, (std::vector{one, again}));
    // Further events of this touch come before the next posting, and none is of another name.
    directory.write("notify/other", "");
    do {
      ASSERT_TRUE(queue.runNext());
    } while (called.back() != other);
    EXPECT_EQ(std::count(called.begin(), called.end(), other), 1);
  }
}

TEST_F(NotificationsTest, PostingsBeforeTheHandlerBeginsAreOneCallAndLaterOnesAnother) {
  NotificationToken token = 0;
  NotificationToken marker = 0;
  HandQueue markers;
  int calls = 0;
  ASSERT_EQ(center.add("burst", token, queue,
                       [&](NotificationToken) {
                         // Comes while the handler runs: must not be lost.
                         if (++calls == 1) directory.write("notify/burst", "");
                       }),
            0);
  ASSERT_EQ(center.add("marker", marker, markers, [](NotificationToken) {}), 0);
  const auto burst = [&] {
    for (int i = 0; i < 50; ++i) directory.write("notify/burst", "");
    directory.write("notify/marker", "");
    return markers.runNext();  // events come in order: all of the burst were seen
  };
  ASSERT_TRUE(burst());
  EXPECT_EQ(queue.waiting(), 1U);
  ASSERT_TRUE(queue.runNext());
  ASSERT_TRUE(queue.runNext());
  EXPECT_EQ(calls, 2);
  ASSERT_TRUE(burst());
  EXPECT_EQ(queue.waiting(), 1U);
}

TEST_F(NotificationsTest, SetUpThatFailsYieldsAStatusAndNoToken) {
  directory.write("file", "");
  NotificationCenter impossible(directory.path() / "file/notify", *watch);
  NotificationToken token = 7;
  EXPECT_EQ(impossible.add("one", token, queue, [](NotificationToken) {}), ENOTDIR);
  EXPECT_EQ(token, 0);
}

class OrientationTest : public DeviceFilesTest {
 protected:
  void SetUp() override {
    DeviceFilesTest::SetUp();
    center.setSource(std::make_unique<OrientationFiles>(center, directory.path(), *watch));
  }
  void add(const char* id, Collected<Orientation>& into,
           OrientationKind kind = OrientationKind::device) {
    center.add(kind, id, [&into](Orientation orientation) { into.add(orientation); });
  }
  void write(const std::string& text) { directory.write("device-orientation", text); }

  OrientationCenter center;
};

TEST_F(OrientationTest, ChangesReachTheirHandlersAndWrongTextIsLogged) {
  write("portrait");
  Collected<Orientation> device;
  Collected<Orientation> ui;
  add("id", device);
  add("id", ui, OrientationKind::ui);
  const std::vector<std::pair<const char*, Orientation>> cases{
      {"2\n", Orientation::portraitUpsideDown},
      {"landscapeLeft", Orientation::landscapeLeft},
      {" landscapeRight\n", Orientation::landscapeRight},
      {"faceDown", Orientation::faceDown},
      {"unknown", Orientation::unknown},
      {"1", Orientation::portrait},
  };
  write("portrait");  // no change
  for (const auto& [text, expected] : cases) {
    SCOPED_TRACE(text);
    write(text);
    EXPECT_THAT(device.next(), Optional(expected));
  }
  LogRecorder::take();
  for (const std::string text : {"7", "-1", "1 2", "Portrait"}) {
    write(text);
    // A file that is written in place may be seen empty on the way.
    std::string line;
    do {
      line = LogRecorder::nextError();
    } while (line.find("\"\"") != line.npos);
    EXPECT_THAT(line, HasSubstr("\"" + text + "\""));
  }
  EXPECT_EQ(ui.size(), 0U);
  directory.write("ui-orientation", "3");
  EXPECT_THAT(ui.next(), Optional(Orientation::landscapeLeft));
  EXPECT_EQ(device.size(), 0U);
}

TEST_F(OrientationTest, OneHandlerForAnIDAndNoneAfterUnregistering) {
  Collected<Orientation> replaced;
  Collected<Orientation> own;
  Collected<Orientation> other;
  add("id", replaced);
  add("id", own);
  add("other", other);
  write("1");
  EXPECT_THAT(own.next(), Optional(Orientation::portrait));
  EXPECT_THAT(other.next(), Optional(Orientation::portrait));
  center.remove(OrientationKind::ui, "id");
  center.remove(OrientationKind::device, "id");
  center.remove(OrientationKind::device, "id");
  write("2");
  EXPECT_THAT(other.next(), Optional(Orientation::portraitUpsideDown));
  center.remove(OrientationKind::device, "other");
  // A change without a handler is the initial orientation of the next one.
  write("3");
  add("other", other);
  write("4");
  EXPECT_THAT(other.next(), Optional(Orientation::landscapeRight));
  EXPECT_EQ(replaced.size() + own.size(), 0U);
}

TEST_F(OrientationTest, UnregisteringWaitsForTheHandlerUnlessCalledFromIt) {
  std::promise<void> entered;
  std::promise<void> removing;
  bool left = false;  // not atomic: only a removal that waits may read it
  center.add(OrientationKind::device, "slow", [&](Orientation) {
    entered.set_value();
    removing.get_future().wait();
    for (int i = 0; i < 1000; ++i) std::this_thread::yield();
    left = true;
  });
  Collected<Orientation> after;
  center.add(OrientationKind::device, "within", [&](Orientation orientation) {
    center.remove(OrientationKind::device, "within");
    after.add(orientation);
  });
  write("1");
  ASSERT_EQ(entered.get_future().wait_for(std::chrono::seconds(30)), std::future_status::ready);
  removing.set_value();
  center.remove(OrientationKind::device, "slow");
  EXPECT_TRUE(left);
  EXPECT_THAT(after.next(), Optional(Orientation::portrait));
}

class PreferencesTest : public DeviceFilesTest {
 protected:
  PreferencesDomain written(std::string_view text) {
    directory.write("some.domain.toml", text);
    return store.open("some.domain");
  }

  PreferencesStore store{directory.path()};
};

TEST_F(PreferencesTest, ValuesAreReadAsStringsAndBooleans) {
  const struct {
    const char* value;
    std::optional<std::string> string;
    bool boolean;
  } cases[] = {
      {"true", std::nullopt, true},
      {"false", std::nullopt, false},
      {"0", "0", false},
      {"-3", "-3", true},
      {"9223372036854775807", "9223372036854775807", true},
      {"0.0", "0", false},
      {"2.5", "2.5", true},
      {"\"\"", "", false},
      {"\"Kitchen\"", "Kitchen", false},
      {"\"YES\"", "YES", true},
      {"\"On\"", "On", true},
      {"\"1\"", "1", true},
      {"\"no\"", "no", false},
      {"\"yes, please\"", "yes, please", false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.value);
    const PreferencesDomain domain = written(std::string("key = ") + c.value);
    EXPECT_TRUE(domain.hasValue("key"));
    EXPECT_EQ(domain.string("key"), c.string);
    EXPECT_EQ(domain.boolean("key"), c.boolean);
    EXPECT_FALSE(domain.hasValue("other"));
    EXPECT_EQ(domain.string("other"), std::nullopt);
    EXPECT_FALSE(domain.boolean("other"));
  }
}

TEST_F(PreferencesTest, FileWithAnErrorChangesNothing) {
  const struct {
    const char* name;
    std::string text;
    const char* line;
  } cases[] = {
      {"torn", "device_name = \"x\"\ndisable_reporting = tr", "some.domain.toml:2: "},
      {"twice", "disable_reporting = false\ndisable_reporting = false\n", "some.domain.toml:2: "},
      {"list", "\n\ndisable_reporting = [false]\n", "some.domain.toml:3: "},
      {"table", "[disable_reporting]\nvalue = false\n", "some.domain.toml:1: "},
      {"date", "\ndisable_reporting = 2026-01-31\n", "some.domain.toml:2: "},
      {"no text", "disable_reporting = \"\xff\"\n", "some.domain.toml:1: "},
      {"too long", std::string(PreferencesStore::kMaximumBytes, '\n') + "a = 1",
       "some.domain.toml: "},
  };
  EXPECT_FALSE(written("disable_reporting = nonsense").hasValue("disable_reporting"));
  EXPECT_THAT(LogRecorder::nextError(), HasSubstr("some.domain.toml:1: "));
  EXPECT_TRUE(written("disable_reporting = true").boolean("disable_reporting"));
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    EXPECT_TRUE(written(c.text).boolean("disable_reporting"));
    EXPECT_TRUE(store.open("some.domain").boolean("disable_reporting"));
    EXPECT_THAT(LogRecorder::takeErrors(), ElementsAre(HasSubstr(c.line))) << "once";
    EXPECT_FALSE(store.open("other.domain").hasValue("disable_reporting"));
  }
  EXPECT_FALSE(written("device_name = 'x'").hasValue("disable_reporting"));
  EXPECT_TRUE(written("disable_reporting = true").boolean("disable_reporting"));

  // A domain that was removed has no values; one that cannot be read keeps them.
  const fs::path file = directory.path() / "some.domain.toml";
  fs::remove(file);
  fs::create_directory(file);
  EXPECT_TRUE(store.open("some.domain").boolean("disable_reporting"));
  EXPECT_THAT(LogRecorder::takeErrors(), SizeIs(1));
  fs::remove(file);
  EXPECT_FALSE(store.open("some.domain").hasValue("disable_reporting"));
  EXPECT_THAT(LogRecorder::takeErrors(), IsEmpty());
}

}  // namespace
}  // namespace quarvel
