#include "Statistics/Service/ZQReportingServiceProtocol.h"

#include <array>

namespace quarvel {

const ExportedInterface& ZQReportingServiceProtocolInterface() {
  using P = ZQReportingServiceProtocol;
  static constexpr std::array kMethods = {
      Exported<&P::createReportingSession>("createReportingSession:reply:"),
      Exported<&P::setServiceType>("setServiceType:reportingSession:reply:"),
      Exported<&P::getServiceNameForReporterID>("getServiceNameForReporterID:reply:"),
      Exported<&P::setConfiguration>("setConfiguration:forReporterID:reply:"),
      Exported<&P::startReportingSessionForID>("startReportingSessionForID:reply:"),
      Exported<&P::sendMessage>("sendMessage:withCategory:andType:forReportingIDs:reply:"),
      Exported<&P::stopReportingSessionForID>("stopReportingSessionForID:reply:"),
      Exported<&P::destroyReportingSession>("destroyReportingSession:reply:"),
      Exported<&P::reporterID>("reporterID:valid:"),
      Exported<&P::getAllReporters>("getAllReporters:"),
      Exported<&P::killService>("killService:"),
  };
  static constexpr ExportedInterface kInterface = {"ZQReportingServiceProtocol", kMethods};
  return kInterface;
}

}  // namespace quarvel
