#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "Statistics/SharedDictionary.h"
#include "base/Value.h"
#include "base/Vocabulary.h"
#include "platform/Condition.h"
#include "platform/Log.h"

namespace quarvel {

/// A reporting session's identifier, chosen by its client.
using ReporterID = std::int64_t;

// Codes that the service itself uses or treats specially.

/// Category of the driver statistics.
inline constexpr std::uint32_t kCategoryTallixing =
    static_cast<std::uint32_t>(vocabulary::Kind::tallixing);
/// Category of a session's summary; no client's component or kind.
inline constexpr std::uint32_t kCategorySummary = 0xffff'ffff;
/// Type of the driver statistics.
inline constexpr std::uint16_t kTypeGeneric =
    static_cast<std::uint16_t>(vocabulary::MessageType::generic);
/// Type of a session's summary.
inline constexpr std::uint16_t kTypeSummary = 0xffff;
/// Telephony and long-form audio are the two types whose orientation is tracked.
inline constexpr std::uint16_t kServiceTypeTelephony =
    static_cast<std::uint16_t>(vocabulary::ServiceType::telephony);
/// Single messages of this type are delayed at random.
inline constexpr std::uint16_t kServiceTypeAlarms =
    static_cast<std::uint16_t>(vocabulary::ServiceType::alarms);
/// Type of a broadcast that finds no started session.
inline constexpr std::uint16_t kServiceTypeStandalone =
    static_cast<std::uint16_t>(vocabulary::ServiceType::standalone);
inline constexpr std::uint16_t kServiceTypeLongFormAudio =
    static_cast<std::uint16_t>(vocabulary::ServiceType::longFormAudio);
/// Messages sent while such a session is started are dropped: they never reach the agent.
inline constexpr std::uint16_t kServiceTypeTest =
    static_cast<std::uint16_t>(vocabulary::ServiceType::test);
/// Type of a session until its client sets one; also the reply for an unknown session.
inline constexpr std::uint16_t kServiceTypeUnknown =
    static_cast<std::uint16_t>(vocabulary::ServiceType::unknown);

/// The user information's key for the client application.
inline constexpr const char* kHostApplicationDisplayID = "HostApplicationDisplayID";

/// Name of the log subsystem, of the preferences domain and of the client at the agent.
inline constexpr const char* kSubsystem = "tarnwick.quarvel";

// All functions here may be called from any thread.

/// The composed name of a category code: "DSP_Playback" for 0x10000003. An unknown component leaves
/// a bare "_" in front, an unknown kind is "Undefined".
[[nodiscard]] std::string ZQReportingUtilityCategoryName(std::uint32_t category);

/// The name of a message type code, of which only the low 32 bits count; "Undefined" when unknown.
[[nodiscard]] std::string ZQReportingUtilityTypeName(std::int64_t type);

/// The same names as constant pieces, for callers that compose a longer text without an allocation.
using CategoryNamePieces = vocabulary::CategoryName;
[[nodiscard]] CategoryNamePieces ZQReportingUtilityCategoryNamePieces(std::uint32_t category);
[[nodiscard]] std::string_view ZQReportingUtilityTypeNameText(std::int64_t type);

/// The name of a service type; empty for a code that has none.
[[nodiscard]] std::string ZQReportingUtilityServiceTypeName(std::uint32_t serviceType);

/// The value of `userInfo` under "HostApplicationDisplayID", of any kind, or "Unknown".
[[nodiscard]] Value ZQReportingUtilityHostApplicationID(const SharedDictionary& userInfo);

/// Whether the device property "InternalBuild" is true. Read once per process.
[[nodiscard]] bool ZQReportingUtilityIsInternalBuild();

/// Blocks until `*done` is set or `seconds` have passed by the wall clock; returns whether it is
/// set. The setter holds the condition's lock and then signals. Every wake-up that finds it not set
/// starts a new full period, so signals can prolong the wait without bound. With a null `log`,
/// lines go to the default log.
[[nodiscard]] bool ZQReportingUtilityWait(Condition& condition, const bool* done,
                                          std::string_view waitingMessage,
                                          std::string_view timeOutMessage, const LogHandle* log,
                                          double seconds);

}  // namespace quarvel
