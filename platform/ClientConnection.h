#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/ExportedInterface.h"

namespace quarvel {

/// One client's connection, as the listener hands it to its delegate: not yet serving.
///
/// An implementation guarantees:
/// - Nothing is read from the client before `resume`.
/// - Calls are made on the connection's own thread, one at a time and in the order sent, on the
///   exported object; a call that the exported interface does not know, or whose arguments do not
///   fit, is answered by the facility and reaches nobody.
/// - When the client breaks the protocol, the interruption handler is called and then the
///   invalidation handler; when it has gone, or the service ends, only the invalidation handler.
///   Each is called at most once, on a platform thread, after every call that arrived before.
/// - After invalidation the connection lets go of the exported object and both handlers.
/// - The facility holds back a client that calls faster than it is served; the service need not.
class ClientConnection {
 public:
  virtual ~ClientConnection() = default;

  /// The caller's process id, as the kernel tells it; fixed when the connection was accepted.
  [[nodiscard]] virtual std::int32_t processIdentifier() const = 0;

  // To be set before `resume`, on the thread that was handed the connection.
  virtual void setExportedInterface(const ExportedInterface& exportedInterface) = 0;
  virtual void setExportedObject(std::shared_ptr<ExportedObject> object) = 0;
  [[nodiscard]] virtual std::shared_ptr<ExportedObject> exportedObject() const = 0;
  virtual void setInterruptionHandler(std::function<void()> handler) = 0;
  virtual void setInvalidationHandler(std::function<void()> handler) = 0;

  /// Begins to serve the client. Returns at once.
  virtual void resume() = 0;
  /// For log lines.
  [[nodiscard]] virtual std::string description() const = 0;
};

}  // namespace quarvel
