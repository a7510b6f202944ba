#include "client/Channel.h"

#include <poll.h>
#include <pthread.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <system_error>

namespace quarvel {
namespace {

constexpr std::size_t kReadBytes = 65'536;

}  // namespace

Result<std::shared_ptr<Client::Channel>> Client::Channel::open(Options options) {
  std::string path = options.socketPath.empty() ? defaultSocketPath() : options.socketPath;
  auto socket = connectTo(path, true);
  if (!socket) return std::move(socket.error());
  const auto channel = std::make_shared<Channel>(std::move(options), std::move(path));
  if (auto begun = channel->begin(socket.value()); !begun) return std::move(begun.error());
  return channel;
}

Client::Channel::Channel(Options options, std::string path)
    : options_(std::move(options)),
      path_(std::move(path)),
      process_(::getpid()),
      received_(kReadBytes),
      random_(static_cast<std::uint_fast32_t>(
          std::chrono::steady_clock::now().time_since_epoch().count())) {}

Client::Channel::~Channel() {
  if (socket_ >= 0) ::close(socket_);
}

Outcome Client::Channel::begin(int socket) {
  const auto refused = [](const char* what, int error) {
    return Failure(Code::unreachable, std::string("This process may have no further ") + what +
                                          ": " + std::strerror(error) + ".");
  };
  {
    MutexLock lock(mutex_);
    socket_ = socket;
    link_ = Link::up;
  }
  if (poller_.error() != 0) return refused("descriptor", poller_.error());
  if (const int error = poller_.watch(socket); error != 0) return refused("descriptor", error);
  connectedAt_ = std::chrono::steady_clock::now();
  if (options_.reconnect) delay_ = options_.reconnect->firstDelay;
  if (!ownThread()) return Success();

  // This thread takes none of the program's signals.
  sigset_t all;
  sigset_t before;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, &before);
  int error = 0;
  try {
    thread_ = std::thread([channel = shared_from_this()] { channel->run(); });
  } catch (const std::system_error& failure) {
    error = failure.code().value();
  }
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
  if (error != 0) return refused("thread", error);
  pthread_setname_np(thread_.native_handle(), "quarvel.client");
  return Success();
}

std::optional<Client::Channel::Time> Client::Channel::DeadlineAfter(
    std::optional<std::chrono::milliseconds> wait) {
  if (!wait || *wait > std::chrono::years(1)) return std::nullopt;
  return std::chrono::steady_clock::now() + *wait;
}

bool Client::Channel::connected() const {
  MutexLock lock(mutex_);
  return link_ == Link::up;
}

bool Client::Channel::reconnecting() const {
  MutexLock lock(mutex_);
  return link_ == Link::down;
}

bool Client::Channel::closing() const {
  MutexLock lock(mutex_);
  return closing_;
}

void Client::Channel::close() {
  if (::getpid() != process_) return abandon();
  const bool inReply = onDriver();
  {
    MutexLock lock(mutex_);
    closing_ = true;
    poller_.wake();
    if (!ownThread() && !inReply) {
      while (driver_.load() != std::thread::id() && !finished_) room_.wait(mutex_);
      driver_ = std::this_thread::get_id();
    }
  }
  if (inReply) {
    if (ownThread()) thread_.detach();
  } else if (ownThread()) {
    thread_.join();
  } else {
    finish();
  }
}

// In a child process: the driver's thread does not exist here, a lock may be held by a thread that
// does not either, and the socket is the parent's.
void Client::Channel::abandon() QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
  poller_.abandon();
  if (socket_ >= 0) ::close(std::exchange(socket_, -1));
}

// ---- Calls, on the caller's thread

Client::Channel::Sent Client::Channel::registerCall(AnyReply&& reply, const SessionCall& session) {
  const bool answered = reply.index() != 0;
  Sent sent{checkCall(session, reply), std::nullopt};
  if (sent.code != Code::none) {
    if (link_ == Link::down && sent.code == Code::connectionLost && !answered) ++unsent_;
    refuse(std::move(reply), sent.code);
    return sent;
  }
  Pending pending{std::move(reply), session.kind, session.session};
  if (answered) sent.call = nextNumber();
  if (!options_.reconnect || !sessions_.record(session, sent.call).own) {
    pending.kind = SessionCall::Kind::none;
  }
  if (sent.call) pending_.emplace(*sent.call, std::move(pending));
  return sent;
}

