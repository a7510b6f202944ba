#pragma once

#include <string>
#include <utility>
#include <variant>
#include <vector>

#include <quarvel/client.hpp>

#include "base/Payload.h"

namespace quarvel {

/// The callback of a call, by the kind of its operation's reply. Empty: the call is a notification.
/// Owned by the table of pending calls until it is delivered; called once.
using AnyReply =
    std::variant<std::monostate, Client::Reply<bool>, Client::Reply<Client::ServiceType>,
                 Client::Reply<std::monostate>, Client::Reply<Client::Validity>,
                 Client::Reply<std::vector<ReporterID>>, Client::Reply<Value>>;

/// Calls `reply` with the contents of the service's response: the error unless that is nil, else
/// the result. A result of another kind than the operation's is `Code::unexpectedReply`. On the
/// driver's thread, without a lock, since the callback may call the client. An empty `reply` is
/// ignored.
void DeliverResponse(const AnyReply& reply, PayloadValue error, PayloadValue result);

/// Calls `reply` with an error of this side. Like `DeliverResponse`.
void DeliverError(const AnyReply& reply, const Error& error);

/// An error of this side of the connection; `reason` is a sentence.
inline Error Failure(Client::Code code, std::string reason) {
  return Error::because(std::string(Client::kErrorDomain), static_cast<std::int64_t>(code),
                        std::move(reason));
}

}  // namespace quarvel
