#pragma once

#include <concepts>
#include <span>
#include <string_view>
#include <tuple>
#include <type_traits>

#include <quarvel/client.hpp>

#include "base/MessagePack.h"
#include "client/Sessions.h"

// The service's operations as requests: name, arguments in order, and the lasting effect on a
// session. All are views for the length of one call.

namespace quarvel::operations {

// Each writes one argument as the wire has it. The writer appends to the connection's gathered
// bytes.

template <std::integral Integer>
void Write(MessagePackWriter& writer, Integer number) {
  writer.integer(number);
}
/// A code as its number, also outside the tables of the vocabulary.
template <class Enumeration>
requires std::is_enum_v<Enumeration>
void Write(MessagePackWriter& writer, Enumeration code) {
  writer.integer(static_cast<std::underlying_type_t<Enumeration>>(code));
}
/// Component and kind as one number of 32 bits.
inline void Write(MessagePackWriter& writer, vocabulary::Category category) {
  writer.integer(category.code);
}
/// A payload's own bytes, a dictionary encoded here, or nil for an absent one.
inline void Write(MessagePackWriter& writer, const PayloadArgument& argument) {
  if (argument.payload() != nullptr) {
    writer.encoded(argument.payload()->encoded());
  } else if (argument.dictionary() != nullptr) {
    writer.value(*argument.dictionary());
  } else {
    writer.nil();
  }
}
/// A list of session IDs; nil addresses every session of the service.
inline void Write(MessagePackWriter& writer, const Recipients& recipients) {
  if (!recipients.sessions()) return writer.nil();
  writer.list(recipients.sessions()->size());
  for (const ReporterID session : *recipients.sessions()) writer.integer(session);
}

/// One operation with its typed arguments.
template <class... Arguments>
struct Request {
  std::string_view operation;  // the full keyword name, a constant
  SessionCall session;         // the lasting effect; kind `none` when there is none
  std::tuple<const Arguments&...> arguments;

  /// The arguments as a MessagePack list.
  void write(MessagePackWriter& writer) const {
    writer.list(sizeof...(Arguments));
    std::apply([&](const auto&... argument) { (Write(writer, argument), ...); }, arguments);
  }
};

/// Any operation by its full keyword name, with any arguments. Has no lasting effect that the
/// client knows.
struct AnyRequest {
  std::string_view operation;  // as the caller gives it
  std::span<const Value> arguments;
  SessionCall session;  // always of kind `none`

  /// The arguments as a MessagePack list.
  void write(MessagePackWriter& writer) const {
    writer.list(arguments.size());
    for (const Value& argument : arguments) writer.value(argument);
  }
};

using Kind = SessionCall::Kind;

// The operations by the first keywords of their names. An argument must outlive the request.

/// Reply: whether the session was created. Lasting: the session exists.
inline Request<ReporterID> Create(const ReporterID& session) {
  return {"createReportingSession:reply:", {Kind::create, session, {}, {}}, std::tie(session)};
}
/// Reply: whether the session exists. Lasting: its type.
inline Request<Client::ServiceType, ReporterID> SetServiceType(const Client::ServiceType& type,
                                                               const ReporterID& session) {
  return {"setServiceType:reportingSession:reply:",
          {Kind::setServiceType, session, type, {}},
          std::tie(type, session)};
}
/// Reply: the code of the session's service type, 65535 when it is unknown.
inline Request<ReporterID> GetServiceName(const ReporterID& session) {
  return {"getServiceNameForReporterID:reply:", {}, std::tie(session)};
}
/// Reply: true. Lasting: the merged configuration.
inline Request<PayloadArgument, ReporterID> SetConfiguration(const PayloadArgument& configuration,
                                                             const ReporterID& session) {
  return {"setConfiguration:forReporterID:reply:",
          {Kind::setConfiguration, session, {}, &configuration},
          std::tie(configuration, session)};
}
/// Reply: comes when the session has stopped, not when it has started. Lasting: the session runs.
inline Request<ReporterID> Start(const ReporterID& session) {
  return {"startReportingSessionForID:reply:", {Kind::start, session, {}, {}}, std::tie(session)};
}
/// Reply: without a value, when the service has accepted the message. No lasting effect.
inline Request<PayloadArgument, vocabulary::Category, Client::MessageType, Recipients> SendMessage(
    const PayloadArgument& payload, const vocabulary::Category& category,
    const Client::MessageType& type, const Recipients& recipients) {
  return {"sendMessage:withCategory:andType:forReportingIDs:reply:",
          {},
          std::tie(payload, category, type, recipients)};
}
/// Reply: whether the session was stopped. Lasting: the session does not run.
inline Request<ReporterID> Stop(const ReporterID& session) {
  return {"stopReportingSessionForID:reply:", {Kind::stop, session, {}, {}}, std::tie(session)};
}
/// Reply: whether the session was destroyed. Lasting: the session does not exist.
inline Request<ReporterID> Destroy(const ReporterID& session) {
  return {"destroyReportingSession:reply:", {Kind::destroy, session, {}, {}}, std::tie(session)};
}
/// Reply: the session's ID and service type; the ID 0 when no client has such a session.
inline Request<ReporterID> Valid(const ReporterID& session) {
  return {"reporterID:valid:", {}, std::tie(session)};
}
/// Reply: the IDs of all clients' sessions.
inline Request<> GetAllReporters() {
  return {"getAllReporters:", {}, {}};
}
/// No reply: the service ends, and with it the connection.
inline Request<> KillService() {
  return {"killService:", {}, {}};
}

}  // namespace quarvel::operations
