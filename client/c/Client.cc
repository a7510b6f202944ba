#include <algorithm>
#include <optional>
#include <span>
#include <type_traits>
#include <utility>
#include <vector>

#include "client/c/Boundary.h"

using quarvel::Client;
using quarvel::PayloadArgument;
using quarvel::Recipients;
using quarvel::ReporterID;
using quarvel::Result;
using quarvel::c::Fill;
using quarvel::c::Guard;

namespace {

// ---- Options

Client::Options AsOptions(const quarvel_options& given) {
  Client::Options options;
  if (given.socket_path != nullptr) options.socketPath = given.socket_path;
  options.driver =
      given.driver == QUARVEL_CALLER ? Client::Driver::caller : Client::Driver::ownThread;
  if (given.gathered_bytes > 0) options.gatheredBytes = given.gathered_bytes;
  if (given.reconnect) {
    Client::Reconnect reconnect;
    if (given.first_delay_ms > 0) {
      reconnect.firstDelay = std::chrono::milliseconds(given.first_delay_ms);
    }
    if (given.longest_delay_ms > 0) {
      reconnect.longestDelay = std::chrono::milliseconds(given.longest_delay_ms);
    }
    options.reconnect = reconnect;
  }
  if (given.connection_changed != nullptr) {
    options.connectionChanged = [call = given.connection_changed,
                                 context = given.context](const Client::ConnectionChange& change) {
      const bool restored = change.kind == Client::ConnectionChange::Kind::restored;
      quarvel_error why;
      Fill(&why, change.why);
      const quarvel_connection_change told{restored, restored ? "" : why.reason, change.unanswered,
                                           change.unsent, change.sessions};
      call(context, &told);
    };
  }
  return options;
}

// ---- Replies: each kind's result as the arguments of its callback

template <class Callback, class T, class Give>
Client::Reply<T> WithError(Callback callback, void* context, Give give) {
  if (callback == nullptr) return {};
  return [=](Result<T> result) {
    if (result.ok()) return give(callback, context, result.value(), nullptr);
    quarvel_error error;
    Fill(&error, result.error());
    give(callback, context, T{}, &error);
  };
}

Client::Reply<bool> Reply(quarvel_boolean_reply reply, void* context) {
  return WithError<quarvel_boolean_reply, bool>(
      reply, context,
      [](quarvel_boolean_reply to, void* with, bool result, const quarvel_error* error) {
        to(with, result, error);
      });
}

Client::Reply<std::monostate> Reply(quarvel_done_reply reply, void* context) {
  return WithError<quarvel_done_reply, std::monostate>(
      reply, context,
      [](quarvel_done_reply to, void* with, std::monostate, const quarvel_error* error) {
        to(with, error);
      });
}

Client::Reply<Client::ServiceType> Reply(quarvel_service_type_reply reply, void* context) {
  return WithError<quarvel_service_type_reply, Client::ServiceType>(
      reply, context,
      [](quarvel_service_type_reply to, void* with, Client::ServiceType type,
         const quarvel_error* error) { to(with, static_cast<std::uint16_t>(type), error); });
}

Client::Reply<Client::Validity> Reply(quarvel_valid_reply reply, void* context) {
  return WithError<quarvel_valid_reply, Client::Validity>(
      reply, context,
      [](quarvel_valid_reply to, void* with, const Client::Validity& validity,
         const quarvel_error* error) {
        to(with, validity.reporterID, static_cast<std::uint16_t>(validity.serviceType), error);
      });
}

Client::Reply<std::vector<ReporterID>> Reply(quarvel_reporters_reply reply, void* context) {
  return WithError<quarvel_reporters_reply, std::vector<ReporterID>>(
      reply, context,
      [](quarvel_reporters_reply to, void* with, const std::vector<ReporterID>& reporters,
         const quarvel_error* error) { to(with, reporters.data(), reporters.size(), error); });
}

// ---- Arguments

Recipients AsRecipients(const int64_t* reporters, std::size_t count) {
  if (reporters == nullptr) return Recipients::everyStartedSession();
  return std::span(reporters, count);
}

// Runs `send` with the payload, which may be none.
template <class Send>
quarvel_status WithPayload(const quarvel_payload* payload, Send&& send) {
  if (payload == nullptr) return send(PayloadArgument(std::nullopt));
  const quarvel::Payload* whole = nullptr;
  if (const auto status = quarvel_payload_read(payload, whole); status != QUARVEL_OK) return status;
  return send(PayloadArgument(*whole));
}

template <class Call>
quarvel_status Send(quarvel_client* client, Call&& call) {
  if (client == nullptr) return QUARVEL_INVALID_ARGUMENT;
  return Guard([&] { return static_cast<quarvel_status>(call(client->client)); });
}

// ---- The synchronous forms

// An exception, or a fault found before the call, has not filled the error yet.
quarvel_status Completed(quarvel_status status, quarvel_error* error) {
  const bool bare = status == QUARVEL_NO_MEMORY || status == QUARVEL_INVALID_PAYLOAD;
  return bare ? Fill(error, status) : status;
}

/// Runs `call`, whose result goes to `take` when there is one.
template <class Call, class Take>
quarvel_status Wait(quarvel_client* client, int timeout, quarvel_error* error, Call&& call,
                    Take&& take) {
  Fill(error, QUARVEL_OK);
  if (client == nullptr) return Fill(error, QUARVEL_INVALID_ARGUMENT);
  const quarvel_status status = Guard([&] {
    auto sync = client->client.sync(
        timeout < 0 ? std::nullopt : std::optional(std::chrono::milliseconds(timeout)));
    auto result = call(sync);
    if (!result.ok()) return Fill(error, result.error());
    take(result.value());
    return QUARVEL_OK;
  });
  return Completed(status, error);
}

template <class Call>
quarvel_status Wait(quarvel_client* client, int timeout, quarvel_error* error, Call&& call) {
  return Wait(client, timeout, error, call, [](const auto&) {});
}

template <class T>
void Give(T* out, const std::type_identity_t<T>& value) {
  if (out != nullptr) *out = value;
}

}  // namespace

