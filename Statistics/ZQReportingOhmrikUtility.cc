#include "Statistics/ZQReportingOhmrikUtility.h"

#include <fmt/format.h>

#include "Statistics/ZQReportingUtility.h"
#include "platform/Log.h"
#include "platform/Ohmrik.h"
#include "platform/Vistrel.h"

namespace quarvel {

namespace {

constexpr std::int32_t kPowerLogDomain = 28;
constexpr LogHandle kDefaultLog = nullptr;

}  // namespace

void ZQReportingOhmrikUtility::handleEvent(const std::optional<Payload>& event,
                                           std::uint32_t /*category*/, std::uint16_t /*type*/,
                                           const SharedDictionary& session) {
  ZQ_FUNCTION("+[ZQReportingOhmrikUtility handleEvent:withCategory:type:session:]");
  if (!event) return;
  const auto engineOnTime = event->find("EngineOnTime");
  if (!engineOnTime) return;
  Dictionary record = {{"EngineOnDuration", engineOnTime->toValue()}};
  const Value application = ZQReportingUtilityHostApplicationID(session);
  if (!application.isNil()) {
    record.set("ApplicationName", application);
  } else {
    ZQ_LOG(kDefaultLog, error, "failed to get app name for ohmrik");
  }
  if (const auto timestamp = event->find("zqreporting_timestamp")) {
    record.set("TimestampEnd", timestamp->toValue());
  } else {
    ZQ_LOG(kDefaultLog, error, "failed to get ZQReporting timestamp for ohmrik");
  }
  OhmrikLogRegisteredEvent(kPowerLogDomain, "Fennor_Haptics", Payload(record), nullptr);
}

void ZQReportingVistrelBridge::handleEvent(const std::optional<Payload>& event,
                                           std::uint32_t category, std::uint16_t type,
                                           const SharedDictionary& session) {
  const std::string name =
      fmt::format("tarnwick.quarvel.{}.{}", ZQReportingUtilityCategoryName(category),
                  ZQReportingUtilityTypeName(type));
  VistrelSendEventLazy(name, [&event, &session] {
    return event.value_or(Payload()).setting(kHostApplicationDisplayID,
                                             ZQReportingUtilityHostApplicationID(session));
  });
}

}  // namespace quarvel
