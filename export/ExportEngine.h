#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "export/ExportBatch.h"

namespace quarvel {

/// What became of a batch.
struct Delivery {
  enum class Rest : std::uint8_t {
    none,     // there is no rest: the whole batch was taken
    again,    // the engine may take the rest another time
    refused,  // the engine will never take the next `refused` rows, as they stand or together
    stopped,  // `stop` was called; what became of the rest is not known
  };

  std::size_t taken = 0;  // so many rows from the first on are safe with the engine
  Rest rest = Rest::none;
  std::size_t refused = 0;
  std::string reason{};  // why there is a rest, a sentence without its full stop
  /// How long the engine asks to be left alone before it is sent the rest.
  std::optional<std::chrono::seconds> after{};
  /// Of the rows that were taken so many were not kept, the engine does not say which; `reason`
  /// says why.
  std::size_t droppedByEngine = 0;
};

/// An engine that takes rows: the part of an exporter that differs from engine to engine. Used by
/// its exporter's thread alone, but for `stop` and `resume`.
class ExportEngine {
 public:
  virtual ~ExportEngine() = default;

  /// Hands rows over and returns once the engine has them safe or is known not to take them, after
  /// some seconds at most. The batch is not empty.
  [[nodiscard]] virtual Delivery deliver(const ExportBatch& batch) = 0;
  /// There will be nothing to deliver for a while: gives up what costs the device anything.
  virtual void rest() = 0;

  /// Any thread. From now on until `resume` a delivery, also one under way, ends at once.
  virtual void stop() = 0;
  virtual void resume() = 0;
};

}  // namespace quarvel
