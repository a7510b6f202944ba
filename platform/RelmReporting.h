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

// The telemetry reporting agent. Its operations may be called from any thread. Those that send may
// hold their caller back while the agent has no room; a refusal is an error, never an exception.

/// Keys of the session info.
inline constexpr const char* kRelmReportingSessionInfoClientType = "ClientType";
inline constexpr const char* kRelmReportingSessionInfoClientVersion = "ClientVersion";
inline constexpr const char* kRelmReportingSessionInfoSessionID = "SessionID";
inline constexpr const char* kRelmReportingSessionInfoBatchEvent = "BatchEvent";
inline constexpr const char* kRelmReportingSessionInfoHierarchyToken = "HierarchyToken";
/// Keys of the user information.
inline constexpr const char* kRelmReportingUserInfoClientName = "ClientName";
inline constexpr const char* kRelmReportingUserInfoServiceName = "ServiceName";

/// A token that places sessions in a hierarchy; opaque text, unique and not to be guessed.
using RelmReportingToken = std::string;

/// One session with the agent. Released when its last reference goes, without a flush.
class RelmReportingSession {
 public:
  /// The names of the backends that can take data now, or none when none was found.
  using ConfigurationCompletion =
      std::function<void(const std::optional<std::vector<std::string>>& backends)>;
  /// None on success.
  using FlushCompletion = std::function<void(const std::optional<Error>& error)>;

  virtual ~RelmReportingSession() = default;

  /// Looks for backends. Returns at once; `completion` is called once, later, on a thread of the
  /// agent. It does not wait for a network.
  virtual void startConfiguration(ConfigurationCompletion completion) = 0;
  /// Hands a message over. Success means that the agent will keep it.
  virtual Outcome agentSendMessage(std::uint16_t category, std::uint16_t type,
                                   const Payload& payload) = 0;
  /// Makes everything that was sent before safe. Returns at once; `completion` is called once,
  /// later, on a thread of the agent, also when the session has been released meanwhile.
  virtual void flushMessages(FlushCompletion completion) = 0;
  /// For log lines.
  [[nodiscard]] virtual std::string description() const = 0;
};

namespace RelmReporting {

[[nodiscard]] RelmReportingToken newSecureHierarchyToken(
    const std::optional<RelmReportingToken>& parent);

/// Never absent. Unknown keys and missing ones are tolerated in both dictionaries.
[[nodiscard]] std::shared_ptr<RelmReportingSession> createAgentSession(
    const Dictionary& sessionInfo, const Dictionary& userInfo,
    const std::vector<std::string>& frameworksToCheck);

/// Hands over one message that belongs to no session.
Outcome sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                       std::uint16_t category, std::uint16_t type, const Payload& payload);

}  // namespace RelmReporting

}  // namespace quarvel
