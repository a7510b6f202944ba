#pragma once

#include <cstdint>
#include <optional>

#include "Statistics/SharedDictionary.h"
#include "base/Payload.h"

namespace quarvel {

// The two event sinks: each message that is routed to a session is offered to both. Stateless;
// called on the `ServerQueue`; never report a failure. `session` is the session's user information.

/// Power-usage log, for messages that carry an engine-on time.
class ZQReportingOhmrikUtility {
 public:
  /// Writes one power-log record when `event` has an "EngineOnTime": that time, the application's
  /// name, and the message's timestamp where it has one. Category and type do not matter.
  static void handleEvent(const std::optional<Payload>& event, std::uint32_t category,
                          std::uint16_t type, const SharedDictionary& session);
};

/// Analytics sink.
class ZQReportingVistrelBridge {
 public:
  /// Offers the event "tarnwick.quarvel.<category name>.<type name>", whose payload is `event`
  /// (empty when absent) with the session's application under "HostApplicationDisplayID".
  static void handleEvent(const std::optional<Payload>& event, std::uint32_t category,
                          std::uint16_t type, const SharedDictionary& session);
};

}  // namespace quarvel
