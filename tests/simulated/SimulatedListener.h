#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Value.h"
#include "platform/ServiceListener.h"
#include "tests/simulated/Scheduler.h"

namespace quarvel {

class SimulatedConnection;

/// One call of a client and everything that was answered to it, later answers too.
struct RecordedCall {
  std::string method;
  List arguments;
  std::vector<Value> results;  // an error as its text
  /// Why the call did not reach the exported object.
  std::optional<std::string> fault;
};

/// Something that came to the service, noted at the moment at which its work is queued: what comes
/// first is carried out first.
struct Arrival {
  enum class Kind : std::uint8_t { connection, call, end, notification };
  Kind kind;
  std::size_t client = 0;  // in the order of their connecting; not of a notification
  std::shared_ptr<const RecordedCall> call;  // of a call
};

/// A process that calls the service: the far end of a connection. Its calls are made on the
/// connection's own simulated thread, in order, once the connection serves. Copies are the same
/// client; dropping one does not disconnect.
class SimulatedClient {
 public:
  using Call = std::shared_ptr<const RecordedCall>;

  explicit SimulatedClient(const std::shared_ptr<SimulatedConnection>& connection);

  /// Sends `arguments`, as MessagePack, to the exported operation `method`.
  Call call(std::string method, const List& arguments);
  /// Breaks the protocol (interruption, then invalidation) or goes away (invalidation alone).
  void end(bool interrupted = false);

  // For asserting that nobody keeps them alive.
  [[nodiscard]] std::weak_ptr<ClientConnection> connection() const;
  [[nodiscard]] std::weak_ptr<ExportedObject> exportedObject() const { return *exportedObject_; }

 private:
  std::weak_ptr<SimulatedConnection> connection_;
  std::shared_ptr<const std::weak_ptr<ExportedObject>> exportedObject_;
};

/// The process's listener.
class SimulatedListener final : public ServiceListener {
 public:
  /// A process connects. The delegate is asked on a platform thread, in the next run.
  SimulatedClient connect(std::int32_t processIdentifier);

  void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) override;
  /// Returns at once, since the test has the main thread.
  void resume() override;

  /// For connections: the facility lets go of one.
  void drop(const SimulatedConnection& connection);
  /// For the end of the simulation: lets go of everything.
  void release();

 private:
  std::shared_ptr<ServiceListenerDelegate> delegate_;
  std::shared_ptr<Scheduler::Queue> queue_;
  std::vector<std::shared_ptr<SimulatedConnection>> connections_;
  std::size_t clients_ = 0;
  bool resumed_ = false;
};

}  // namespace quarvel
