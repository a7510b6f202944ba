#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <vector>

#include "base/Error.h"
#include "platform/ServiceListener.h"
#include "system/Configuration.h"
#include "transport/ListeningSocket.h"

namespace quarvel {

/// A listener on a Unix stream socket.
/// Owner: the process's composition root (or a test); must outlive `resume`.
/// Thread: the thread that calls `resume` becomes the I/O thread, which serves every connection.
class SocketListener final : public ServiceListener {
 public:
  struct Options {
    /// Of clients, calls, replies and time, for each connection.
    Configuration::Limits limits;
    /// Signals that end the service as `requestEnd` does; caught from construction on.
    std::vector<int> endSignals;
    // Called on the I/O thread; optional.

    /// Once clients are served.
    std::function<void()> atStart;
    /// Every `pulseInterval` from then on; zero: never.
    std::function<void()> pulse;
    std::chrono::microseconds pulseInterval{0};
    /// When the end begins.
    std::function<void()> atEndBegun;
    /// In this order, when every connection has ended.
    std::vector<std::function<void()>> atEnd;
  };

  /// Errors: domain "quarvel.listener", when the kernel has no descriptor for an event loop.
  [[nodiscard]] static Result<std::unique_ptr<SocketListener>> create(ListeningSocket socket,
                                                                      Options options);
  /// Removes the socket file. `resume` has returned, or was never called.
  ~SocketListener() override;

  /// Before `resume`. The delegate decides about each client, on the I/O thread.
  void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) override;
  /// Blocks until the service was told to end, every connection has ended and `atEnd` is done.
  void resume() override;
  /// Tells the service to end: accepts no more clients, executes the calls that have arrived, ends
  /// every connection. Any thread; returns at once.
  void requestEnd();

 private:
  class Loop;  // the event loop and all state, so that the header names no library
  explicit SocketListener(std::unique_ptr<Loop> loop);

  const std::unique_ptr<Loop> loop_;
};

}  // namespace quarvel
