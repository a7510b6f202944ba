#include "transport/SocketListener.h"

#include <sys/socket.h>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/post.hpp>
#include <asio/signal_set.hpp>
#include <asio/steady_timer.hpp>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <limits>
#include <string>
#include <system_error>
#include <unordered_set>
#include <utility>
#include <vector>

#include "base/Format.h"
#include "platform/Log.h"
#include "quotas/FlowControl.h"
#include "transport/SocketConnection.h"

namespace quarvel {

namespace {

FlowInstant Now() {
  return std::chrono::steady_clock::now();
}

}  // namespace

/// The listener's side of the event loop: accepts clients, counts connections, ends the service.
/// Owner: the `SocketListener`. Thread: the I/O thread, except for `requestEnd`.
class SocketListener::Loop {
 public:
  Loop(ListeningSocket socket, Options options)
      : options_(std::move(options)),
        context_(std::make_shared<ConnectionContext>(options_.limits)),
        busy_(context_->io.get_executor()),
        listeningSocket_(std::move(socket)),
        socket_(context_->io, listeningSocket_.releaseDescriptor().release()),
        acceptTimer_(context_->io),
        pulseTimer_(context_->io),
        signals_(context_->io) {
    for (const int signal : options_.endSignals) signals_.add(signal);
    // A call may complete after this object has gone; the posted block then never runs.
    context_->acceptAgain = [this, &io = context_->io] { acceptSoon(io); };
    context_->connectionEnded = [this](const std::shared_ptr<SocketConnection>& connection) {
      connections_.erase(connection);
      if (paused_ && !ended_) acceptSoon(context_->io);
    };
  }

  void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) {
    delegate_ = std::move(delegate);
  }

  void run(SocketListener& listener) {
    listener_ = &listener;
    if (!options_.endSignals.empty()) {
      signals_.async_wait([this](asio::error_code error, int) {
        if (!error) end();
      });
    }
    acceptSoon(context_->io);
    if (options_.atStart) asio::post(context_->io, options_.atStart);
    if (options_.pulseInterval > std::chrono::nanoseconds::zero()) pulseLater();
    context_->io.run();
    for (const auto& step : options_.atEnd) step();
  }

  void requestEnd() {
    asio::post(context_->io, [this] { end(); });
  }

 private:
  void acceptSoon(asio::io_context& io) {
    asio::post(io, [this] { acceptPending(); });
  }

  void acceptPending() {
    if (accepting_ || ended_) return;
    switch (accept(flow::kAcceptsPerTurn)) {
      case AcceptResult::noneLeft:
        accepting_ = true;
        socket_.async_wait(asio::posix::stream_descriptor::wait_read,
                           [this](asio::error_code error) {
                             accepting_ = false;
                             if (!error) acceptPending();
                           });
        break;
      case AcceptResult::turnOver:
        acceptSoon(context_->io);
        break;
      case AcceptResult::rateLimited:
        acceptAt(rateLimit_.nextTurn());
        break;
      case AcceptResult::paused:
        break;
    }
  }

  /// Why `accept` returned. `paused`: until an event or a timer calls `acceptPending`.
  enum class AcceptResult { noneLeft, turnOver, rateLimited, paused };

