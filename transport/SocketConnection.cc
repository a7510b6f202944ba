#include "transport/SocketConnection.h"

#include <sys/socket.h>

#include <asio/dispatch.hpp>
#include <asio/post.hpp>
#include <cerrno>
#include <utility>

#include "base/Format.h"
#include "platform/Log.h"
#include "queues/BlockingScope.h"
#include "transport/Request.h"

namespace quarvel {

using std::chrono::steady_clock;

namespace {

/// One client's calls are taken in for so long before the others have their turn, looked at every
/// few calls. Those for which the server queue has work stop earlier, at the desk.
constexpr std::chrono::microseconds kLongestTurn{200};
constexpr unsigned kCallsPerLook = 16;

/// The store commits far more often than this.
constexpr std::chrono::milliseconds kSlowBehind{50};

std::int32_t PeerProcessIdentifier(int socket) {
  ucred peer{};
  socklen_t length = sizeof peer;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) return 0;
  return peer.pid;
}

}  // namespace

SocketConnection::SocketConnection(std::shared_ptr<ConnectionContext> context, std::uint64_t number)
    : context_(std::move(context)),
      number_(number),
      socket_(context_->io),
      scanner_(context_->limits.messageBytes, context_->limits.depth),
      frameTimer_(context_->io),
      stallTimer_(context_->io),
      behindTimer_(context_->io) {}

std::shared_ptr<SocketConnection> SocketConnection::create(
    std::shared_ptr<ConnectionContext> context, UniqueDescriptor socket, std::uint64_t number) {
  std::shared_ptr<SocketConnection> connection(new SocketConnection(std::move(context), number));
  asio::error_code error;
  connection->socket_.assign(socket.get(), error);
  if (error) return nullptr;
  connection->processIdentifier_ = PeerProcessIdentifier(socket.release());
  // Calls may outlive the connection and even the listener, so what they hold on to is the context.
  connection->desk_ = std::make_shared<ReplyQueue>(
      connection->context_->limits,
      [shared = connection->context_, weak = std::weak_ptr(connection)] {
        asio::post(shared->io, [weak] {
          if (const auto self = weak.lock()) self->attend();
        });
      });
  return connection;
}

void SocketConnection::setExportedInterface(const ExportedInterface& exportedInterface) {
  interface_ = &exportedInterface;
}

void SocketConnection::setExportedObject(std::shared_ptr<ExportedObject> object) {
  object_ = std::move(object);
}

std::shared_ptr<ExportedObject> SocketConnection::exportedObject() const {
  return object_;
}

void SocketConnection::setInterruptionHandler(std::function<void()> handler) {
  interruptionHandler_ = std::move(handler);
}

void SocketConnection::setInvalidationHandler(std::function<void()> handler) {
  invalidationHandler_ = std::move(handler);
}

std::string SocketConnection::description() const {
  return fmt::format("<ClientConnection {} from pid {}>", number_, processIdentifier_);
}

void SocketConnection::resume() {
  // At once on the I/O thread, so that an end of the service finds it resumed.
  asio::dispatch(context_->io, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) {
      self->resumed_ = true;
      self->proceed();
    }
  });
}

/// Takes what has been read as far as the limits allow, then waits for more. Whatever made it stop
/// short calls it again.
void SocketConnection::proceed() {
  if (!open_ || !resumed_ || reading_) return;
  bool isLeft = false;
  {
    // Most calls are brief and find their queues at rest: they are carried out here.
    InlineRunner help;
    isLeft = decode();
    while (help.runOne()) {
      if (open_) flush();
    }
  }
  if (!open_) return;
  if (mustWait()) {
    unwatchFrame();  // it is not the client that is slow
    return;
  }
  if (isLeft) {
    // What was carried out here has made room again. After the others' turn, so that nobody waits
    // for one who sends without end.
    asio::post(context_->io, [self = shared_from_this()] { self->proceed(); });
    return;
  }
  if (buffer_.empty()) {
    buffer_.release();
    unwatchFrame();
  } else {
    watchFrame();
  }
  reading_ = true;
  socket_.async_wait(asio::posix::stream_descriptor::wait_read,
                     [self = shared_from_this()](asio::error_code error) {
                       self->reading_ = false;
                       if (error) {
                         self->end(false);
                       } else {
                         self->receive();
                       }
                     });
}

