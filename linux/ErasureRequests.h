#pragma once

#include <cstdint>
#include <filesystem>
#include <memory>

#include "base/Error.h"
#include "platform/WorkQueue.h"

namespace quarvel {

struct ErasureSelection;
class Exporters;
class TelemetryStore;

/// Carries out the requests of `quarvelctl erase`: files `<name>.json` in `directory`, each
/// `{"session": ID}`, `{"before": microseconds}` or `{"all": true}`, announced by the notification
/// "tarnwick.quarvel.erase". A request becomes `<name>.answer`: `{"rows": N}` or
/// `{"error": "..."}`. While rows are erased nothing is exported and no exporter holds a row.
///
/// Owned by the service, and outlives the blocks of its queue.
class ErasureRequests {
 public:
  /// Carries out the requests that are there already, and each later one. `store` and `exporters`
  /// outlive this.
  ErasureRequests(std::filesystem::path directory, TelemetryStore& store, Exporters& exporters);
  ErasureRequests(const ErasureRequests&) = delete;
  ErasureRequests& operator=(const ErasureRequests&) = delete;

 private:
  // On `queue_`.

  /// Carries out every request in the directory.
  void answerAll();
  /// Carries out one request and replaces its file by the answer.
  void answer(const std::filesystem::path& request);
  /// Erases rows while the exporters are held. Returns their number; blocks until the store has
  /// erased them. Errors: the store's.
  [[nodiscard]] Result<std::int64_t> erase(const ErasureSelection& selection);

  // Constant after construction.
  const std::filesystem::path directory_;
  TelemetryStore& store_;
  Exporters& exporters_;
  const std::unique_ptr<WorkQueue> queue_;  // serial: one request at a time
};

}  // namespace quarvel
