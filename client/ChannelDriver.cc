#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "client/Channel.h"

// The channel's driver: reads, delivers replies, runs timers.

namespace quarvel {
namespace {

/// The longest time for which a closing client keeps sending.
constexpr auto kLinger = std::chrono::seconds(5);

Error WhyRefused(Client::Code code, const std::string& lossReason) {
  switch (code) {
    case Client::Code::heldBack:
      return Failure(code,
                     "The service is slower than this client, and as much has gathered as may; try "
                     "again later.");
    case Client::Code::deferred:
      return Failure(code,
                     "The connection to the service is lost for now; what this call asks of the "
                     "session is done when it is back.");
    default:
      return Failure(code, lossReason);
  }
}

}  // namespace

void Client::Channel::run() {
  driver_ = std::this_thread::get_id();
  while (!closing()) step(std::nullopt);
  finish();
}

Client::Code Client::Channel::dispatch(std::optional<Time> deadline) {
  {
    MutexLock lock(mutex_);
    if (ownThread() || driver_.load() != std::thread::id()) return Code::wouldDeadlock;
    driver_ = std::this_thread::get_id();
  }
  step(deadline);
  {
    MutexLock lock(mutex_);
    if (!closing_) {
      driver_ = std::thread::id();
      return link_ == Link::lost ? Code::connectionLost : Code::none;
    }
  }
  finish();
  return Code::connectionLost;
}

void Client::Channel::step(std::optional<Time> deadline) {
  const Poller::Events events = poller_.wait(deadline);
  if (events.input) receiveReplies();
  if (events.timer) {
    reconnect();
    runScheduled();
  }
  deliverRefusals();
  armTimer();
  MutexLock lock(mutex_);
  if (link_ != Link::up || writing_) return;
  if (hasOutputDue()) {
    write(false);
  } else {
    watchOutput(false);
  }
}

void Client::Channel::finish() {
  const Time deadline = std::chrono::steady_clock::now() + kLinger;
  while (!flushed() && std::chrono::steady_clock::now() < deadline) step(deadline);
  {
    MutexLock lock(mutex_);
    if (link_ == Link::up) ::shutdown(socket_, SHUT_RDWR);
  }
  while (connected()) receiveReplies();  // the replies that have arrived, until the end
  handleLoss("The client has closed the connection.", true);
  deliverRefusals();
  MutexLock lock(mutex_);
  finished_ = true;
  driver_ = std::thread::id();
  room_.notifyAll();
}

// Writes as much as the socket takes. True when nothing is left that could still be sent.
bool Client::Channel::flushed() {
  MutexLock lock(mutex_);
  if (link_ == Link::up && !writing_ && hasOutput()) write(false);
  return link_ != Link::up || (!writing_ && !hasOutput());
}

void Client::Channel::receiveReplies() {
  bool more = true;
  for (int round = 0; round < kRounds && more; ++round) {
    std::optional<std::string> end = receive(more);
    if (!end) end = deliverReplies();
    if (end) return handleLoss(*end, false);
  }
}

// Reads the bytes that have arrived; sets `more` when there may be further ones. Returns the reason
// when the connection has ended.
std::optional<std::string> Client::Channel::receive(bool& more) {
  int socket = -1;
  {
    MutexLock lock(mutex_);
    socket = socket_;
  }
  if (begin_ == end_) begin_ = end_ = 0;
  if (end_ == received_.size()) {
    if (begin_ > 0) {
      std::memmove(received_.data(), received_.data() + begin_, end_ - begin_);
      end_ -= std::exchange(begin_, 0);
    } else {
      received_.resize(received_.size() * 2);
    }
  }
  const std::size_t room = received_.size() - end_;
  ssize_t count = 0;
  do {
    count = ::recv(socket, received_.data() + end_, room, 0);
  } while (count < 0 && errno == EINTR);
  more = count == static_cast<ssize_t>(room);
  if (count > 0) {
    end_ += static_cast<std::size_t>(count);
    return std::nullopt;
  }
  if (count == 0) return "The service has closed the connection.";
  if (errno == EAGAIN) return std::nullopt;
  return std::string("The connection to the service broke: ") + std::strerror(errno) + ".";
}

std::optional<std::string> Client::Channel::deliverReplies() {
  for (;;) {
    const std::string_view bytes(received_.data() + begin_, end_ - begin_);
    if (bytes.empty()) return std::nullopt;
    switch (scanner_.scan(bytes)) {
      case MessagePackScanner::Progress::incomplete:
        return std::nullopt;
      case MessagePackScanner::Progress::fault:
        return "The service sent what is no reply: " + scanner_.fault();
      case MessagePackScanner::Progress::complete:
        break;
    }
    begin_ += scanner_.length();
    scanner_.reset();
    if (!deliverReply(PayloadValue(bytes.data()))) return "The service sent what is no reply.";
  }
}

bool Client::Channel::deliverReply(PayloadValue response) {
  constexpr std::int64_t kResponse = 1;
  if (response.kind() != PayloadValue::Kind::list || response.count() != 4) return false;
  auto item = response.items().begin();
  const auto kind = (*item).integer();
  const auto call = (*++item).integer();
  const PayloadValue error = *++item;
  const PayloadValue result = *++item;
  if (kind != kResponse || !call || !std::in_range<std::uint32_t>(*call)) return false;

  AnyReply reply;
  {
    MutexLock lock(mutex_);
    const auto found = pending_.find(static_cast<std::uint32_t>(*call));
    if (found == pending_.end()) return true;  // its reply was dropped
    reply = std::move(found->second.reply);
    pending_.erase(found);
  }
  DeliverResponse(reply, error, result);
  return true;
}

void Client::Channel::deliverRefusals() {
  for (;;) {
    std::vector<Refused> refused;
    {
      MutexLock lock(mutex_);
      std::swap(refused, refused_);
    }
    if (refused.empty()) return;
    for (const Refused& one : refused) DeliverError(one.reply, WhyRefused(one.code, lossReason_));
  }
}

void Client::Channel::runScheduled() {
  const Time now = std::chrono::steady_clock::now();
  std::vector<std::weak_ptr<Periodic>> due;
  {
    MutexLock lock(mutex_);
    const auto first = std::partition(scheduled_.begin(), scheduled_.end(),
                                      [now](const Scheduled& one) { return one.time > now; });
    for (auto one = first; one != scheduled_.end(); ++one) due.push_back(std::move(one->work));
    scheduled_.erase(first, scheduled_.end());
  }
  for (const std::weak_ptr<Periodic>& one : due) {
    const std::shared_ptr<Periodic> work = one.lock();
    if (!work) continue;
    if (const auto next = work->run()) {
      MutexLock lock(mutex_);
      scheduled_.push_back({*next, one});
    }
  }
}

void Client::Channel::armTimer() {
  std::optional<Time> next = reconnectAt_;
  MutexLock lock(mutex_);
  for (const Scheduled& one : scheduled_) {
    if (!next || one.time < *next) next = one.time;
  }
  poller_.arm(next);
}

}  // namespace quarvel
