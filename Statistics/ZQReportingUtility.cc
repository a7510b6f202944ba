#include "Statistics/ZQReportingUtility.h"

#include <chrono>

#include "base/Mutex.h"
#include "platform/Clock.h"
#include "platform/DeviceProperties.h"

namespace quarvel {

CategoryNamePieces ZQReportingUtilityCategoryNamePieces(std::uint32_t category) {
  return vocabulary::PiecesOf(vocabulary::Category(category));
}

std::string ZQReportingUtilityCategoryName(std::uint32_t category) {
  return vocabulary::NameOf(vocabulary::Category(category));
}

std::string_view ZQReportingUtilityTypeNameText(std::int64_t type) {
  return vocabulary::TypeName(static_cast<std::uint32_t>(type));
}

std::string ZQReportingUtilityTypeName(std::int64_t type) {
  return std::string(ZQReportingUtilityTypeNameText(type));
}

std::string ZQReportingUtilityServiceTypeName(std::uint32_t serviceType) {
  return std::string(vocabulary::ServiceTypeName(serviceType));
}

Value ZQReportingUtilityHostApplicationID(const SharedDictionary& userInfo) {
  return userInfo.find(kHostApplicationDisplayID).value_or("Unknown");
}

bool ZQReportingUtilityIsInternalBuild() {
  static const bool internalBuild = DevicePropertyBoolean("InternalBuild").value_or(false);
  return internalBuild;
}

bool ZQReportingUtilityWait(Condition& condition, const bool* done, std::string_view waitingMessage,
                            std::string_view timeOutMessage, const LogHandle* log, double seconds) {
  ZQ_FUNCTION("ZQReportingUtilityWait");
  const LogHandle scope = log == nullptr ? nullptr : *log;
  const auto period =
      std::chrono::duration_cast<std::chrono::microseconds>(std::chrono::duration<double>(seconds));
  const BasicMutexLock<Condition> lock(condition);
  if (*done) return true;
  for (;;) {
    ZQ_LOG(scope, standard, "{}", waitingMessage);
    if (!condition.waitUntil(CurrentDate() + period)) break;
    ZQ_LOG(scope, standard, "continuing");
    if (*done) return true;
  }
  ZQ_LOG(scope, error, "{}", timeOutMessage);
  return false;
}

}  // namespace quarvel
