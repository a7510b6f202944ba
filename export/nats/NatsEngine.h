#pragma once

#include <memory>
#include <optional>
#include <string>

#include "export/ExportDevice.h"
#include "export/ExportEngine.h"
#include "export/nats/NatsSettings.h"

namespace quarvel {

/// A NATS JetStream stream: a message a row, subject `quarvel.<device>.<table>`, body the row as
/// JSON, its name as the `Nats-Msg-Id` by which the stream drops repeats.
///
/// A row counts as taken when its own acknowledgement has come. Rows are published without waiting
/// for one another; when something does not get on, the connection is given up with all that waits
/// in it, and what was not acknowledged goes out again, under the same names, on a new one.
class NatsEngine final : public ExportEngine {
 public:
  NatsEngine(NatsSettings settings, const ExportDevice& device);
  ~NatsEngine() override;

  [[nodiscard]] Delivery deliver(const ExportBatch& batch) override;
  void rest() override;
  void stop() override;
  void resume() override;

 private:
  class Answers;
  class Connection;

  const NatsSettings settings_;
  const std::string name_;     // of the connection
  const std::string subject_;  // and the table's name
  Answers& answers_;           // the library may call them after everything else
  std::unique_ptr<Connection> connection_;
};

}  // namespace quarvel
