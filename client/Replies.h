#pragma once

#include <variant>
#include <vector>

#include <quarvel/client.hpp>

#include "base/Payload.h"

namespace quarvel {

/// How a call is answered, by the kind of its operation's reply; without one it is a notification.
using AnyReply =
    std::variant<std::monostate, Client::Reply<bool>, Client::Reply<Client::ServiceType>,
                 Client::Reply<std::monostate>, Client::Reply<Client::Validity>,
                 Client::Reply<std::vector<ReporterID>>, Client::Reply<Value>>;

/// Gives what the service's response holds: its error unless that is nil, else its result.
void GiveResponse(const AnyReply& reply, PayloadValue error, PayloadValue result);

void GiveError(const AnyReply& reply, const Error& error);

}  // namespace quarvel
