#pragma once

#include <memory>

#include "platform/ClientConnection.h"

namespace quarvel {

class ServiceListener;

/// Decides about new connections. Owned by the listener.
class ServiceListenerDelegate {
 public:
  virtual ~ServiceListenerDelegate() = default;
  /// Called on a platform thread for every new connection. To accept it, the delegate sets it up,
  /// resumes it and returns true. Otherwise the connection is closed.
  virtual bool shouldAcceptNewConnection(ServiceListener& listener,
                                         const std::shared_ptr<ClientConnection>& connection) = 0;
};

/// Accepts the connections of this service process. The platform owns it.
class ServiceListener {
 public:
  virtual ~ServiceListener() = default;
  /// Shares ownership of the delegate for the life of the listener. Before `resume`.
  virtual void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) = 0;
  /// Serves on the calling thread, the main one, until the service is told to end, and need not
  /// return: an orderly end stops the clients as if they had gone, drains every queue and exits.
  virtual void resume() = 0;
};

/// The process's own service listener. Its name comes from the launch configuration. When the
/// service cannot start (its socket is taken, its store cannot be opened), the process ends here
/// with an error line and a status other than 0.
[[nodiscard]] ServiceListener& ProcessServiceListener();

}  // namespace quarvel
