#include "platform/RelmReporting.h"

#include "linux/ProcessStore.h"
#include "store/TelemetryAgent.h"
#include "store/database/SecureRandom.h"
#include "system/Configuration.h"

namespace quarvel::RelmReporting {

namespace {

TelemetryAgent& ProcessAgent() {
  // Never destroyed: queues may call it until the process is gone.
  static auto& agent =
      *new TelemetryAgent(ProcessTelemetryStore(), Configuration::process().agent.backends);
  return agent;
}

}  // namespace

RelmReportingToken newSecureHierarchyToken(const std::optional<RelmReportingToken>& parent) {
  return NewHierarchyToken(parent);
}

std::shared_ptr<RelmReportingSession> createAgentSession(const Dictionary& sessionInfo,
                                                         const Dictionary& userInfo,
                                                         const std::vector<std::string>&) {
  return ProcessAgent().createAgentSession(sessionInfo, userInfo);
}

Outcome sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                       std::uint16_t category, std::uint16_t type, const Payload& payload) {
  return ProcessAgent().sendOneMessage(sessionInfo, userInfo, category, type, payload);
}

}  // namespace quarvel::RelmReporting
