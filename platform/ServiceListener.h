#pragma once

#include <memory>

#include "platform/ClientConnection.h"

namespace quarvel {

class ServiceListener;

/// Decides about new connections.
class ServiceListenerDelegate {
 public:
  virtual ~ServiceListenerDelegate() = default;
  /// Called on a platform thread for every new connection. To accept: set the connection up, resume
  /// it and return true. A connection that is not accepted is closed.
  virtual bool shouldAcceptNewConnection(ServiceListener& listener,
                                         const std::shared_ptr<ClientConnection>& connection) = 0;
};

/// The listener that the platform made for this service process.
class ServiceListener {
 public:
  virtual ~ServiceListener() = default;
  /// Shares ownership of the delegate for the life of the listener. Before `resume`.
  virtual void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) = 0;
  /// Serves until the service is told to end. Takes the calling thread, which must be the main one,
  /// and need not return: a service that ends in order stops its clients as if they had gone,
  /// drains every queue and exits.
  virtual void resume() = 0;
};

/// The process's own service listener. Its name comes from the launch configuration. A service that
/// cannot be started (its socket is taken, its store cannot be opened) ends here, with an error
/// line and a status other than 0.
[[nodiscard]] ServiceListener& ProcessServiceListener();

}  // namespace quarvel
