#include <fcntl.h>
#include <fmt/format.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <future>
#include <sstream>
#include <thread>

#include "device/NotificationCenter.h"
#include "device/OrientationFiles.h"
#include "device/PreferencesStore.h"
#include "device/TallixFacility.h"
#include "device/TallixSampling.h"
#include "platform/Tallix.h"
#include "tests/Gate.h"
#include "tests/LogRecorder.h"
#include "tests/TemporaryDirectory.h"
#include "tests/device/Collected.h"

namespace quarvel {
namespace {

using ::testing::ElementsAre, ::testing::HasSubstr, ::testing::IsEmpty, testing::LogRecorder,
    ::testing::Optional, ::testing::Pair, ::testing::SizeIs;
using enum Orientation;
using enum TallixErrorCode;
namespace fs = std::filesystem;

class DeviceFilesTest : public ::testing::Test {
 protected:
  void SetUp() override { LogRecorder::take(); }
  void TearDown() override { watch.end(); }

  TemporaryDirectory directory;
  DirectoryWatch watch;
};

/// A queue whose blocks run when the test says so.
class HandQueue : public WorkQueue {
 public:
  [[nodiscard]] std::string_view label() const override { return "test"; }
  void async(Block block) override { blocks.add(std::make_shared<Block>(std::move(block))); }
  void after(std::chrono::milliseconds, Block block) override { async(std::move(block)); }
  [[nodiscard]] bool isCurrent() const override { return false; }
  /// Waits for a block and runs it. False when none came.
  [[nodiscard]] bool runNext() {
    const auto block = blocks.next();
    if (block) (**block)();
    return block.has_value();
  }

  Collected<std::shared_ptr<Block>> blocks;
};

class NotificationsTest : public DeviceFilesTest {
 protected:
  NotificationToken add(const char* name, WorkQueue& on, NotificationHandler handler) {
    NotificationToken token = 0;
    EXPECT_EQ(center.add(name, token, on, std::move(handler)), 0);
    return token;
  }

