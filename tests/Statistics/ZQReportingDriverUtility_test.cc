#include "Statistics/ZQReportingDriverUtility.h"

#include <gmock/gmock.h>

#include "tests/simulated/Simulation.h"

namespace quarvel {
namespace {

using testing::Contains;
using testing::ElementsAre;
using testing::IsEmpty;

const std::optional<std::string> kNone;

std::vector<std::string> Lines(const Simulation& simulation, const char* operation) {
  const std::string function = std::string(" zqrd -[ZQReportingDriverUtility ") + operation + "]: ";
  std::vector<std::string> lines;
  for (std::string line : simulation.log.texts()) {
    if (const auto at = line.find(function); at != std::string::npos) {
      lines.push_back(line.replace(at, function.size(), " "));
    }
  }
  return lines;
}

TEST(Drivers, SubscribesToTheGroupsThatHaveChannelsAndOnlyLogsAnError) {
  Simulation simulation(1);
  simulation.tallix.channels = {{"VorrenMXDrv", kNone, "a", 0},
                                {"other", "MCA", "c", 0},
                                {"Haptics", "Stats", "d", 0, false}};
  simulation.tallix.channelsError = Error{"tallix", 5, {}};
  const ZQReportingDriverUtility drivers;
  ASSERT_EQ(drivers.ioChannelSubscriptions().size(), 2U);
  EXPECT_THAT(Lines(simulation, "init"),
              ElementsAre("info creating tallixing driver utility",
                          "error error 5 getting channels for driver VorrenMXDrv-(null)",
                          "default subscribed to group group VorrenMXDrv-(null)",
                          "error error 5 getting channels for driver Speaker-(null)",
                          "error error 5 getting channels for driver (null)-MCA",
                          "default subscribed to group group (null)-MCA",
                          "error error 5 getting channels for driver Haptics-Stats",
                          "info couldn't find any channels for driver group Haptics-Stats",
                          "default subscribed to group group Haptics-Stats"));
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
  EXPECT_THAT(Lines(simulation, "getSnapShot"), ElementsAre("info sampling driver Speaker-(null)",
                                                            "error TallixCreateSamples error 3"));
  EXPECT_THAT(Lines(simulation, kStatistics), Contains("error TallixCreateSamples error 3"));
}

}  // namespace
}  // namespace quarvel
