#include "Statistics/ZQReportingUtility.h"

#include <array>
#include <chrono>

#include "base/Mutex.h"
#include "platform/Clock.h"
#include "platform/DeviceProperties.h"

namespace quarvel {

namespace {

constexpr std::array<std::string_view, 12> kCategoryKinds = {
    "Undefined",     "Generic",     "Record", "Playback",  "PlaybackAndRecord", "Setup",
    "ClientRequest", "RouteChange", "Error",  "Tallixing", "Performance",       "Volume"};

constexpr std::array<std::string_view, 6> kTypes = {"Generic", "Start", "Stop",
                                                    "Setup",   "Error", "IssueDetector"};

constexpr std::array<std::string_view, 12> kServiceTypes = {
    "generic",          "kivo",          "telephony",
    "haptics",          "alarms",        "standalone",
    "soundautoconfig",  "longformaudio", "nonlongformaudio",
    "audiodeviceusage", "alerts",        "test"};

std::string_view ComponentWord(std::uint32_t component) {
  switch (component) {
    case 0x0800'0000:
      return "Session_";
    case 0x1000'0000:
      return "DSP_";
    case 0x2000'0000:
      return "HAL_";
    case 0x4000'0000:
      return "Routing_";
    case 0x8000'0000:
      return "Toolbox_";
    default:
      return "_";
  }
}

}  // namespace

CategoryNamePieces ZQReportingUtilityCategoryNamePieces(std::uint32_t category) {
  const bool hasComponent = category >= 0x1'0000 && category != 0xffff'ffff;
  const std::uint32_t kind = category & 0xffff;
  return {hasComponent ? ComponentWord(category & 0xffff'0000) : std::string_view(),
          kCategoryKinds[kind < kCategoryKinds.size() ? kind : 0]};
}

std::string ZQReportingUtilityCategoryName(std::uint32_t category) {
  const CategoryNamePieces pieces = ZQReportingUtilityCategoryNamePieces(category);
  return std::string(pieces.component).append(pieces.kind);
}

std::string_view ZQReportingUtilityTypeNameText(std::int64_t type) {
  const auto code = static_cast<std::uint32_t>(type);
  if (code < kTypes.size()) return kTypes[code];
  return code == 65535 ? "Unknown" : "Undefined";
}

std::string ZQReportingUtilityTypeName(std::int64_t type) {
  return std::string(ZQReportingUtilityTypeNameText(type));
}

std::string ZQReportingUtilityServiceTypeName(std::uint32_t serviceType) {
  if (serviceType < kServiceTypes.size()) return std::string(kServiceTypes[serviceType]);
  return serviceType == kServiceTypeUnknown ? "unknown" : "";
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
