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

/// A listener on a Unix stream socket. The thread that calls `resume` becomes the I/O thread, which
/// serves every connection.
class SocketListener final : public ServiceListener {
 public:
  struct Options {
    Configuration::Limits limits;
    /// Signals that end the service in order; seen from construction on.
    std::vector<int> endSignals;
    /// Called on the I/O thread, each when it is set: once clients are served; every
    /// `pulseInterval` from then on, unless that is zero; when the end begins.
    std::function<void()> atStart;
    std::function<void()> pulse;
    std::chrono::microseconds pulseInterval{0};
    std::function<void()> atEndBegun;
    /// What is to be done when every connection has ended, in this order, on the I/O thread.
    std::vector<std::function<void()>> atEnd;
  };

  /// Errors: domain "quarvel.listener", when the kernel has no room for an event loop.
  [[nodiscard]] static Result<std::unique_ptr<SocketListener>> create(ListeningSocket socket,
                                                                      Options options);
  ~SocketListener() override;

  void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) override;
  /// Returns when the service has been told to end, every connection has ended and `atEnd` is done.
  void resume() override;
  /// Tells the service to end, as an end signal does. Any thread; returns at once.
  void requestEnd();

 private:
  class Loop;
  explicit SocketListener(std::unique_ptr<Loop> loop);

  const std::unique_ptr<Loop> loop_;
};

}  // namespace quarvel