quarvel_status quarvel_client_new(const quarvel_options* options, quarvel_client** client,
                                  quarvel_error* error) {
  Fill(error, QUARVEL_OK);
  quarvel_options read;
  if (client == nullptr || !quarvel::c::Read(options, read)) {
    return Fill(error, QUARVEL_INVALID_ARGUMENT);
  }
  *client = nullptr;
  const quarvel_status status = Guard([&] {
    auto connected = Client::connect(AsOptions(read));
    if (!connected) return Fill(error, connected.error());
    *client = new quarvel_client{std::move(connected.value())};
    return QUARVEL_OK;
  });
  return Completed(status, error);
}

void quarvel_client_free(quarvel_client* client) {
  delete client;
}

bool quarvel_connected(const quarvel_client* client) {
  return client != nullptr && client->client.connected();
}

int quarvel_descriptor(const quarvel_client* client) {
  return client == nullptr ? -1 : client->client.descriptor();
}

quarvel_status quarvel_dispatch(quarvel_client* client, int timeout_ms) {
  return Send(client, [=](Client& to) {
    return to.dispatch(timeout_ms < 0 ? std::nullopt
                                      : std::optional(std::chrono::milliseconds(timeout_ms)));
  });
}

quarvel_status quarvel_create_reporting_session(quarvel_client* client, int64_t reporter_id,
                                                quarvel_boolean_reply reply, void* context) {
  return Send(client, [=](Client& to) {
    return to.createReportingSession(reporter_id, Reply(reply, context));
  });
}

