#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "export/ExportBatch.h"

namespace quarvel {

/// The outcome of one batch.
struct Delivery {
  enum class Remainder : std::uint8_t {
    none,     // the whole batch was taken
    again,    // the engine may take the remaining rows at another time
    refused,  // the engine will never take the next `refused` rows, alone or together
    stopped,  // `stop` was called; the remaining rows may or may not have arrived
  };

  std::size_t taken = 0;  // rows that are safe with the engine, counted from the first
  Remainder remainder = Remainder::none;
  std::size_t refused = 0;
  std::string reason{};  // of the remainder; a sentence without its full stop
  /// Time that the engine asks for before the remaining rows are sent.
  std::optional<std::chrono::seconds> after{};
  /// Number of taken rows that the engine dropped without naming them, for `reason`.
  std::size_t droppedByEngine = 0;
};

/// The part of an exporter that differs from engine to engine: it hands rows to one remote system.
/// Owned by its `ExportThread` and used on that thread alone, but for `stop` and `resume`; lives
/// until the thread has ended.
class ExportEngine {
 public:
  virtual ~ExportEngine() = default;

  /// Sends rows and waits, for some seconds at most, until the engine has them safe or refuses
  /// them. The batch is not empty.
  [[nodiscard]] virtual Delivery deliver(const ExportBatch& batch) = 0;
  /// Releases the connection and anything else that costs the device power while there is nothing
  /// to send. The next `deliver` connects again.
  virtual void disconnect() = 0;

  /// Any thread. Between `stop` and `resume` a delivery ends at once, also one in flight.
  virtual void stop() = 0;
  virtual void resume() = 0;
};

}  // namespace quarvel