/// Whether calls are left for which there is no room.
bool SocketConnection::decode() {
  const auto end = steady_clock::now() + kLongestTurn;
  for (unsigned calls = 1; open_ && !buffer_.empty() && !mustWait(); ++calls) {
    const std::string_view bytes = buffer_.bytes();
    switch (scanner_.scan(bytes)) {
      case MessagePackScanner::Progress::incomplete:
        return false;
      case MessagePackScanner::Progress::fault:
        breach(scanner_.fault());
        return false;
      case MessagePackScanner::Progress::complete:
        carryOut(bytes.substr(0, scanner_.length()));
        buffer_.consume(scanner_.length());
        scanner_.reset();
        frameIsPartial_ = false;
        break;
    }
    if (calls % kCallsPerLook == 0 && !lastWords_ && steady_clock::now() >= end) break;
  }
  return open_ && !buffer_.empty();
}

void SocketConnection::receive() {
  if (!open_) return;
  if (!mustWait() && !readAvailable()) {
    end(false);
    return;
  }
  proceed();
}

/// One read: how many bytes there were; none when the client has gone.
std::optional<std::size_t> SocketConnection::readAvailable() {
  const std::span<char> room = buffer_.room();
  const ssize_t count =
      TEMP_FAILURE_RETRY(::recv(socket_.native_handle(), room.data(), room.size(), MSG_DONTWAIT));
  if (count < 0 && errno == EAGAIN) return 0;
  if (count <= 0) return std::nullopt;
  buffer_.arrived(static_cast<std::size_t>(count));
  return static_cast<std::size_t>(count);
}

/// Whether the client has to wait: for its calls to be worked off, or until it reads its replies.
bool SocketConnection::mustWait() {
  if (lastWords_) return false;
  const std::size_t limit = context_->limits.replyBytes;
  if (desk_->repliesHeld() >= limit) {
    flush();
    if (desk_->repliesHeld() >= limit) {
      watchStall();
      return true;
    }
  }
  if (!desk_->mustWaitForRoom()) return false;
  // Also when it is full of others yet: those are behind once they have been carried out.
  watchThoseBehind();
  return true;
}

void SocketConnection::carryOut(std::string_view frame) {
  std::string_view fault;
  if (const auto request = Request::from(PayloadValue(frame.data()), fault)) {
    dispatch(*request, frame.size());
  } else {
    breach(fault);
  }
}

void SocketConnection::dispatch(const Request& request, std::size_t frameBytes) {
  ZQ_FUNCTION("-[SocketConnection dispatch:frameBytes:]");
  const auto call = std::make_shared<Call>(desk_, request.messageID, frameBytes);
  const ExportedMethod* method =
      interface_ != nullptr && object_ ? interface_->find(request.method) : nullptr;
  std::optional<Error> error;
  if (method == nullptr) {
    error = UnknownMethodError(interface_, request.method);
  } else if (request.params.count() != method->argumentCount) {
    // Not left to the operation: the list may be as long as a message, and is not to be copied.
    error = BadArgumentsError(WrongArgumentCount(*method, request.params.count()));
  } else {
    arguments_.clear();
    for (const PayloadValue argument : request.params.items()) arguments_.push_back(argument);
    desk_->begin(frameBytes);
    const CallRef hold(call);
    const CallScope scope(CallScope::Of::call, hold);
    if (auto wrong = method->invoke(*method, *object_, arguments_, call)) {
      error = BadArgumentsError(std::move(*wrong));
    }
  }
  if (!error) return;
  ZQ_LOG(nullptr, info, "client {}: {}", processIdentifier_, error->description());
  call->error(*error);
}

/// What the desk wakes the I/O thread for.
void SocketConnection::attend() {
  if (!open_) return;
  flush();
  watchStall();
  proceed();
}

