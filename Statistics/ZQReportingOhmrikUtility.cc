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
  // Most events are not wanted, so the name is composed without an allocation.
  const CategoryNamePieces names = ZQReportingUtilityCategoryNamePieces(category);
  fmt::memory_buffer name;
  for (const std::string_view piece :
       {std::string_view("tarnwick.quarvel."), names.component, names.kind, std::string_view("."),
        ZQReportingUtilityTypeNameText(type)}) {
    name.append(piece);
  }
  VistrelSendEventLazy({name.data(), name.size()}, [&event, &session] {
    return event.value_or(Payload()).setting(kHostApplicationDisplayID,
                                             ZQReportingUtilityHostApplicationID(session));
  });
}

}  // namespace quarvel
