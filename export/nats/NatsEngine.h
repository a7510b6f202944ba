#pragma once

#include <memory>
#include <optional>
#include <string>

#include "export/ExportEngine.h"
#include "export/ExportSettings.h"
#include "export/nats/NatsSettings.h"

namespace quarvel {

/// Publishes rows to a NATS JetStream stream: one message for each row, subject
/// `quarvel.<device>.<table>`, body the row as JSON. The row's name is the `Nats-Msg-Id` by which
/// the stream drops repeats.
///
/// A row is taken once its own acknowledgement has come; rows are published without waiting for one
/// another. After any failure the connection is closed with all rows in flight, and the rows
/// without an acknowledgement are sent again, under the same names, on a new connection. Owned and
/// used as `ExportEngine` says.
class NatsEngine final : public ExportEngine {
 public:
  /// Connects to no server before the first delivery.
  NatsEngine(NatsSettings settings, const ExportDevice& device);
  ~NatsEngine() override;

  [[nodiscard]] Delivery deliver(const ExportBatch& batch) override;
  void disconnect() override;
  void stop() override;
  void resume() override;

 private:
  class Acknowledgements;  // of the batch in flight; filled by the library's threads
  class Connection;        // to one of the servers, with the stream checked

  const NatsSettings settings_;
  const std::string name_;              // of the connection
  const std::string subject_;           // of every message, up to the table's name
  Acknowledgements& acknowledgements_;  // outlives this: the library may still call it
  std::unique_ptr<Connection> connection_;
};

}  // namespace quarvel
