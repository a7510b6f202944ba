#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>

#include "client/Channel.h"
#include "client/Operations.h"

// The channel's loss of its connection, and reconnection.

namespace quarvel {
namespace {

/// A connection that has lasted this long starts the back-off anew.
constexpr auto kLasted = std::chrono::seconds(10);

}  // namespace

void Client::Channel::handleLoss(const std::string& reason, bool forGood) {
  using Change = ConnectionChange;
  const Time now = std::chrono::steady_clock::now();
  Change change;
  bool told = false;
  {
    MutexLock lock(mutex_);
    told = link_ == Link::up && !closing_;
    link_ = options_.reconnect && !forGood && !closing_ ? Link::down : Link::lost;
    if (socket_ >= 0) {
      ::shutdown(socket_, SHUT_RDWR);
      while (writing_) room_.wait(mutex_);
      poller_.unwatch(socket_);
      ::close(std::exchange(socket_, -1));
      outputWatched_ = false;
    }
    room_.notifyAll();
    change.unsent = dropOutput();
    change.unanswered = refusePending();
    change.sessions = sessions_.all().size();
    if (link_ == Link::down) {
      if (now - connectedAt_ >= kLasted) delay_ = options_.reconnect->firstDelay;
      reconnectAt_ = now + nextDelay();
    } else {
      reconnectAt_.reset();
    }
  }
  lossReason_ = reason;
  begin_ = end_ = 0;
  scanner_.reset();
  if (!told || !options_.connectionChanged) return;
  change.kind = Change::Kind::lost;
  change.why = Failure(Code::connectionLost, reason);
  options_.connectionChanged(change);
}

// Returns the number of dropped notifications: no reply tells of their loss.
std::size_t Client::Channel::dropOutput() {
  constexpr char kNotification = '\x93';
  std::size_t unsent = 0;
  const auto count = [&unsent](std::string_view frames, std::size_t sent) {
    for (std::size_t at = 0; at < frames.size();) {
      const std::size_t length = PayloadValue(frames.data() + at).encoded().size();
      if (at + length > sent && frames[at] == kNotification) ++unsent;
      at += length;
    }
  };
  count(sending_, sent_);
  count(gathered_, 0);
  sending_.clear();
  gathered_.clear();
  sent_ = 0;
  flushing_ = false;
  return unsent;
}

// Refuses the pending calls in their order, except the starts that will be restored.
std::size_t Client::Channel::refusePending() {
  std::vector<std::pair<std::uint32_t, Pending>> waiting(std::make_move_iterator(pending_.begin()),
                                                         std::make_move_iterator(pending_.end()));
  pending_.clear();
  std::ranges::sort(waiting, {}, [](const auto& one) { return one.first; });
  std::size_t refused = 0;
  for (auto& [call, pending] : waiting) {
    const bool start = pending.kind == SessionCall::Kind::start;
    if (link_ == Link::down && start && sessions_.keepReply(pending.session, call, pending.reply)) {
      continue;
    }
    const bool deferred = link_ == Link::down && pending.kind != SessionCall::Kind::none && !start;
    refuse(std::move(pending.reply), deferred ? Code::deferred : Code::connectionLost);
    ++refused;
  }
  if (link_ == Link::lost) {
    for (Sessions::Session& session : sessions_.all()) {
      refuse(std::exchange(session.stopped, AnyReply()), Code::connectionLost);
    }
  }
  return refused;
}

std::chrono::milliseconds Client::Channel::nextDelay() {
  // No delay at all would keep the processor busy until the service is back.
  const std::chrono::milliseconds delay = std::max(delay_, std::chrono::milliseconds(1));
  delay_ = std::min(2 * delay, options_.reconnect->longestDelay);
  const std::int64_t quarter = delay.count() / 4;
  std::uniform_int_distribution<std::int64_t> vary(-quarter, quarter);
  return delay + std::chrono::milliseconds(vary(random_));
}

void Client::Channel::reconnect() {
  const Time now = std::chrono::steady_clock::now();
  if (!reconnectAt_ || now < *reconnectAt_) return;
  reconnectAt_.reset();
  const auto socket = connectTo(path_, false);
  if (!socket || poller_.watch(socket.value()) != 0) {
    if (socket) ::close(socket.value());
    reconnectAt_ = now + nextDelay();
    return;
  }
  connectedAt_ = now;
  ConnectionChange change;
  change.kind = ConnectionChange::Kind::restored;
  {
    MutexLock lock(mutex_);
    socket_ = socket.value();
    link_ = Link::up;
    flushing_ = true;
    change.sessions = restoreSessions();
    change.unsent = std::exchange(unsent_, 0);
  }
  if (options_.connectionChanged) options_.connectionChanged(change);
}

std::size_t Client::Channel::restoreSessions() {
  for (Sessions::Session& session : sessions_.all()) {
    const ReporterID id = session.reporterID;
    frame(operations::Create(id), std::nullopt);
    if (session.serviceType)
      frame(operations::SetServiceType(*session.serviceType, id), std::nullopt);
    if (session.configuration) {
      const PayloadArgument configuration(*session.configuration);
      frame(operations::SetConfiguration(configuration, id), std::nullopt);
    }
    if (!session.started) continue;
    session.start.reset();
    if (session.stopped.index() != 0) {
      session.start = nextNumber();
      pending_.emplace(*session.start, Pending{std::exchange(session.stopped, AnyReply()),
                                               SessionCall::Kind::start, id});
    }
    frame(operations::Start(id), session.start);
  }
  return sessions_.all().size();
}

}  // namespace quarvel
