#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/ExportedInterface.h"

namespace quarvel {

/// One client's connection. The listener hands it to its delegate before it serves; the facility
/// owns it until it is invalidated.
///
/// An implementation guarantees:
/// - Nothing is read from the client before `resume`.
/// - Calls are made on the exported object, on the connection's own thread, one at a time and in
///   the order sent. The facility itself answers a call that the exported interface does not know,
///   or whose arguments do not fit.
/// - When the client breaks the protocol, the interruption handler is called and then the
///   invalidation handler; when it has gone, or the service ends, only the invalidation handler.
///   Each is called at most once, on a platform thread, after every call that arrived before.
/// - After invalidation the connection releases the exported object and both handlers.
/// - The facility applies back-pressure to a client that calls faster than it is served.
class ClientConnection {
 public:
  virtual ~ClientConnection() = default;

  /// The caller's process id, as the kernel tells it; fixed when the connection was accepted.
  [[nodiscard]] virtual std::int32_t processIdentifier() const = 0;

  // Set before `resume`, on the thread on which the delegate was asked.
  virtual void setExportedInterface(const ExportedInterface& exportedInterface) = 0;
  virtual void setExportedObject(std::shared_ptr<ExportedObject> object) = 0;
  [[nodiscard]] virtual std::shared_ptr<ExportedObject> exportedObject() const = 0;
  /// Called when the client breaks the protocol.
  virtual void setInterruptionHandler(std::function<void()> handler) = 0;
  /// Called at the end of the connection, for any reason.
  virtual void setInvalidationHandler(std::function<void()> handler) = 0;

  /// Starts to serve the client. Returns at once.
  virtual void resume() = 0;
  /// For log lines.
  [[nodiscard]] virtual std::string description() const = 0;
};

}  // namespace quarvel