/// Writes the replies that lie at the desk, all of them with one write where the socket takes them.
void SocketConnection::flush() {
  while (!writing_) {
    if (sent_ == sending_.size()) {
      sent_ = 0;
      if (!desk_->takeReplies(sending_)) return;
    }
    const ssize_t count = ::send(socket_.native_handle(), sending_.data() + sent_,
                                 sending_.size() - sent_, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (count >= 0) {
      sent_ += static_cast<std::size_t>(count);
      desk_->repliesWritten(static_cast<std::size_t>(count));
    } else if (errno != EAGAIN && errno != EINTR && errno != ENOBUFS && errno != ENOMEM) {
      // The client hears no more. The socket is still read: what it sent before is to be carried
      // out. Unless it has closed its end itself, it is to notice.
      const bool hasClosed = errno == EPIPE;
      desk_->refuseReplies();
      sending_.clear();
      sent_ = 0;
      if (!hasClosed) ::shutdown(socket_.native_handle(), SHUT_RD);
      return;
    }
    if (sent_ < sending_.size()) waitUntilWritable();
  }
}

void SocketConnection::waitUntilWritable() {
  writing_ = true;
  socket_.async_wait(asio::posix::stream_descriptor::wait_write,
                     [self = shared_from_this()](asio::error_code error) {
                       self->writing_ = false;
                       if (error || !self->open_) return;
                       self->unwatchStall();
                       self->attend();
                     });
}

void SocketConnection::watchFrame() {
  if (frameIsPartial_) return;
  frameIsPartial_ = true;
  frameDeadline_ = steady_clock::now() + context_->limits.frame;
  if (!frameTimerRuns_) awaitFrameDeadline();
}

/// The timer is left running from one partial frame to the next, so that a busy client, whose every
/// read ends inside a frame, does not set it each time.
void SocketConnection::awaitFrameDeadline() {
  frameTimerRuns_ = true;
  frameTimer_.expires_at(frameDeadline_);
  frameTimer_.async_wait([self = shared_from_this()](asio::error_code error) {
    if (error || !self->open_) return;
    self->frameTimerRuns_ = false;
    if (!self->frameIsPartial_) return;
    if (steady_clock::now() < self->frameDeadline_) {
      self->awaitFrameDeadline();
    } else {
      self->giveUp("a message was begun and not completed in time");
    }
  });
}

void SocketConnection::unwatchFrame() {
  frameIsPartial_ = false;
  if (std::exchange(frameTimerRuns_, false)) frameTimer_.cancel();
}

void SocketConnection::watchStall() {
  if (stallTimerRuns_ || !writing_ || desk_->repliesHeld() < context_->limits.replyBytes) return;
  stallTimerRuns_ = true;
  stallTimer_.expires_after(context_->limits.stall);
  stallTimer_.async_wait([self = shared_from_this()](asio::error_code error) {
    if (error || !self->stallTimerRuns_ || self->stallTimer_.expiry() > steady_clock::now()) return;
    self->giveUp("it does not read its replies");
  });
}

void SocketConnection::unwatchStall() {
  if (std::exchange(stallTimerRuns_, false)) stallTimer_.cancel();
}

/// Calls that wait for something slow do not hold back those that come after them for long.
void SocketConnection::watchThoseBehind() {
  if (std::exchange(behindTimerRuns_, true)) return;
  behindTimer_.expires_after(kSlowBehind);
  behindTimer_.async_wait([self = shared_from_this(), done = desk_->callsDone()](asio::error_code) {
    self->behindTimerRuns_ = false;
    if (!self->open_ || !self->desk_->isWaiting()) return;
    if (self->desk_->callsDone() == done) self->desk_->excuseThoseBehind();
    self->proceed();
  });
}

void SocketConnection::breach(std::string_view fault) {
  ZQ_FUNCTION("-[SocketConnection breach:]");
  ZQ_LOG(nullptr, error, "client {} broke the protocol: {}", processIdentifier_, fault);
  end(true);
}

void SocketConnection::giveUp(std::string_view why) {
  ZQ_FUNCTION("-[SocketConnection giveUp:]");
  ZQ_LOG(nullptr, error, "client {} is disconnected: {}", processIdentifier_, why);
  end(false);
}

void SocketConnection::refuse() {
  interruptionHandler_ = nullptr;
  invalidationHandler_ = nullptr;
  end(false);
}

void SocketConnection::endInOrder() {
  if (open_ && resumed_) {
    // The client can send no more, so this comes to an end; what it has sent can still be read.
    ::shutdown(socket_.native_handle(), SHUT_RD);
    lastWords_ = true;
    do {
      decode();
    } while (open_ && readAvailable().value_or(0) > 0);
  }
  end(false);
}

void SocketConnection::end(bool interrupted) {
  if (!open_) return;
  flush();  // a client that has only stopped sending gets the replies that are there
  open_ = false;
  desk_->refuseReplies();
  unwatchFrame();
  unwatchStall();
  behindTimer_.cancel();
  asio::error_code ignored;
  socket_.close(ignored);

  const auto interruptionHandler = std::exchange(interruptionHandler_, nullptr);
  const auto invalidationHandler = std::exchange(invalidationHandler_, nullptr);
  {
    const CallRef passage = context_->passages.begin(context_);
    const CallScope scope(CallScope::Of::call, passage);
    if (interrupted && interruptionHandler) interruptionHandler();
    if (invalidationHandler) invalidationHandler();
    object_.reset();
  }
  context_->connectionEnded(shared_from_this());
}

}  // namespace quarvel
