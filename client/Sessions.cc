#include "client/Sessions.h"

#include <algorithm>
#include <utility>

namespace quarvel {

Sessions::Session* Sessions::find(ReporterID session) {
  const auto found = std::ranges::find(sessions_, session, &Session::reporterID);
  return found == sessions_.end() ? nullptr : &*found;
}

Sessions::Recorded Sessions::record(const SessionCall& call, std::optional<std::uint32_t> number) {
  using Kind = SessionCall::Kind;
  if (call.kind == Kind::none) return {};
  Session* session = find(call.session);
  if (session == nullptr) {
    if (call.kind != Kind::create) return {};
    sessions_.push_back({call.session, {}, {}, false, {}, {}});
    return {true, {}};
  }
  Recorded recorded{true, {}};
  switch (call.kind) {
    case Kind::none:
      break;
    case Kind::create:
      recorded.ended = std::move(session->stopped);
      *session = {call.session, {}, {}, false, {}, {}};
      break;
    case Kind::setServiceType:
      session->serviceType = call.serviceType;
      break;
    case Kind::setConfiguration:
      if (call.configuration->payload() != nullptr) {
        if (!session->configuration) session->configuration.emplace();
        session->configuration->merge(call.configuration->payload()->root().toDictionary());
      } else if (call.configuration->dictionary() != nullptr) {
        if (!session->configuration) session->configuration.emplace();
        session->configuration->merge(*call.configuration->dictionary());
      }
      break;
    case Kind::start:
      // The service answers the first start alone.
      if (!std::exchange(session->started, true)) session->start = number;
      break;
    case Kind::stop:
      recorded.ended = std::exchange(session->stopped, AnyReply());
      session->started = false;
      break;
    case Kind::destroy:
      recorded.ended = std::move(session->stopped);
      sessions_.erase(sessions_.begin() + (session - sessions_.data()));
      break;
  }
  return recorded;
}

bool Sessions::keepReply(ReporterID reporterID, std::optional<std::uint32_t> number,
                         AnyReply& stopped) {
  Session* session = find(reporterID);
  const bool telling = session != nullptr && session->started && session->start == number &&
                       session->stopped.index() == 0;
  if (telling) session->stopped = std::exchange(stopped, AnyReply());
  return telling;
}

}  // namespace quarvel