quarvel_status quarvel_set_service_type(quarvel_client* client, uint16_t service_type,
                                        int64_t reporting_session, quarvel_boolean_reply reply,
                                        void* context) {
  return Send(client, [=](Client& to) {
    return to.setServiceType(Client::ServiceType{service_type}, reporting_session,
                             Reply(reply, context));
  });
}

quarvel_status quarvel_get_service_name_for_reporter_id(quarvel_client* client, int64_t reporter_id,
                                                        quarvel_service_type_reply reply,
                                                        void* context) {
  return Send(client, [=](Client& to) {
    return to.getServiceNameForReporterID(reporter_id, Reply(reply, context));
  });
}

quarvel_status quarvel_set_configuration(quarvel_client* client,
                                         const quarvel_payload* configuration, int64_t reporter_id,
                                         quarvel_boolean_reply reply, void* context) {
  return Send(client, [=](Client& to) {
    return WithPayload(configuration, [&](PayloadArgument merged) {
      return static_cast<quarvel_status>(
          to.setConfiguration(merged, reporter_id, Reply(reply, context)));
    });
  });
}

quarvel_status quarvel_start_reporting_session_for_id(quarvel_client* client, int64_t reporter_id,
                                                      quarvel_boolean_reply stopped,
                                                      void* context) {
  return Send(client, [=](Client& to) {
    return to.startReportingSessionForID(reporter_id, Reply(stopped, context));
  });
}

quarvel_status quarvel_send_message(quarvel_client* client, const quarvel_payload* payload,
                                    uint32_t category, uint16_t type, const int64_t* reporting_ids,
                                    size_t count, quarvel_done_reply reply, void* context) {
  return Send(client, [=](Client& to) {
    return WithPayload(payload, [&](PayloadArgument sent) {
      return static_cast<quarvel_status>(
          to.sendMessage(sent, Client::Category(category), Client::MessageType{type},
                         AsRecipients(reporting_ids, count), Reply(reply, context)));
    });
  });
}

quarvel_status quarvel_stop_reporting_session_for_id(quarvel_client* client, int64_t reporter_id,
                                                     quarvel_boolean_reply reply, void* context) {
  return Send(client, [=](Client& to) {
    return to.stopReportingSessionForID(reporter_id, Reply(reply, context));
  });
}

quarvel_status quarvel_destroy_reporting_session(quarvel_client* client, int64_t reporter_id,
                                                 quarvel_boolean_reply reply, void* context) {
  return Send(client, [=](Client& to) {
    return to.destroyReportingSession(reporter_id, Reply(reply, context));
  });
}

quarvel_status quarvel_reporter_id(quarvel_client* client, int64_t reporter_id,
                                   quarvel_valid_reply valid, void* context) {
  return Send(client,
              [=](Client& to) { return to.reporterID(reporter_id, Reply(valid, context)); });
}

quarvel_status quarvel_get_all_reporters(quarvel_client* client, quarvel_reporters_reply reply,
                                         void* context) {
  return Send(client, [=](Client& to) { return to.getAllReporters(Reply(reply, context)); });
}

quarvel_status quarvel_kill_service(quarvel_client* client, quarvel_boolean_reply reply,
                                    void* context) {
  return Send(client, [=](Client& to) { return to.killService(Reply(reply, context)); });
}

quarvel_status quarvel_sync_create_reporting_session(quarvel_client* client, int64_t reporter_id,
                                                     int timeout_ms, quarvel_error* error) {
  return Wait(client, timeout_ms, error,
              [=](auto& sync) { return sync.createReportingSession(reporter_id); });
}

quarvel_status quarvel_sync_set_service_type(quarvel_client* client, uint16_t service_type,
                                             int64_t reporting_session, int timeout_ms,
                                             quarvel_error* error) {
  return Wait(client, timeout_ms, error, [=](auto& sync) {
    return sync.setServiceType(Client::ServiceType{service_type}, reporting_session);
  });
}

