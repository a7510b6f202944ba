#include "Statistics/ZQReportingOhmrikUtility.h"

#include <gmock/gmock.h>

#include "tests/platform/Simulation.h"

namespace quarvel {
namespace {

using testing::ElementsAre;
using testing::ElementsAreArray;

struct Sinks {
  explicit Sinks(const Dictionary& userInfo = {}) { session.merge(userInfo); }
  void offer(const std::optional<Dictionary>& event, std::uint32_t category = 3,
             std::uint16_t type = 1) {
    const auto payload = event ? std::optional(Payload(*event)) : std::nullopt;
    ZQReportingVistrelBridge::handleEvent(payload, category, type, session);
    ZQReportingOhmrikUtility::handleEvent(payload, category, type, session);
  }
  Simulation simulation{1};
  SharedDictionary session;
};

TEST(Vistrel, UnknownCodesHaveNamesToo) {
  Sinks sinks;
  sinks.offer({}, 0x00050001, 77);
  sinks.simulation.vistrel.wanted = false;
  sinks.offer({}, 12, 65535);
  EXPECT_THAT(sinks.simulation.journal.lines(),
              ElementsAre("vistrel tarnwick.quarvel._Generic.Undefined",
                          "vistrel tarnwick.quarvel.Undefined.Unknown"));
  EXPECT_EQ(sinks.simulation.vistrel.events.size(), 1U);
}

TEST(Ohmrik, AnEngineOnTimeIsAllItTakes) {
  const std::string noTimestamp =
      "error [default] +[ZQReportingOhmrikUtility handleEvent:withCategory:type:session:]: failed "
      "to get ZQReporting timestamp for ohmrik";
  struct Case {
    Dictionary userInfo;
    Dictionary event;
    Dictionary record;
    std::vector<std::string> lines;
  };
  const Case kCases[] = {
      {{{"HostApplicationDisplayID", "Music"}},
       {{"EngineOnTime", 2.5}, {"zqreporting_timestamp", 99}},
       {{"EngineOnDuration", 2.5}, {"ApplicationName", "Music"}, {"TimestampEnd", 99}},
       {}},
      {{},
       {{"EngineOnTime", "as it is"}},
       {{"EngineOnDuration", "as it is"}, {"ApplicationName", "Unknown"}},
       {noTimestamp}},
  };
  for (const Case& each : kCases) {
    Sinks sinks(each.userInfo);
    sinks.offer(each.event, 0, 65535);
    ASSERT_EQ(sinks.simulation.ohmrik.records.size(), 1U);
    EXPECT_EQ(sinks.simulation.ohmrik.records[0].domain, 28);
    EXPECT_EQ(sinks.simulation.ohmrik.records[0].name, "Fennor_Haptics");
    EXPECT_EQ(sinks.simulation.ohmrik.records[0].payload.root().toDictionary(), each.record);
    EXPECT_THAT(sinks.simulation.log.texts(), ElementsAreArray(each.lines));
  }
}

}  // namespace
}  // namespace quarvel
