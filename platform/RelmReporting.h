#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Error.h"
#include "base/Payload.h"
#include "base/Value.h"

namespace quarvel {

// The telemetry reporting agent. All operations may be called from any thread. Sending may block
// while the agent has no room; a refusal is an error value, never an exception.

/// Keys of the session info.
inline constexpr const char* kRelmReportingSessionInfoClientType = "ClientType";
inline constexpr const char* kRelmReportingSessionInfoClientVersion = "ClientVersion";
inline constexpr const char* kRelmReportingSessionInfoSessionID = "SessionID";
inline constexpr const char* kRelmReportingSessionInfoBatchEvent = "BatchEvent";
inline constexpr const char* kRelmReportingSessionInfoHierarchyToken = "HierarchyToken";
/// Keys of the user information.
inline constexpr const char* kRelmReportingUserInfoClientName = "ClientName";
inline constexpr const char* kRelmReportingUserInfoServiceName = "ServiceName";

/// Places a session in a hierarchy: opaque text, unique and impossible to guess.
using RelmReportingToken = std::string;

/// One session with the agent. Owned by its references; the last one releases it without a flush.
class RelmReportingSession {
 public:
  /// Called with the names of the backends that can take data now, or none when none was found.
  using ConfigurationCompletion =
      std::function<void(const std::optional<std::vector<std::string>>& backends)>;
  /// Called with no error on success.
  using FlushCompletion = std::function<void(const std::optional<Error>& error)>;

  virtual ~RelmReportingSession() = default;

  /// Looks for backends without waiting for a network. Returns at once; `completion` is called
  /// once, later, on a thread of the agent.
  virtual void startConfiguration(ConfigurationCompletion completion) = 0;
  /// Hands a message over. Success means that the agent will keep it. May block for room.
  virtual Outcome agentSendMessage(std::uint16_t category, std::uint16_t type,
                                   const Payload& payload) = 0;
  /// Makes every message sent before durable. Returns at once; `completion` is called once, later,
  /// on a thread of the agent, even when the session has been released by then.
  virtual void flushMessages(FlushCompletion completion) = 0;
  /// For log lines.
  [[nodiscard]] virtual std::string description() const = 0;
};

namespace RelmReporting {

/// A new token below `parent`, or at the top of a new hierarchy.
[[nodiscard]] RelmReportingToken newSecureHierarchyToken(
    const std::optional<RelmReportingToken>& parent);

/// A new session, never absent. Both dictionaries may have unknown keys and lack known ones.
[[nodiscard]] std::shared_ptr<RelmReportingSession> createAgentSession(
    const Dictionary& sessionInfo, const Dictionary& userInfo,
    const std::vector<std::string>& frameworksToCheck);

/// Hands over one message that belongs to no session. May block for room.
Outcome sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                       std::uint16_t category, std::uint16_t type, const Payload& payload);

}  // namespace RelmReporting

}  // namespace quarvel
