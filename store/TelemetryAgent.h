#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "base/Error.h"
#include "base/Payload.h"
#include "base/Value.h"
#include "platform/RelmReporting.h"
#include "store/TelemetryStore.h"

namespace quarvel {

class WorkQueue;

/// The telemetry agent: keeps sessions and their messages in the store, where each message that it
/// is given has been counted as on its way. Any thread.
class TelemetryAgent {
 public:
  /// `backends`: the configured ones, in the order in which they are told to sessions.
  TelemetryAgent(std::shared_ptr<TelemetryStore> store, std::vector<std::string> backends);

  /// As the operations of the same names (`platform/RelmReporting.h`). Keys that are missing, or
  /// hold another kind of value, leave their columns empty.
  [[nodiscard]] std::shared_ptr<RelmReportingSession> createAgentSession(
      const Dictionary& sessionInfo, const Dictionary& userInfo);
  Outcome sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                         std::uint16_t category, std::uint16_t type, const Payload& payload);

 private:
  class Session;
  /// What sessions share with the agent, and may keep longer.
  struct Core {
    std::shared_ptr<TelemetryStore> store;
    std::vector<std::string> backends;
    std::unique_ptr<WorkQueue> completions;  // where those run that the writer does not call
  };

  std::shared_ptr<const Core> core_;
};

}  // namespace quarvel
