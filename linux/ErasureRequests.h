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
  void answerAll();
  void answer(const std::filesystem::path& request);
  [[nodiscard]] Result<std::int64_t> erase(const ErasureSelection& selection);

  const std::filesystem::path directory_;
  TelemetryStore& store_;
  Exporters& exporters_;
  const std::unique_ptr<WorkQueue> queue_;
};

}  // namespace quarvel