Client::Code Client::Channel::checkCall(const SessionCall& session, AnyReply& reply) {
  if (link_ == Link::lost) return Code::connectionLost;
  if (link_ == Link::up) {
    const bool mayWait = ownThread() && !onDriver();
    return mayWait || gathered_.size() < options_.gatheredBytes ? Code::none : Code::heldBack;
  }
  Sessions::Recorded recorded = sessions_.record(session, std::nullopt);
  refuse(std::move(recorded.ended), Code::connectionLost);
  if (!recorded.own) return Code::connectionLost;
  if (session.kind != SessionCall::Kind::start) return Code::deferred;
  const bool kept = sessions_.keepReply(session.session, std::nullopt, reply);
  return kept || reply.index() == 0 ? Code::deferred : Code::connectionLost;
}

// Numbers wrap around; a call that is never answered keeps its number.
std::uint32_t Client::Channel::nextNumber() {
  while (pending_.contains(nextCall_)) ++nextCall_;
  return nextCall_++;
}

void Client::Channel::refuse(AnyReply&& reply, Code code) {
  if (reply.index() == 0) return;
  refused_.push_back({std::move(reply), code});
  if (!onDriver()) poller_.wake();
}

void Client::Channel::forget(std::uint32_t call) {
  Pending forgotten;  // destroyed after the lock is released, since a reply may own anything
  MutexLock lock(mutex_);
  if (const auto found = pending_.find(call); found != pending_.end()) {
    forgotten = std::move(found->second);
    pending_.erase(found);
  }
}

void Client::Channel::beginBatch() {
  MutexLock lock(mutex_);
  ++batches_;
}

void Client::Channel::endBatch() {
  MutexLock lock(mutex_);
  --batches_;
  if (hasOutput()) sendIfDue();
}

void Client::Channel::flush() {
  MutexLock lock(mutex_);
  if (link_ == Link::up && !writing_ && hasOutput()) write(ownThread());
}

void Client::Channel::schedule(Time time, std::weak_ptr<Periodic> work) {
  MutexLock lock(mutex_);
  scheduled_.push_back({time, std::move(work)});
  poller_.wake();
}

void Client::Channel::sendIfDue() {
  if (onDriver()) {
    flushing_ = true;  // when the step ends
    return;
  }
  const bool writable = link_ == Link::up && !writing_ && (ownThread() || !outputWatched_);
  if (writable && (batches_ == 0 || gathered_.size() >= kGatheredBytes)) write(ownThread());
  while (ownThread() && writing_ && link_ == Link::up && gathered_.size() >= kGatheredBytes) {
    room_.wait(mutex_);
  }
}

bool Client::Channel::hasOutput() const {
  return sent_ < sending_.size() || !gathered_.empty();
}

bool Client::Channel::hasOutputDue() const {
  return sent_ < sending_.size() || flushing_ || gathered_.size() >= kGatheredBytes ||
         (batches_ == 0 && !gathered_.empty());
}

void Client::Channel::write(bool mayWait) {
  writing_ = true;
  const int socket = socket_;
  Written written = Written::all;
  for (int round = 0;
       round < kRounds && written == Written::all && link_ == Link::up && hasOutput(); ++round) {
    if (sent_ == sending_.size()) {
      sending_.clear();
      sent_ = 0;
      std::swap(sending_, gathered_);
      flushing_ = false;
      room_.notifyAll();
    }
    mutex_.unlock();
    written = writeSending(socket, mayWait);
    mutex_.lock();
  }
  writing_ = false;
  room_.notifyAll();
  if (link_ == Link::up) watchOutput(written != Written::failed && hasOutput());
}

Client::Channel::Written Client::Channel::writeSending(int socket, bool mayWait) {
  while (sent_ < sending_.size()) {
    const ssize_t count =
        ::send(socket, sending_.data() + sent_, sending_.size() - sent_, MSG_NOSIGNAL);
    if (count >= 0) {
      sent_ += static_cast<std::size_t>(count);
    } else if (errno == EAGAIN && mayWait) {
      pollfd writable{socket, POLLOUT, 0};
      ::poll(&writable, 1, -1);
    } else if (errno == EAGAIN) {
      return Written::some;
    } else if (errno != EINTR) {
      ::shutdown(socket, SHUT_RDWR);  // the driver reads the end and reports it
      return Written::failed;
    }
  }
  return Written::all;
}

void Client::Channel::watchOutput(bool wanted) {
  if (wanted != std::exchange(outputWatched_, wanted)) poller_.watchOutput(socket_, wanted);
}

}  // namespace quarvel
