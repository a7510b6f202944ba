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

FlowInstant Now() {
  return steady_clock::now();
}

std::int32_t PeerProcessIdentifier(int socket) {
  ucred peer{};
  socklen_t length = sizeof peer;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) return 0;
  return peer.pid;
}

/// The begin or the end of a connection, while blocks that it caused are unfinished.
class ConnectionChange final : public CallTracker {
 public:
  explicit ConnectionChange(std::shared_ptr<ConnectionContext> context)
      : context_(std::move(context)) {
    context_->churn.changeBegun();
  }
  [[nodiscard]] std::size_t bytes() const override { return 0; }

 protected:
  void blockRan(std::chrono::nanoseconds /*time*/) override {}
  void callExecuted() override {}
  void callCompleted() override {
    if (context_->churn.changeEnded()) context_->acceptAgain();
  }

 private:
  const std::shared_ptr<ConnectionContext> context_;
};

}  // namespace

CallRef ConnectionContext::trackConnectionChange() {
  return CallRef(std::make_shared<ConnectionChange>(shared_from_this()));
}

SocketConnection::SocketConnection(std::shared_ptr<ConnectionContext> context, std::uint64_t number)
    : context_(std::move(context)),
      number_(number),
      socket_(context_->io),
      scanner_(context_->limits.messageBytes, context_->limits.depth),
      frameTimer_(context_->io),
      stallTimer_(context_->io),
      slowCallsTimer_(context_->io) {}