  HandQueue queue;
  NotificationCenter center{directory.path() / "notify", watch};
};

TEST_F(NotificationsTest, EachWayOfTouchingAFilePosts) {
  const std::string file = directory.path() / "notify/one";
  std::vector<NotificationToken> called;
  const auto record = [&called](NotificationToken token) { called.push_back(token); };
  const NotificationToken one = add("one", queue, record);
  const NotificationToken again = add("one", queue, record);
  const NotificationToken other = add("other", queue, record);
  const auto expectPosting = [&](const char* name, const auto& touch) {
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
    EXPECT_EQ(std::ranges::count(called, other), 1);
  };
  expectPosting("made", [&] { directory.write("notify/one", ""); });
  expectPosting("written", [&] { directory.write("notify/one", "news"); });
  expectPosting("opened and closed", [&] { ::close(::open(file.c_str(), O_WRONLY)); });
  expectPosting("touched by path", [&] { utimensat(AT_FDCWD, file.c_str(), nullptr, 0); });
  expectPosting("replaced", [&] { fs::rename(directory.write("new", ""), file); });
}

TEST_F(NotificationsTest, PostingsBeforeTheHandlerBeginsAreOneCallAndLaterOnesAnother) {
  HandQueue markers;
  int calls = 0;
  add("burst", queue, [&](NotificationToken) {
    // Comes while the handler runs: must not be lost.
    if (++calls == 1) directory.write("notify/burst", "");
  });
  add("marker", markers, [](NotificationToken) {});
  const auto burst = [&] {
    for (int i = 0; i < 50; ++i) directory.write("notify/burst", "");
    directory.write("notify/marker", "");
    return markers.runNext();  // events come in order: all of the burst were seen
  };
  ASSERT_TRUE(burst());
  EXPECT_EQ(queue.blocks.size(), 1U);
  ASSERT_TRUE(queue.runNext());
  ASSERT_TRUE(queue.runNext());
  EXPECT_EQ(calls, 2);
  ASSERT_TRUE(burst());
  EXPECT_EQ(queue.blocks.size(), 1U);
}

TEST_F(NotificationsTest, EventsThatTheKernelDroppedPostEveryName) {
  /// Holds up the thread of the watch, so that the kernel's queue of events fills.
  struct FullQueue final : HandQueue {
    void async(Block) override {
      entered.arrive();
      leave.wait();
    }
    testing::Gate entered, leave;
  } full;
  add("one", full, [](NotificationToken) {});
  add("untouched", queue, [](NotificationToken) {});
  const std::string one = directory.write("notify/one", "");
  full.entered.wait();
  int most = 0;
  std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> most;
  ASSERT_GT(most, 0);
  const std::string two = directory.write("notify/two", "");
  for (int i = 0; i <= most; ++i) {  // in turn: the kernel joins equal neighbours
    utimensat(AT_FDCWD, (i % 2 == 0 ? one : two).c_str(), nullptr, 0);
  }
  full.leave.arrive();
  EXPECT_TRUE(queue.runNext());
}

TEST_F(NotificationsTest, SetUpThatFailsYieldsAStatusAndNoToken) {
  directory.write("file", "");
  NotificationCenter impossible(directory.path() / "file/notify", watch);
  NotificationToken token = 7;
  EXPECT_EQ(impossible.add("one", token, queue, [](NotificationToken) {}), ENOTDIR);
  EXPECT_EQ(token, 0);
}

class OrientationTest : public DeviceFilesTest {
 protected:
  void SetUp() override {
    DeviceFilesTest::SetUp();
    center.setSource(std::make_unique<OrientationFiles>(center, directory.path(), watch));
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
  Collected<Orientation> device, ui;
  add("id", device);
  add("id", ui, OrientationKind::ui);
  write("portrait");  // no change
  const auto expect = [&](const char* text, Orientation orientation) {
    write(text);
    EXPECT_THAT(device.next(), Optional(orientation)) << text;
  };
  expect("2\n", portraitUpsideDown);
  expect("landscapeLeft", landscapeLeft);
  expect(" landscapeRight\n", landscapeRight);
  expect("faceDown", faceDown);
  expect("unknown", unknown);
  expect("1", portrait);
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
  EXPECT_THAT(ui.next(), Optional(landscapeLeft));
  EXPECT_EQ(device.size(), 0U);
}

TEST_F(OrientationTest, OneHandlerForAnIDAndNoneAfterUnregistering) {
  Collected<Orientation> replaced, own, other;
  add("id", replaced);
  add("id", own);
  add("other", other);
  write("1");
  EXPECT_THAT(own.next(), Optional(portrait));
  EXPECT_THAT(other.next(), Optional(portrait));
  center.remove(OrientationKind::ui, "id");
  center.remove(OrientationKind::device, "id");
  center.remove(OrientationKind::device, "id");
  write("2");
  EXPECT_THAT(other.next(), Optional(portraitUpsideDown));
  center.remove(OrientationKind::device, "other");
  // A change without a handler is the initial orientation of the next one.
  write("3");
  add("other", other);
  write("4");
  EXPECT_THAT(other.next(), Optional(landscapeRight));
  EXPECT_EQ(replaced.size() + own.size(), 0U);
}

TEST_F(OrientationTest, UnregisteringWaitsForTheHandlerUnlessCalledFromIt) {
  testing::Gate entered, removing;
  bool left = false;  // not atomic: only a removal that waits may read it
  center.add(OrientationKind::device, "slow", [&](Orientation) {
    entered.arrive();
    removing.wait();
    for (int i = 0; i < 1000; ++i) std::this_thread::yield();
    left = true;
  });
  Collected<Orientation> after;
  center.add(OrientationKind::device, "within", [&](Orientation orientation) {
    center.remove(OrientationKind::device, "within");
    after.add(orientation);
  });
  write("1");
  entered.wait();
  removing.arrive();
  center.remove(OrientationKind::device, "slow");
  EXPECT_TRUE(left);
  EXPECT_THAT(after.next(), Optional(portrait));
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
  const auto expect = [this](const std::string& value, std::optional<std::string> string,
                             bool boolean) {
    SCOPED_TRACE(value);
    const PreferencesDomain domain = written("key = " + value);
    EXPECT_TRUE(domain.hasValue("key"));
    EXPECT_EQ(domain.string("key"), string);
    EXPECT_EQ(domain.boolean("key"), boolean);
    EXPECT_FALSE(domain.hasValue("other") || domain.string("other") || domain.boolean("other"));
  };
  expect("true", std::nullopt, true);
  expect("false", std::nullopt, false);
  expect("0", "0", false);
  expect("0.0", "0", false);
  for (const char* number : {"-3", "9223372036854775807", "2.5"}) expect(number, number, true);
  for (const std::string text : {"YES", "On", "1"}) expect('"' + text + '"', text, true);
  for (const std::string text : {"", "Kitchen", "no", "yes, please"}) {
    expect('"' + text + '"', text, false);
  }
}

TEST_F(PreferencesTest, FileWithAnErrorChangesNothing) {
  const std::vector<std::pair<std::string, const char*>> cases{
      {"device_name = 'x'\ndisable_reporting = tr", ":2: "},
      {"disable_reporting = false\ndisable_reporting = false\n", ":2: "},
      {"\n\ndisable_reporting = [false]\n", ":3: "},
      {"[disable_reporting]\nvalue = false\n", ":1: "},
      {"\ndisable_reporting = 2026-01-31\n", ":2: "},
      {"disable_reporting = '\xff'\n", ":1: "},
      {std::string(PreferencesStore::kMaximumBytes, '\n') + "a = 1", ": "},
  };
  EXPECT_FALSE(written("disable_reporting = nonsense").hasValue("disable_reporting"));
  EXPECT_THAT(LogRecorder::takeErrors(), SizeIs(1));
  EXPECT_TRUE(written("disable_reporting = true").boolean("disable_reporting"));
  for (const auto& [text, place] : cases) {
    SCOPED_TRACE(text.substr(0, 60));
    EXPECT_TRUE(written(text).boolean("disable_reporting"));
    EXPECT_TRUE(store.open("some.domain").boolean("disable_reporting"));
    EXPECT_THAT(LogRecorder::takeErrors(),
                ElementsAre(HasSubstr(std::string("domain.toml") + place)))
        << "once";
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

using Figures = std::vector<std::pair<std::string, std::int64_t>>;

Figures figures(const TallixSamples& samples) {
  Figures all;
  if (!samples) return all;
  TallixIterate(*samples, [&all](const TallixChannelSample& sample) {
    all.emplace_back(TallixChannelGetChannelName(sample).value_or("(no name)"),
                     TallixSimpleGetIntegerValue(sample));
    return 0;
  });
  return all;
}

constexpr TallixErrorCode kNone{};
TallixErrorCode code(const std::optional<Error>& error) {
  return error ? static_cast<TallixErrorCode>(error->code) : kNone;
}

/// A subscription to all that one lookup finds.
struct Subscribed {
  explicit Subscribed(const Configuration::Tallix& configuration,
                      std::optional<std::string_view> group = std::nullopt) {
    const TallixChannels found =
        TallixFacility(configuration).channelsInGroup(group, std::nullopt, error);
    subscription = TallixCreateSubscription(found, channels);
  }
  TallixSamples sample() {
    error.reset();
    return TallixCreateSamples(*subscription, channels, error);
  }

  TallixChannels channels;
  std::shared_ptr<TallixSubscription> subscription;
  std::optional<Error> error;
};

class TallixTest : public DeviceFilesTest {
 protected:
  Configuration::Tallix configuration(std::vector<Configuration::TallixChannel> single = {}) const {
    return {directory.path() / "tree", std::move(single)};
  }
};

TEST_F(TallixTest, LookupMatchesGroupsAndSubgroups) {
  for (const char* file :
       {"Speaker/Opened", "Speaker/Left/Clips", "VorrenMXDrv/MCA/Underruns", "Haptics/Stats/Taps",
        "Haptics/MCA/Frames", "Haptics/.hidden", "Haptics/not\xffutf8"}) {
    directory.write(fs::path("tree") / file, "1");
  }
  fs::create_directories(directory.path() / "tree/Bare/Stats");
  fs::create_symlink(directory.write("elsewhere", "1"), directory.path() / "tree/Haptics/Linked");
  const TallixFacility facility(
      configuration({{"Speaker", "", "Single", directory.path() / "elsewhere", ""}}));

  const auto found = [&facility](std::optional<std::string_view> group,
                                 std::optional<std::string_view> subgroup) -> std::string {
    std::optional<Error> error;
    const TallixChannels channels = facility.channelsInGroup(group, subgroup, error);
    EXPECT_EQ(code(error), kNone);
    if (!channels) return "no such group";
    std::string names = std::to_string(TallixGetChannelCount(*channels));
    for (const DriverChannel& channel : channels->channels) names += ' ' + channel.name;
    return names;
  };
  EXPECT_EQ(found("Speaker", {}), "3 Opened Single Clips");
  EXPECT_EQ(found("Haptics", {}), "3 Linked Frames Taps") << "links count";
  EXPECT_EQ(found({}, "MCA"), "2 Frames Underruns");
  EXPECT_EQ(found("Haptics", "Stats"), "1 Taps");
  EXPECT_EQ(found({}, {}), "7 Linked Frames Taps Opened Single Clips Underruns");
  EXPECT_EQ(found("Speaker", "Opened"), "no such group") << "a channel is no subgroup";
  EXPECT_EQ(found("Amplifier", {}), "no such group");
  EXPECT_EQ(found("Bare", {}), "0");
  EXPECT_EQ(found("Bare", "Stats"), "0");
}

TEST_F(TallixTest, SamplesAndDeltasFollowTheCounters) {
  const auto write = [this](const char* down, const std::string& low, const char* up) {
    directory.write("tree/G/Down", down);
    directory.write("tree/G/Low", low);
    directory.write("tree/G/Up", up);
  };
  write("50\n", std::to_string(INT64_MIN), "  100\n");
  Subscribed subscribed(configuration());
  const TallixSamples earlier = subscribed.sample();
  ASSERT_NE(earlier, nullptr) << subscribed.error->description();
  write("-20", "1", "107\n");
  const TallixSamples later = subscribed.sample();
  EXPECT_THAT(figures(later), ElementsAre(Pair("Down", -20), Pair("Low", 1), Pair("Up", 107)));
  std::optional<Error> error;
  EXPECT_THAT(figures(TallixCreateSamplesDelta(earlier, later, error)),
              ElementsAre(Pair("Down", -70), Pair("Low", INT64_MAX), Pair("Up", 7)));
  EXPECT_EQ(code(error), kNone);

  int visited = 0;
  TallixIterate(*later, [&visited](const TallixChannelSample&) { return ++visited == 2 ? 1 : 0; });
  EXPECT_EQ(visited, 2);
}

TEST_F(TallixTest, SamplesOfOtherChannelsAreRefused) {
  directory.write("tree/A/One", "1");
  directory.write("tree/B/One", "1");
  Subscribed a(configuration(), "A");
  Subscribed b(configuration(), "B");
  std::optional<Error> error;
  EXPECT_EQ(TallixCreateSamplesDelta(nullptr, a.sample(), error), nullptr);
  EXPECT_EQ(code(error), noEarlierSamples);
  EXPECT_EQ(TallixCreateSamplesDelta(b.sample(), a.sample(), error), nullptr);
  EXPECT_EQ(code(error), differentChannels);
  EXPECT_EQ(TallixCreateSamples(*a.subscription, b.channels, error), nullptr);
  EXPECT_EQ(code(error), notSubscribed);
}

TEST_F(TallixTest, ChannelWithoutAnIntegerIsAnErrorUntilItHasOne) {
  const fs::path file = directory.write("tree/G/Counter", "1");
  Subscribed subscribed(configuration());
  const std::vector<std::pair<std::string, TallixErrorCode>> cases{
      {"", noInteger},
      {"12 34", noInteger},
      {"0x10", noInteger},
      {std::string(3, '\0'), noInteger},
      {std::string(5000, ' ') + "1", noInteger},
      {"9223372036854775808", integerOutOfRange},
      {std::string(5000, '9'), integerOutOfRange},
  };
  for (const auto& [content, expected] : cases) {
    SCOPED_TRACE(content.substr(0, 30));
    directory.write("tree/G/Counter", content);
    EXPECT_EQ(subscribed.sample(), nullptr);
    EXPECT_EQ(code(subscribed.error), expected);
    EXPECT_THAT(LogRecorder::nextError(), HasSubstr(file.native()));
  }
  directory.write("tree/G/Counter", "9223372036854775807");
  EXPECT_THAT(figures(subscribed.sample()), ElementsAre(Pair("Counter", INT64_MAX)));
}

TEST_F(TallixTest, VanishedChannelIsAnErrorAndMayComeBack) {
  const fs::path file = directory.write("tree/G/Counter", "1");
  Subscribed subscribed(configuration());
  fs::remove(file);
  EXPECT_EQ(subscribed.sample(), nullptr);
  EXPECT_EQ(code(subscribed.error), channelUnreadable);
  directory.write("tree/G/Counter", "2");
  EXPECT_THAT(figures(subscribed.sample()), ElementsAre(Pair("Counter", 2)));
  // A program that publishes a counter by renaming must not leave us with its first value.
  fs::rename(directory.write("new", "3"), file);
  EXPECT_THAT(figures(subscribed.sample()), ElementsAre(Pair("Counter", 3)));
}

TEST_F(TallixTest, ChannelsThatCannotBeReadLeaveTheOthers) {
  std::optional<Error> error;
  const TallixFacility facility(
      configuration({{"Speaker", "", "Clips", directory.write("counter", "7"), ""}}));
  const TallixChannels channels = facility.channelsInGroup("Speaker", std::nullopt, error);
  EXPECT_EQ(code(error), unreadableGroups) << "there is no tree";
  ASSERT_NE(channels, nullptr);
  EXPECT_EQ(TallixGetChannelCount(*channels), 1);

  directory.write("tree/G/Counter", "1");
  Subscribed subscribed(configuration({{"G", "", "Absent", directory.path() / "absent", ""},
                                       {"G", "", "Folder", directory.path(), "([0-9]+)"}}));
  EXPECT_THAT(LogRecorder::nextError(), HasSubstr("Absent"));
  ASSERT_EQ(TallixGetChannelCount(*subscribed.channels), 2);
  EXPECT_EQ(subscribed.sample(), nullptr);  // a directory opens but cannot be read
  EXPECT_EQ(code(subscribed.error), channelUnreadable);
}

// The service hung in open(2) of a named pipe without a writer.
TEST_F(TallixTest, NamedPipeInPlaceOfACounterBlocksNothing) {
  const fs::path pipe = directory.path() / "pipe";
  ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
  fs::create_directories(directory.path() / "tree");
  std::future<TallixErrorCode> result = std::async(std::launch::async, [&] {
    Subscribed subscribed(configuration({{"G", "", "Pipe", pipe, ""}}));
    EXPECT_EQ(subscribed.sample(), nullptr);
    return code(subscribed.error);
  });
  const bool inTime = result.wait_for(std::chrono::seconds(5)) == std::future_status::ready;
  EXPECT_TRUE(inTime);
  const int writer = inTime ? -1 : ::open(pipe.c_str(), O_WRONLY | O_NONBLOCK);  // ends the hang
  EXPECT_EQ(result.get(), channelUnreadable);
  ::close(writer);
}

TEST_F(TallixTest, PatternsFindTheirIntegersInOneLongReport) {
  std::string report = "           CPU0\n";
  for (int row = 1; report.size() < 60'000; ++row) {
    report += fmt::format("{:3}:  {:9}  IO-APIC  {}-edge  device{}\n", row, row * 10, row, row);
  }
  report += "ERR:          4\n";
  const fs::path file = directory.write("interrupts", report);
  const fs::path line = directory.write("line", std::string(70'000, 'x') + " 5");
  fs::create_directories(directory.path() / "tree");
  Subscribed subscribed(configuration({
      {"Irq", "", "First", file, "^ *1: +([0-9]+)"},
      {"Irq", "", "Last", file, "^ERR: +([0-9]+)$"},
      {"Irq", "", "Middle", file, "^ *[0-9]+: +([0-9]+) .*device321$"},
      {"Irq", "", "NoGroup", file, "[0-9]+"},
      {"Irq", "", "Unbalanced", file, "([0-9]+"},
  }));
  for (const char* wrong : {"NoGroup", "Unbalanced"}) {
    EXPECT_THAT(LogRecorder::nextError(), HasSubstr(wrong));
  }
  EXPECT_THAT(figures(subscribed.sample()),
              ElementsAre(Pair("First", 10), Pair("Last", 4), Pair("Middle", 3210)));

  Subscribed beyond(configuration({{"Irq", "", "Beyond", line, "x (5)"}}));
  EXPECT_EQ(beyond.sample(), nullptr);
  EXPECT_EQ(code(beyond.error), noInteger);

  // The kernel returns a report of its own page by page.
  const fs::path maps = "/proc/self/maps";
  std::stringstream text;
  text << std::ifstream(maps).rdbuf();
  ASSERT_GT(text.str().find("[stack]"), 4096U);
  Subscribed kernel(configuration({{"Memory", "", "Inode", maps, " ([0-9]+) +\\[stack\\]$"}}));
  EXPECT_THAT(figures(kernel.sample()), ElementsAre(Pair("Inode", 0)));
}

}  // namespace
}  // namespace quarvel
