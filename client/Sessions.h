#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include <quarvel/client.hpp>

#include "client/Replies.h"

namespace quarvel {

/// The lasting effect of a call on one session of this client: the part that must be repeated on a
/// new connection. A view for the length of the call.
struct SessionCall {
  enum class Kind : std::uint8_t {
    none,    // nothing to repeat
    create,  // the session exists from now on, without type and configuration
    setServiceType,
    setConfiguration,  // merged into the configuration set before
    start,
    stop,
    destroy  // nothing of the session is repeated any more
  };
  Kind kind = Kind::none;
  ReporterID session = 0;                          // the session that the call names
  Client::ServiceType serviceType{};               // of `setServiceType`
  const PayloadArgument* configuration = nullptr;  // of `setConfiguration`
};

/// The sessions that a client has created, as they must be restored on a new connection. Owned by
/// the connection and guarded by its mutex.
class Sessions {
 public:
  /// The state of one session, as the service has it after the calls sent.
  struct Session {
    ReporterID reporterID = 0;
    std::optional<Client::ServiceType> serviceType;  // none: never set
    std::optional<Dictionary> configuration;         // merged from all calls; none: never set
    bool started = false;                            // and not stopped since
    /// The number under which the start's reply is pending.
    std::optional<std::uint32_t> start;
    /// The start's reply, kept while there is no connection on which it could arrive.
    AnyReply stopped;
  };

  /// The result of recording a call.
  struct Recorded {
    /// The session is this client's, or was until this call.
    bool own = false;
    /// The kept reply of a start whose session this call has ended: the service will never answer
    /// it.
    AnyReply ended;
  };
  /// Records a call's lasting effect. A start that is the session's first is pending under
  /// `number`.
  [[nodiscard]] Recorded record(const SessionCall& call, std::optional<std::uint32_t> number);

  /// Keeps `stopped` until the session is started on a new connection, when it is the reply of the
  /// start that was pending under `number`. False, and `stopped` is untouched, when it is not.
  [[nodiscard]] bool keepReply(ReporterID reporterID, std::optional<std::uint32_t> number,
                               AnyReply& stopped);

  /// In the order in which they were created, for the calls that restore them. Valid until a call
  /// is recorded.
  [[nodiscard]] std::vector<Session>& all() { return sessions_; }

 private:
  /// Null when this client has no such session.
  [[nodiscard]] Session* find(ReporterID session);

  std::vector<Session> sessions_;  // few; searched one by one
};

}  // namespace quarvel
