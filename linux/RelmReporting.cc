#include "platform/RelmReporting.h"

#include "linux/Service.h"
#include "store/database/SecureRandom.h"

namespace quarvel::RelmReporting {

RelmReportingToken newSecureHierarchyToken(const std::optional<RelmReportingToken>& parent) {
  return NewHierarchyToken(parent);
}

std::shared_ptr<RelmReportingSession> createAgentSession(const Dictionary& sessionInfo,
                                                         const Dictionary& userInfo,
                                                         const std::vector<std::string>&) {
  return Service::current().agent().createAgentSession(sessionInfo, userInfo);
}

Outcome sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                       std::uint16_t category, std::uint16_t type, const Payload& payload) {
  return Service::current().agent().sendOneMessage(sessionInfo, userInfo, category, type, payload);
}

}  // namespace quarvel::RelmReporting
