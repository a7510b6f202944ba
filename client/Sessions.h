#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include <quarvel/client.hpp>

#include "client/Replies.h"

namespace quarvel {

/// What a call asks of one session of this client, as far as it outlives the connection.
struct SessionCall {
  enum class Kind : std::uint8_t {
    none,
    create,
    setServiceType,
    setConfiguration,
    start,
    stop,
    destroy
  };
  Kind kind = Kind::none;
  ReporterID session = 0;
  Client::ServiceType serviceType{};               // of `setServiceType`
  const PayloadArgument* configuration = nullptr;  // of `setConfiguration`
};

/// The sessions that a client has asked for, so that they can be made anew on another connection.
/// Not synchronised.
class Sessions {
 public:
  struct Session {
    ReporterID reporterID = 0;
    std::optional<Client::ServiceType> serviceType;
    std::optional<Dictionary> configuration;
    bool started = false;
    /// Under which number the start's reply is awaited.
    std::optional<std::uint32_t> start;
    /// The start's reply, while there is no connection on which it could be awaited.
    AnyReply stopped;
  };

  struct Noted {
    /// The session is this client's own, or was until this call.
    bool own = false;
    /// The reply of a start that nobody will answer any more: it was kept, and its session has
    /// gone.
    AnyReply ended;
  };
  /// Takes note of a call; a start that is the session's first is awaited under `number`.
  [[nodiscard]] Noted note(const SessionCall& call, std::optional<std::uint32_t> number);

  /// Takes the reply of the start that was awaited under `number` and would have told of the
  /// session's end, until the session is started anew. False: it is no such reply, and stays.
  [[nodiscard]] bool keep(ReporterID reporterID, std::optional<std::uint32_t> number,
                          AnyReply& stopped);

  /// In the order in which they were created.
  [[nodiscard]] std::vector<Session>& all() { return sessions_; }

 private:
  [[nodiscard]] Session* find(ReporterID session);

  std::vector<Session> sessions_;
};

}  // namespace quarvel
