#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "Statistics/ZQReportingUtility.h"
#include "base/Payload.h"
#include "base/Value.h"
#include "platform/ExportedInterface.h"
#include "platform/Reply.h"

namespace quarvel {

/// The interface that audio clients call, in the order in which it is exported. Each operation is
/// called on the connection's thread and returns at once. The work and the reply follow on the
/// `ServerQueue`, in the order of the calls of all clients.
///
/// An unknown identifier is not an error and gets a neutral reply. The only error that a client can
/// receive says that reporting is switched off (`sendMessage`).
class ZQReportingServiceProtocol : public ExportedObject {
 public:
  /// Creates a session. One that this client already has under `reporterID` is dropped, not
  /// stopped. Replies true.
  virtual void createReportingSession(ReporterID reporterID, BoolReply reply) = 0;
  /// Sets the service type of one of the caller's own sessions. Replies true, found or not.
  virtual void setServiceType(std::uint16_t serviceType, ReporterID reportingSession,
                              BoolReply reply) = 0;
  /// Replies the numeric service type of any client's session, 65535 when it is unknown; twice for
  /// identifier 0.
  virtual void getServiceNameForReporterID(ReporterID reporterID, ServiceTypeReply reply) = 0;
  /// Merges `configuration` into the user information of one of the caller's own sessions; an
  /// absent one changes nothing. Replies true, found or not.
  virtual void setConfiguration(std::optional<Dictionary> configuration, ReporterID reporterID,
                                BoolReply reply) = 0;
  /// Starts any client's session. The reply, true, comes when the session stops; none ever comes
  /// for a session that is unknown or started already.
  virtual void startReportingSessionForID(ReporterID reporterID, BoolReply reply) = 0;
  /// Routes a message to the named sessions, any client's; with an absent list to every started
  /// session, or as a single message when there is none. Replies with no error, or with domain
  /// "tarnwick.audio.reporting", code 1, while reporting is switched off.
  virtual void sendMessage(std::optional<Payload> payload, std::uint32_t category,
                           std::uint16_t type, std::optional<std::vector<ReporterID>> reportingIDs,
                           ErrorReply reply) = 0;
  /// Stops one of the caller's own sessions. Replies true, found or not.
  virtual void stopReportingSessionForID(ReporterID reporterID, BoolReply reply) = 0;
  /// Stops, if started, and drops one of the caller's own sessions. Replies true, found or not.
  virtual void destroyReportingSession(ReporterID reporterID, BoolReply reply) = 0;
  /// Replies "reporterID" and "serviceType" of any client's session, or 0 and 65535.
  virtual void reporterID(ReporterID reporterID, DictionaryReply valid) = 0;
  /// Replies the identifiers of all sessions of all clients.
  virtual void getAllReporters(ListReply reply) = 0;
  /// Ends the process with status 2. Never replies.
  virtual void killService(BoolReply reply) = 0;
};

/// The protocol as connections export it.
[[nodiscard]] const ExportedInterface& ZQReportingServiceProtocolInterface();

}  // namespace quarvel
