#include <fcntl.h>
#include <fmt/format.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <future>
#include <sstream>
#include <thread>

#include "device/TallixFacility.h"
#include "device/TallixSampling.h"
#include "platform/Tallix.h"
#include "tests/LogRecorder.h"
#include "tests/TemporaryDirectory.h"

namespace quarvel {
namespace {

using ::testing::ElementsAre, ::testing::HasSubstr, testing::LogRecorder, ::testing::Pair;
using enum TallixErrorCode;
namespace fs = std::filesystem;

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

class TallixTest : public ::testing::Test {
 protected:
  void SetUp() override { LogRecorder::take(); }

  Configuration::Tallix configuration(std::vector<Configuration::TallixChannel> single = {}) const {
    return {directory.path() / "tree", std::move(single)};
  }

  TemporaryDirectory directory;
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

  const struct {
    const char* name;
    std::optional<std::string_view> group, subgroup;
    std::optional<std::vector<std::string>> found;  // absent: no such group
  } cases[] = {
      {"group alone", "Speaker", std::nullopt, {{"Opened", "Single", "Clips"}}},
      {"links count", "Haptics", std::nullopt, {{"Linked", "Frames", "Taps"}}},
      {"subgroup alone", std::nullopt, "MCA", {{"Frames", "Underruns"}}},
      {"both", "Haptics", "Stats", {{"Taps"}}},
      {"neither", {}, {}, {{"Linked", "Frames", "Taps", "Opened", "Single", "Clips", "Underruns"}}},
      {"a channel is no subgroup", "Speaker", "Opened", std::nullopt},
      {"no such group", "Amplifier", {}, {}},
      {"a group without channels", "Bare", std::nullopt, {{}}},
      {"a subgroup without channels", "Bare", "Stats", {{}}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    std::optional<Error> error;
    const TallixChannels channels = facility.channelsInGroup(c.group, c.subgroup, error);
    EXPECT_EQ(code(error), kNone);
    ASSERT_EQ(channels != nullptr, c.found.has_value());
    if (!channels) continue;
    std::vector<std::string> names;
    for (const DriverChannel& channel : channels->channels) names.push_back(channel.name);
    EXPECT_EQ(names, *c.found);
    EXPECT_EQ(TallixGetChannelCount(*channels), static_cast<std::int32_t>(c.found->size()));
  }
}

TEST_F(TallixTest, SamplesAndDeltasFollowTheCounters) {
  directory.write("tree/G/Down", "50\n");
  directory.write("tree/G/Low", std::to_string(INT64_MIN));
  directory.write("tree/G/Up", "  100\n");
  Subscribed subscribed(configuration());
  const TallixSamples earlier = subscribed.sample();
  ASSERT_NE(earlier, nullptr) << subscribed.error->description();

  directory.write("tree/G/Down", "-20");
  directory.write("tree/G/Low", "1");
  directory.write("tree/G/Up", "107\n");
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
  std::promise<TallixErrorCode> sampled;
  std::thread sampling([&] {
    Subscribed subscribed(configuration({{"G", "", "Pipe", pipe, ""}}));
    EXPECT_EQ(subscribed.sample(), nullptr);
    sampled.set_value(code(subscribed.error));
  });
  std::future<TallixErrorCode> result = sampled.get_future();
  const bool inTime = result.wait_for(std::chrono::seconds(5)) == std::future_status::ready;
  EXPECT_TRUE(inTime);
  const int writer = inTime ? -1 : ::open(pipe.c_str(), O_WRONLY | O_NONBLOCK);  // ends the hang
  sampling.join();
  ::close(writer);
  EXPECT_EQ(result.get(), channelUnreadable);
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
