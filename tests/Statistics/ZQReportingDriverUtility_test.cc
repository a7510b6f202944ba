#include "Statistics/ZQReportingDriverUtility.h"

#include <gmock/gmock.h>

#include "tests/platform/Simulation.h"

namespace quarvel {
namespace {

using testing::Contains;
using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;
using testing::Key;

const std::optional<std::string> kNone;

std::vector<SimulatedTallix::Channel> EveryDriver() {
  return {{"VorrenMXDrv", kNone, "a", 10},
          {"Speaker", "any", "b", 10},
          {"other", "MCA", "c", 10},
          {"Haptics", "Stats", kNone, 10},
          {"Haptics", "Other", "d", 10}};
}

std::vector<std::string> Lines(const Simulation& simulation, const char* operation,
                               const std::string& level = "") {
  const std::string function = std::string(" zqrd -[ZQReportingDriverUtility ") + operation + "]: ";
  std::vector<std::string> lines;
  for (std::string line : simulation.log.texts(level)) {
    if (const auto at = line.find(function); at != std::string::npos) {
      lines.push_back(line.replace(at, function.size(), " "));
    }
  }
  return lines;
}

TEST(Drivers, SubscribesToTheGroupsThatHaveChannels) {
  Simulation simulation(1);
  simulation.tallix.channels = {{"VorrenMXDrv", kNone, "a", 0}, {"other", "MCA", "c", 0}};
  simulation.tallix.emptyGroups = {{"Haptics", "Stats"}};
  const ZQReportingDriverUtility drivers;
  ASSERT_EQ(drivers.ioChannelSubscriptions().size(), 2U);
  EXPECT_THAT(Lines(simulation, "init"),
              ElementsAre("info creating tallixing driver utility",
                          "default subscribed to group group VorrenMXDrv-(null)",
                          "default subscribed to group group (null)-MCA",
                          "info couldn't find any channels for driver group Haptics-Stats",
                          "default subscribed to group group Haptics-Stats"));
}

TEST(Drivers, AnErrorInTheLookUpIsLoggedAndNoMore) {
  Simulation simulation(1);
  simulation.tallix.channels = {{"Speaker", kNone, "a", 0}};
  simulation.tallix.channelsError = Error{"tallix", 5, {}};
  const ZQReportingDriverUtility drivers;
  EXPECT_EQ(drivers.ioChannelSubscriptions().size(), 1U);
  EXPECT_THAT(Lines(simulation, "init", "error"),
              ElementsAre("error error 5 getting channels for driver VorrenMXDrv-(null)",
                          "error error 5 getting channels for driver Speaker-(null)",
                          "error error 5 getting channels for driver (null)-MCA",
                          "error error 5 getting channels for driver Haptics-Stats"));
}

TEST(Drivers, CountsWhatRoseSinceTheSnapshot) {
  Simulation simulation(1);
  simulation.tallix.channels = EveryDriver();
  const ZQReportingDriverUtility drivers;
  const DriverSnapShot snapShot = drivers.getSnapShot();
  EXPECT_THAT(snapShot, ElementsAre(Key("(null)-MCA"), Key("Haptics-Stats"), Key("Speaker-(null)"),
                                    Key("VorrenMXDrv-(null)")));
  EXPECT_THAT(
      Lines(simulation, "getSnapShot"),
      ElementsAre("info sampling driver VorrenMXDrv-(null)", "info sampling driver Speaker-(null)",
                  "info sampling driver (null)-MCA", "info sampling driver Haptics-Stats"));
  EXPECT_EQ(drivers.getDriverStatisticsRelativeToSnapShot(snapShot), std::nullopt);

  auto& channels = simulation.tallix.channels;
  channels[0].value = 11;
  channels[1].value = 9;
  channels[2].value = 17;
  channels[3].value = 13;
  channels[4].value = 99;
  EXPECT_EQ(drivers.getDriverStatisticsRelativeToSnapShot(snapShot),
            (Dictionary{{"VorrenMXDrv_a", 1}, {"MCA_c", 7}, {"Haptics_Stats_", 3}}));
  EXPECT_EQ(
      drivers.getDriverStatisticsRelativeToSnapShot(std::nullopt),
      (Dictionary{{"VorrenMXDrv_a", 11}, {"Speaker_b", 9}, {"MCA_c", 17}, {"Haptics_Stats_", 13}}));
}

TEST(Drivers, WhatCannotBeSampledIsLeftOutAndWhatHasNoDifferenceIsReportedAsItIs) {
  Simulation simulation(1);
  simulation.tallix.channels = {{"Speaker", kNone, "b", 10}};
  const ZQReportingDriverUtility drivers;
  const char* const kStatistics = "getDriverStatisticsRelativeToSnapShot:";

  EXPECT_EQ(drivers.getDriverStatisticsRelativeToSnapShot(DriverSnapShot{}),
            (Dictionary{{"Speaker_b", 10}}));
  EXPECT_THAT(Lines(simulation, kStatistics),
              ElementsAre("info getting latest samples", "info done getting latest samples",
                          "error TallixCreateSamplesDelta error 6"));

  simulation.tallix.samplesError = Error{"tallix", 3, {}};
  EXPECT_THAT(drivers.getSnapShot(), IsEmpty());
  EXPECT_EQ(drivers.getDriverStatisticsRelativeToSnapShot(std::nullopt), std::nullopt);
  EXPECT_THAT(Lines(simulation, "getSnapShot", "error"),
              ElementsAre("error TallixCreateSamples error 3"));
  EXPECT_THAT(Lines(simulation, kStatistics, "error"),
              Contains("error TallixCreateSamples error 3"));
}

}  // namespace
}  // namespace quarvel
