#include <algorithm>
#include <cstring>
#include <string_view>

#include "base/Utf8.h"
#include "client/c/Boundary.h"

namespace quarvel::c {
namespace {

template <std::size_t Size>
void Copy(char (&to)[Size], std::string_view text) {
  const std::string_view copied = quarvel::Utf8Prefix(text, Size - 1);
  std::ranges::copy(copied, to);
  to[copied.size()] = '\0';
}

}  // namespace

constexpr bool IsSame(Client::Code code, quarvel_status status) {
  return static_cast<std::int64_t>(code) == status;
}
static_assert(IsSame(Client::Code::none, QUARVEL_OK) &&
              IsSame(Client::Code::unreachable, QUARVEL_UNREACHABLE) &&
              IsSame(Client::Code::connectionLost, QUARVEL_CONNECTION_LOST) &&
              IsSame(Client::Code::timedOut, QUARVEL_TIMED_OUT) &&
              IsSame(Client::Code::wouldDeadlock, QUARVEL_WOULD_DEADLOCK) &&
              IsSame(Client::Code::unexpectedReply, QUARVEL_UNEXPECTED_REPLY) &&
              IsSame(Client::Code::heldBack, QUARVEL_HELD_BACK) &&
              IsSame(Client::Code::deferred, QUARVEL_DEFERRED));

quarvel_status Fill(quarvel_error* out, const Error& error) {
  const bool ours = error.domain == Client::kErrorDomain;
  const quarvel_status status = ours ? static_cast<quarvel_status>(error.code) : QUARVEL_REFUSED;
  if (out == nullptr) return status;
  out->status = status;
  out->code = error.code;
  Copy(out->domain, error.domain);
  const Value* reason = error.userInfo.find("reason");
  Copy(out->reason,
       reason != nullptr && reason->string() != nullptr ? *reason->string() : std::string_view());
  return status;
}

quarvel_status Fill(quarvel_error* out, quarvel_status status) {
  if (out == nullptr) return status;
  *out = {};
  out->status = status;
  if (status == QUARVEL_OK) return status;
  out->code = status;
  Copy(out->domain, Client::kErrorDomain);
  Copy(out->reason, quarvel_status_text(status));
  return status;
}

}  // namespace quarvel::c

const char* quarvel_status_text(quarvel_status status) {
  switch (status) {
    case QUARVEL_OK:
      return "All is well.";
    case QUARVEL_UNREACHABLE:
      return "The service cannot be reached.";
    case QUARVEL_CONNECTION_LOST:
      return "The connection to the service is lost.";
    case QUARVEL_TIMED_OUT:
      return "The service has not replied in time.";
    case QUARVEL_WOULD_DEADLOCK:
      return "This cannot wait here; use the asynchronous form.";
    case QUARVEL_UNEXPECTED_REPLY:
      return "The service's reply is not what this operation replies.";
    case QUARVEL_HELD_BACK:
      return "The service is slower than this client; try again later.";
    case QUARVEL_DEFERRED:
      return "The connection is lost for now; what the call asks of the session is done when it is "
             "back.";
    case QUARVEL_REFUSED:
      return "The service has refused the call.";
    case QUARVEL_INVALID_ARGUMENT:
      return "An argument is missing or too small.";
    case QUARVEL_INVALID_PAYLOAD:
      return "The payload is not whole: a text that is not UTF-8, a key too many or too few, a "
             "container that is not closed, or bytes that are no dictionary.";
    case QUARVEL_NO_MEMORY:
      return "The process has no memory left, or no other resource that is needed.";
  }
  return "There is no such status.";
}
