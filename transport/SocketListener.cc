#include "transport/SocketListener.h"

#include <sys/socket.h>

#include <algorithm>
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
#include "transport/SocketConnection.h"

namespace quarvel {

namespace {

/// Descriptors run out for the whole process or system, so there may be some again although none of
/// our connections has ended.
constexpr std::chrono::seconds kRetryAccepting{1};

/// So many clients are welcomed before those who are there get their turn.
constexpr int kAcceptedPerTurn = 4;

/// Whoever comes brings the server queue work, a look at its process, lines of the log and a row:
/// some hundred microseconds in all. So many may come at once, and in the long run so often, that
/// those who come and go as fast as they can leave the processor to others.
class Pace {
 public:
  [[nodiscard]] bool allowsOne() const { return next_ <= std::chrono::steady_clock::now(); }
  void oneCame() {
    next_ = std::max(next_, std::chrono::steady_clock::now() - kInterval * kAtOnce) + kInterval;
  }
  /// When a turn's worth may come again.
  [[nodiscard]] std::chrono::steady_clock::time_point nextTurn() const {
    return next_ + kInterval * kAcceptedPerTurn;
  }

 private:
  static constexpr int kAtOnce = 512;
  static constexpr std::chrono::microseconds kInterval{250};

  std::chrono::steady_clock::time_point next_;
};

}  // namespace

/// The listener's side of the event loop: accepts, counts, ends. All of it belongs to the I/O
/// thread, except what `SocketListener` calls on any.
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
    // May come when this object has gone, but then nothing runs the loop any more.
    context_->passages.wake = [this, &io = context_->io] { acceptSoon(io); };
    context_->connectionEnded = [this](const std::shared_ptr<SocketConnection>& connection) {
      connections_.erase(connection);
      if (heldBack_ && !ended_) acceptSoon(context_->io);
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
    asio::post(io, [this] { acceptWaiting(); });
  }

  void acceptWaiting() {
    if (accepting_ || ended_) return;
    switch (accept(kAcceptedPerTurn)) {
      case Accepted::all:
        accepting_ = true;
        socket_.async_wait(asio::posix::stream_descriptor::wait_read,
                           [this](asio::error_code error) {
                             accepting_ = false;
                             if (!error) acceptWaiting();
                           });
        break;
      case Accepted::turn:
        acceptSoon(context_->io);
        break;
      case Accepted::paced:
        acceptAt(pace_.nextTurn());
        break;
      case Accepted::heldBack:
        break;
    }
  }

  /// What became of the clients who wait: all are accepted, as many as were to be, as many as may
  /// be for now, or no more may be until somebody calls `acceptSoon`.
  enum class Accepted { all, turn, paced, heldBack };

  Accepted accept(int most) {
    for (int accepted = 0;;) {
      if (accepted == most) return Accepted::turn;
      if (!ended_ && context_->passages.areTooMany()) return Accepted::heldBack;
      if (!ended_ && !pace_.allowsOne()) return Accepted::paced;
      if (connections_.size() >= options_.limits.connections) {
        holdBack(fmt::format("there are {} connections already", connections_.size()));
        return Accepted::heldBack;
      }
      UniqueDescriptor client(
          ::accept4(socket_.native_handle(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
      if (client) {
        ++accepted;
        pace_.oneCame();
        welcome(std::move(client));
      } else if (errno == EAGAIN) {
        heldBack_ = false;
        return Accepted::all;
      } else if (errno != EINTR && errno != ECONNABORTED && errno != EPROTO) {
        holdBack(std::generic_category().message(errno));
        acceptAt(std::chrono::steady_clock::now() + kRetryAccepting);
        return Accepted::heldBack;
      }
    }
  }

  /// Accepts no more until a connection ends; said once, however long it lasts.
  void holdBack(const std::string& reason) {
    ZQ_FUNCTION("-[SocketListener holdBack:]");
    if (std::exchange(heldBack_, true)) return;
    ZQ_LOG(nullptr, error, "no further client is accepted until one has gone: {}", reason);
  }

  void acceptAt(std::chrono::steady_clock::time_point time) {
    acceptTimer_.expires_at(time);
    acceptTimer_.async_wait([this](asio::error_code error) {
      if (!error) acceptWaiting();
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

  void welcome(UniqueDescriptor client) {
    ZQ_FUNCTION("-[SocketListener welcome:]");
    const auto connection = SocketConnection::create(context_, std::move(client), ++lastNumber_);
    if (connection == nullptr) {
      ZQ_LOG(nullptr, error, "a client is turned away: the kernel cannot watch its socket");
      return;
    }
    connections_.insert(connection);
    const CallRef passage = context_->passages.begin(context_);
    const CallScope scope(CallScope::Of::call, passage);
    if (delegate_ == nullptr || !delegate_->shouldAcceptNewConnection(*listener_, connection)) {
      connection->refuse();
    }
  }

  void end() {
    if (std::exchange(ended_, true)) return;
    if (options_.atEndBegun) options_.atEndBegun();
    // Who came before the end is heard; at an inherited socket they wait for the next service.
    if (listeningSocket_.removeFile()) (void)accept(std::numeric_limits<int>::max());
    asio::error_code ignored;
    socket_.close(ignored);
    acceptTimer_.cancel();
    pulseTimer_.cancel();
    signals_.cancel(ignored);
    // Each takes itself out of the set.
    const std::vector<std::shared_ptr<SocketConnection>> connections(connections_.begin(),
                                                                     connections_.end());
    for (const auto& connection : connections) connection->endInOrder();
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
  Pace pace_;
  bool accepting_ = false;  // waits for a client
  bool heldBack_ = false;   // clients wait, but there is no room
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
