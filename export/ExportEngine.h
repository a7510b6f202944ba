#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "export/ExportBatch.h"

namespace quarvel {

struct BackendSettings;
struct ExportDevice;

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
  std::size_t refused = 0;  // rows after the taken ones; 0 unless `remainder` is `refused`
  std::string reason{};     // of the remainder; a sentence without its full stop
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
  /// The delivery in flight returns `stopped`.
  virtual void stop() = 0;
  /// Lets later deliveries run again.
  virtual void resume() = 0;
};

/// The function that an engine's module exports under `kEngineModuleEntry`. `settings` are of the
/// engine's own type: its own reader made them.
using MakeEngine = ExportEngine* (*)(const BackendSettings& settings, const ExportDevice& device);
inline constexpr const char* kEngineModuleEntry = "QuarvelMakeEngine";

/// Makes the engine of a backend from its module, `export-<backend>.so`, which is loaded now and
/// never closed. An engine's libraries are larger than all the rest of the service, and most
/// devices need one engine or none. When the module cannot be loaded, the result is an engine that
/// takes nothing and gives the reason. Blocks while the module is loaded.
[[nodiscard]] std::unique_ptr<ExportEngine> LoadEngine(const std::string& backend,
                                                       const BackendSettings& settings,
                                                       const ExportDevice& device);

}  // namespace quarvel
