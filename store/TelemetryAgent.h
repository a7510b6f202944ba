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

/// The telemetry agent: adds sessions and their messages to the store. Each message was counted as
/// accepted before. Owned by the service; its sessions may live longer. Any thread.
class TelemetryAgent {
 public:
  /// `backends`: the configured ones, in the order in which sessions get them.
  /// Shares the store, also with its sessions.
  TelemetryAgent(std::shared_ptr<TelemetryStore> store, std::vector<std::string> backends);

  /// Implement the operations of the same names (`platform/RelmReporting.h`). A key that is
  /// missing, or holds another kind of value, leaves its column empty.
  [[nodiscard]] std::shared_ptr<RelmReportingSession> createAgentSession(
      const Dictionary& sessionInfo, const Dictionary& userInfo);
  /// Waits while the store has no room. Errors: the store's refusal.
  Outcome sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                         std::uint16_t category, std::uint16_t type, const Payload& payload);

 private:
  class Session;  // a `RelmReportingSession` on the store
  /// Shared with the sessions, which may keep it longer than the agent.
  struct Core {
    std::shared_ptr<TelemetryStore> store;
    std::vector<std::string> backends;       // available while the store is open
    std::unique_ptr<WorkQueue> completions;  // runs completions that the writer does not call
  };

  std::shared_ptr<const Core> core_;  // constant after construction
};

}  // namespace quarvel
