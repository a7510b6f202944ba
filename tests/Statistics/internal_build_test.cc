#include <gmock/gmock.h>

#include "tests/Statistics/Service/CoreFixtures.h"

// Additional work of internal builds. A program of its own, since a process reads only once whether
// it belongs to one.

namespace quarvel {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

struct InternalBuild : testing::Test {
  // The first answer counts for the process; later simulations are not asked.
  static void SetUpTestSuite() {
    Simulation simulation(1);
    simulation.internalBuild = true;
    ASSERT_TRUE(ZQReportingUtilityIsInternalBuild());
    simulation.internalBuild = false;
    ASSERT_TRUE(ZQReportingUtilityIsInternalBuild());
  }
};

TEST_F(InternalBuild, FileErrorsAreLoggedAndDoNotAffectTheSummary) {
  SessionOwner owner(1);
  owner.files.directoryError = Error::because("files", 13, "no");
  owner.files.writeError = Error::because("files", 2, "nowhere");
  owner.start();
  owner.send();
  owner.stop();
  owner.run();
  EXPECT_EQ(owner.delivered().size(), 2U);
  const std::string function = "error zqrr -[ZQReportingSession createSummaryEventForSession]: ";
  EXPECT_THAT(
      owner.errors(),
      ElementsAre(function + "can't create logging directory at /private/var/mobile/Library/Logs/"
                             "Faultkeep/DiagnosticLogs/Audio/Reporting: files 13: no",
                  function + "jsonOutput writeToURL: files 2: nowhere"));
}

TEST_F(InternalBuild, OrientationIsTrackedForTwoServiceTypesExceptOnDeviceClass6) {
  const std::tuple<std::uint16_t, std::optional<std::int64_t>, bool> kCases[] = {
      {7, 1, true},  {2, 1, true},  {7, std::nullopt, true}, {7, 6, false},
      {2, 6, false}, {8, 1, false}, {65535, 1, false}};
  for (const auto& [serviceType, deviceClass, tracked] : kCases) {
    SCOPED_TRACE(serviceType);
    SessionOwner owner(1, serviceType);
    owner.deviceClass = deviceClass;
    owner.start();
    const std::size_t expected = tracked ? 1 : 0;
    EXPECT_EQ(owner.orientation.device.count("ZQReportingService 7"), expected);
    EXPECT_EQ(owner.orientation.ui.count("ZQReportingService 7"), expected);
    owner.stop();
    EXPECT_THAT(owner.orientation.device, IsEmpty());
    EXPECT_THAT(owner.orientation.ui, IsEmpty());
  }
}

TEST_F(InternalBuild, TheSummaryHasOrientationChangesToTheMillisecond) {
  for (const auto seed : Seeds()) {
    SessionOwner owner(seed, kServiceTypeTelephony);
    owner.start();
    owner.runFor(1234560us);
    SimulatedOrientation::turn(owner.orientation.device, Orientation::landscapeLeft);
    owner.runFor(1s);
    SimulatedOrientation::turn(owner.orientation.ui, Orientation::portrait);
    owner.runFor(1s);
    owner.scheduler.setWallClock(owner.scheduler.wallClock() - 10s);  // before the start
    SimulatedOrientation::turn(owner.orientation.device, Orientation::portrait);
    owner.runFor(0s);
    owner.stop();
    owner.run();
    EXPECT_EQ(owner.delivered().at(0).payload.root().toDictionary(),
              (Dictionary{{"ZQ_Session_Summary_Event", "2"},
                          {"device_orientation", "landscapeLeft,portrait"},
                          {"device_orientation_time", "1.235,6.765"},
                          {"ui_orientation", "portrait"},
                          {"ui_orientation_time", "2.235"}}));
  }
}

}  // namespace
}  // namespace quarvel