std::shared_ptr<SocketConnection> SocketConnection::create(
    std::shared_ptr<ConnectionContext> context, UniqueDescriptor socket, std::uint64_t number) {
  std::shared_ptr<SocketConnection> connection(new SocketConnection(std::move(context), number));
  asio::error_code error;
  connection->socket_.assign(socket.get(), error);
  if (error) return nullptr;
  connection->processIdentifier_ = PeerProcessIdentifier(socket.release());
  // A call may outlive the connection and even the listener, so its channel holds the context.
  connection->channel_ = std::make_shared<CallChannel>(
      connection->context_->limits,
      [shared = connection->context_, weak = std::weak_ptr(connection)] {
        asio::post(shared->io, [weak] {
          if (const auto self = weak.lock()) self->onRepliesOrRoom();
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

void SocketConnection::proceed() {
  if (!open_ || !resumed_ || reading_) return;
  bool isLeft = false;
  {
    // Most calls are brief and find their queues idle: their blocks run here.
    InlineRunner runner;
    isLeft = decode();
    while (runner.runOne()) {
      if (open_) flush();
    }
  }
  if (!open_) return;
  if (mustWait()) {
    unwatchFrame();  // the service is slow, not the client
    return;
  }
  if (isLeft) {
    // The blocks that ran here made room again. Posted, so that the other clients are served before
    // one that sends without end.
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

bool SocketConnection::decode() {
  ReadTurn turn(Now());
  while (open_ && !buffer_.empty() && !mustWait()) {
    const std::string_view bytes = buffer_.bytes();
    switch (scanner_.scan(bytes)) {
      case MessagePackScanner::Progress::incomplete:
        return false;
      case MessagePackScanner::Progress::fault:
        endForProtocolError(scanner_.fault());
        return false;
      case MessagePackScanner::Progress::complete:
        execute(bytes.substr(0, scanner_.length()));
        buffer_.consume(scanner_.length());
        scanner_.reset();
        frameIsPartial_ = false;
        break;
    }
    if (!draining_ && turn.isOverAfterCall(Now)) break;
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

std::optional<std::size_t> SocketConnection::readAvailable() {
  const std::span<char> room = buffer_.room();
  const ssize_t count =
      TEMP_FAILURE_RETRY(::recv(socket_.native_handle(), room.data(), room.size(), MSG_DONTWAIT));
  if (count < 0 && errno == EAGAIN) return 0;
  if (count <= 0) return std::nullopt;
  buffer_.arrived(static_cast<std::size_t>(count));
  return static_cast<std::size_t>(count);
}

bool SocketConnection::mustWait() {
  if (draining_) return false;
  if (channel_->replies.holdsMaximum()) {
    flush();
    if (channel_->replies.holdsMaximum()) {
      watchStall();
      return true;
    }
  }
  if (!channel_->flow.mustWait(Now)) return false;
  // Also while the calls are still executing: they are unstored after that.
  watchSlowCalls();
  return true;
}

void SocketConnection::execute(std::string_view frame) {
  std::string_view fault;
  if (const auto request = Request::from(PayloadValue(frame.data()), fault)) {
    dispatch(*request, frame.size());
  } else {
    endForProtocolError(fault);
  }
}

void SocketConnection::dispatch(const Request& request, std::size_t frameBytes) {
  ZQ_FUNCTION("-[SocketConnection dispatch:frameBytes:]");
  const auto call = std::make_shared<Call>(channel_, request.messageID, frameBytes);
  const ExportedMethod* method =
      interface_ != nullptr && object_ ? interface_->find(request.method) : nullptr;
  std::optional<Error> error;
  if (method == nullptr) {
    error = UnknownMethodError(interface_, request.method);
  } else if (request.params.count() != method->argumentCount) {
    // Checked before the arguments are copied: the list may be as long as a message.
    error = BadArgumentsError(WrongArgumentCount(*method, request.params.count()));
  } else {
    arguments_.clear();
    for (const PayloadValue argument : request.params.items()) arguments_.push_back(argument);
    channel_->flow.callBegun(frameBytes);
    const CallRef reference(call);
    const CallScope scope(CallScope::Of::call, reference);
    if (auto wrong = method->invoke(*method, *object_, arguments_, call)) {
      error = BadArgumentsError(std::move(*wrong));
    }
  }
  if (!error) return;
  ZQ_LOG(nullptr, info, "client {}: {}", processIdentifier_, error->description());
  call->error(*error);
}

void SocketConnection::onRepliesOrRoom() {
  if (!open_) return;
  flush();
  watchStall();
  proceed();
}

void SocketConnection::flush() {
  while (!writing_) {
    if (sent_ == sending_.size()) {
      sent_ = 0;
      if (!channel_->replies.take(sending_)) return;
    }
    const ssize_t count = ::send(socket_.native_handle(), sending_.data() + sent_,
                                 sending_.size() - sent_, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (count >= 0) {
      sent_ += static_cast<std::size_t>(count);
      channel_->replies.written(static_cast<std::size_t>(count));
    } else if (errno != EAGAIN && errno != EINTR && errno != ENOBUFS && errno != ENOMEM) {
      // No reply reaches the client any more. The socket is still read: calls that were sent before
      // are executed. A client that did not close its end itself shall notice.
      const bool hasClosed = errno == EPIPE;
      channel_->replies.refuse();
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
                       self->onRepliesOrRoom();
                     });
}

void SocketConnection::watchFrame() {
  if (frameIsPartial_) return;
  frameIsPartial_ = true;
  frameDeadline_ = steady_clock::now() + context_->limits.frame;
  if (!frameTimerRuns_) awaitFrameDeadline();
}

void SocketConnection::awaitFrameDeadline() {
  // The timer runs on from one partial frame to the next: a busy client, whose every read ends
  // inside a frame, does not set it each time.
  frameTimerRuns_ = true;
  frameTimer_.expires_at(frameDeadline_);
  frameTimer_.async_wait([self = shared_from_this()](asio::error_code error) {
    if (error || !self->open_) return;
    self->frameTimerRuns_ = false;
    if (!self->frameIsPartial_) return;
    if (steady_clock::now() < self->frameDeadline_) {
      self->awaitFrameDeadline();
    } else {
      self->endForTimeout("a message was begun and not completed in time");
    }
  });
}

void SocketConnection::unwatchFrame() {
  frameIsPartial_ = false;
  if (std::exchange(frameTimerRuns_, false)) frameTimer_.cancel();
}

void SocketConnection::watchStall() {
  if (stallTimerRuns_ || !writing_ || !channel_->replies.holdsMaximum()) return;
  stallTimerRuns_ = true;
  stallTimer_.expires_after(context_->limits.stall);
  stallTimer_.async_wait([self = shared_from_this()](asio::error_code error) {
    if (error || !self->stallTimerRuns_ || self->stallTimer_.expiry() > steady_clock::now()) return;
    self->endForTimeout("it does not read its replies");
  });
}

void SocketConnection::unwatchStall() {
  if (std::exchange(stallTimerRuns_, false)) stallTimer_.cancel();
}

void SocketConnection::watchSlowCalls() {
  if (std::exchange(slowCallsTimerRuns_, true)) return;
  slowCallsTimer_.expires_after(flow::kExemptAfter);
  slowCallsTimer_.async_wait(
      [self = shared_from_this(), completed = channel_->flow.completedCalls()](asio::error_code) {
        self->slowCallsTimerRuns_ = false;
        if (!self->open_ || !self->channel_->flow.isWaiting()) return;
        self->channel_->flow.exemptSlowCalls(completed);
        self->proceed();
      });
}

void SocketConnection::endForProtocolError(std::string_view fault) {
  ZQ_FUNCTION("-[SocketConnection endForProtocolError:]");
  ZQ_LOG(nullptr, error, "client {} broke the protocol: {}", processIdentifier_, fault);
  end(true);
}

void SocketConnection::endForTimeout(std::string_view reason) {
  ZQ_FUNCTION("-[SocketConnection endForTimeout:]");
  ZQ_LOG(nullptr, error, "client {} is disconnected: {}", processIdentifier_, reason);
  end(false);
}

void SocketConnection::refuse() {
  interruptionHandler_ = nullptr;
  invalidationHandler_ = nullptr;
  end(false);
}

void SocketConnection::drainAndEnd() {
  if (open_ && resumed_) {
    // Stops the client from sending, so that the loop ends; bytes that have arrived stay readable.
    ::shutdown(socket_.native_handle(), SHUT_RD);
    draining_ = true;
    do {
      (void)decode();
    } while (open_ && readAvailable().value_or(0) > 0);
  }
  end(false);
}

void SocketConnection::end(bool interrupted) {
  if (!open_) return;
  flush();  // a client that has only shut down its sending side still gets its replies
  open_ = false;
  channel_->replies.refuse();
  unwatchFrame();
  unwatchStall();
  slowCallsTimer_.cancel();
  asio::error_code ignored;
  socket_.close(ignored);

  const auto interruptionHandler = std::exchange(interruptionHandler_, nullptr);
  const auto invalidationHandler = std::exchange(invalidationHandler_, nullptr);
  {
    const CallRef change = context_->trackConnectionChange();
    const CallScope scope(CallScope::Of::call, change);
    if (interrupted && interruptionHandler) interruptionHandler();
    if (invalidationHandler) invalidationHandler();
    object_.reset();
  }
  context_->connectionEnded(shared_from_this());
}

}  // namespace quarvel