quarvel_status quarvel_sync_get_service_name_for_reporter_id(quarvel_client* client,
                                                             int64_t reporter_id, int timeout_ms,
                                                             uint16_t* service_type,
                                                             quarvel_error* error) {
  return Wait(
      client, timeout_ms, error,
      [=](auto& sync) { return sync.getServiceNameForReporterID(reporter_id); },
      [=](Client::ServiceType type) { Give(service_type, static_cast<std::uint16_t>(type)); });
}

quarvel_status quarvel_sync_set_configuration(quarvel_client* client,
                                              const quarvel_payload* configuration,
                                              int64_t reporter_id, int timeout_ms,
                                              quarvel_error* error) {
  const quarvel_status status = Guard([&] {
    return WithPayload(configuration, [&](PayloadArgument merged) {
      return Wait(client, timeout_ms, error,
                  [&](auto& sync) { return sync.setConfiguration(merged, reporter_id); });
    });
  });
  return Completed(status, error);
}

quarvel_status quarvel_sync_start_reporting_session_for_id(quarvel_client* client,
                                                           int64_t reporter_id,
                                                           quarvel_boolean_reply stopped,
                                                           void* context, int timeout_ms,
                                                           bool* started, quarvel_error* error) {
  return Wait(
      client, timeout_ms, error,
      [=](auto& sync) {
        return sync.startReportingSessionForID(reporter_id, Reply(stopped, context));
      },
      [=](bool known) { Give(started, known); });
}

quarvel_status quarvel_sync_send_message(quarvel_client* client, const quarvel_payload* payload,
                                         uint32_t category, uint16_t type,
                                         const int64_t* reporting_ids, size_t count, int timeout_ms,
                                         quarvel_error* error) {
  const quarvel_status status = Guard([&] {
    return WithPayload(payload, [&](PayloadArgument sent) {
      return Wait(client, timeout_ms, error, [&](auto& sync) {
        return sync.sendMessage(sent, Client::Category(category), Client::MessageType{type},
                                AsRecipients(reporting_ids, count));
      });
    });
  });
  return Completed(status, error);
}

quarvel_status quarvel_sync_stop_reporting_session_for_id(quarvel_client* client,
                                                          int64_t reporter_id, int timeout_ms,
                                                          quarvel_error* error) {
  return Wait(client, timeout_ms, error,
              [=](auto& sync) { return sync.stopReportingSessionForID(reporter_id); });
}

quarvel_status quarvel_sync_destroy_reporting_session(quarvel_client* client, int64_t reporter_id,
                                                      int timeout_ms, quarvel_error* error) {
  return Wait(client, timeout_ms, error,
              [=](auto& sync) { return sync.destroyReportingSession(reporter_id); });
}

quarvel_status quarvel_sync_reporter_id(quarvel_client* client, int64_t reporter_id, int timeout_ms,
                                        bool* valid, uint16_t* service_type, quarvel_error* error) {
  return Wait(
      client, timeout_ms, error, [=](auto& sync) { return sync.reporterID(reporter_id); },
      [=](const Client::Validity& validity) {
        Give(valid, validity.valid());
        Give(service_type, static_cast<std::uint16_t>(validity.serviceType));
      });
}

quarvel_status quarvel_sync_get_all_reporters(quarvel_client* client, int timeout_ms,
                                              int64_t* reporter_ids, size_t room, size_t* count,
                                              quarvel_error* error) {
  return Wait(
      client, timeout_ms, error, [](auto& sync) { return sync.getAllReporters(); },
      [=](const std::vector<ReporterID>& reporters) {
        if (reporter_ids != nullptr) {
          std::copy_n(reporters.begin(), std::min(room, reporters.size()), reporter_ids);
        }
        Give(count, reporters.size());
      });
}

quarvel_status quarvel_sync_kill_service(quarvel_client* client, int timeout_ms,
                                         quarvel_error* error) {
  return Wait(client, timeout_ms, error, [](auto& sync) { return sync.killService(); });
}
