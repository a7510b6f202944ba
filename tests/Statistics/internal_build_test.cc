#include <gmock/gmock.h>

#include "Statistics/ZQReportingUtility.h"
#include "tests/platform/Simulation.h"

// A program of its own: whether the build is an internal one is asked once a process.

namespace quarvel {
namespace {

TEST(InternalBuild, IsAskedForOnce) {
  Simulation simulation(1);
  simulation.deviceProperties["InternalBuild"] = true;
  EXPECT_TRUE(ZQReportingUtilityIsInternalBuild());
  simulation.deviceProperties["InternalBuild"] = false;
  EXPECT_TRUE(ZQReportingUtilityIsInternalBuild());
}

}  // namespace
}  // namespace quarvel