  AcceptResult accept(int most) {
    for (int accepted = 0;;) {
      if (accepted == most) return AcceptResult::turnOver;
      if (!ended_ && context_->churn.mustWait()) return AcceptResult::paused;
      if (!ended_ && !rateLimit_.allowsOne(Now())) return AcceptResult::rateLimited;
      if (connections_.size() >= options_.limits.connections) {
        pauseAccepting(fmt::format("there are {} connections already", connections_.size()));
        return AcceptResult::paused;
      }
      UniqueDescriptor client(
          ::accept4(socket_.native_handle(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
      if (client) {
        ++accepted;
        rateLimit_.accepted(Now());
        addConnection(std::move(client));
      } else if (errno == EAGAIN) {
        paused_ = false;
        return AcceptResult::noneLeft;
      } else if (errno != EINTR && errno != ECONNABORTED && errno != EPROTO) {
        pauseAccepting(std::generic_category().message(errno));
        acceptAt(Now() + flow::kAcceptRetry);
        return AcceptResult::paused;
      }
    }
  }

  /// No client is accepted until a connection ends. Logged once for the whole pause.
  void pauseAccepting(const std::string& reason) {
    ZQ_FUNCTION("-[SocketListener pauseAccepting:]");
    if (std::exchange(paused_, true)) return;
    ZQ_LOG(nullptr, error, "no further client is accepted until one has gone: {}", reason);
  }

  void acceptAt(std::chrono::steady_clock::time_point time) {
    acceptTimer_.expires_at(time);
    acceptTimer_.async_wait([this](asio::error_code error) {
      if (!error) acceptPending();
    });
  }

  void pulseLater() {
    pulseTimer_.expires_after(options_.pulseInterval);
    pulseTimer_.async_wait([this](asio::error_code error) {
      if (error || ended_) return;
      options_.pulse();
      pulseLater();
    });
  }

  void addConnection(UniqueDescriptor client) {
    ZQ_FUNCTION("-[SocketListener addConnection:]");
    const auto connection = SocketConnection::create(context_, std::move(client), ++lastNumber_);
    if (connection == nullptr) {
      ZQ_LOG(nullptr, error, "a client is turned away: the kernel cannot watch its socket");
      return;
    }
    connections_.insert(connection);
    const CallRef change = context_->trackConnectionChange();
    const CallScope scope(CallScope::Of::call, change);
    if (delegate_ == nullptr || !delegate_->shouldAcceptNewConnection(*listener_, connection)) {
      connection->refuse();
    }
  }

  void end() {
    if (std::exchange(ended_, true)) return;
    if (options_.atEndBegun) options_.atEndBegun();
    // Clients that connected before the end are served; at an inherited socket they wait for the
    // next service instead.
    if (listeningSocket_.removeFile()) (void)accept(std::numeric_limits<int>::max());
    asio::error_code ignored;
    socket_.close(ignored);
    acceptTimer_.cancel();
    pulseTimer_.cancel();
    signals_.cancel(ignored);
    // A copy: each connection removes itself from the set.
    const std::vector<std::shared_ptr<SocketConnection>> connections(connections_.begin(),
                                                                     connections_.end());
    for (const auto& connection : connections) connection->drainAndEnd();
    busy_.reset();
  }

  // Constant once the listener serves.
  const Options options_;
  const std::shared_ptr<ConnectionContext> context_;
  std::shared_ptr<ServiceListenerDelegate> delegate_;
  SocketListener* listener_ = nullptr;

  // The I/O thread's.
  asio::executor_work_guard<asio::io_context::executor_type> busy_;  // until the end
  ListeningSocket listeningSocket_;
  asio::posix::stream_descriptor socket_;
  asio::steady_timer acceptTimer_;
  asio::steady_timer pulseTimer_;
  asio::signal_set signals_;
  std::unordered_set<std::shared_ptr<SocketConnection>> connections_;
  std::uint64_t lastNumber_ = 0;
  AcceptRateLimit rateLimit_;
  bool accepting_ = false;  // waits until a client connects
  bool paused_ = false;     // clients wait, but the service has no room for them
  bool ended_ = false;
};

SocketListener::SocketListener(std::unique_ptr<Loop> loop) : loop_(std::move(loop)) {}

SocketListener::~SocketListener() = default;

Result<std::unique_ptr<SocketListener>> SocketListener::create(ListeningSocket socket,
                                                               Options options) {
  try {
    return std::unique_ptr<SocketListener>(
        new SocketListener(std::make_unique<Loop>(std::move(socket), std::move(options))));
  } catch (const std::system_error& error) {
    return Error::because("quarvel.listener", 2,
                          fmt::format("the event loop cannot be set up: {}", error.what()));
  }
}

void SocketListener::setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) {
  loop_->setDelegate(std::move(delegate));
}

void SocketListener::resume() {
  loop_->run(*this);
}

void SocketListener::requestEnd() {
  loop_->requestEnd();
}

}  // namespace quarvel
