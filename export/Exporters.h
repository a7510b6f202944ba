#pragma once

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "base/Mutex.h"
#include "export/ExportThread.h"
#include "store/TelemetryStore.h"

namespace quarvel {

/// The exporters of one store, a thread each. All operations from any thread.
class Exporters {
 public:
  struct Backend {
    Exporter::Options options;
    std::unique_ptr<ExportEngine> engine;
  };
  /// `store` must outlive this. They begin at once when `exports`.
  Exporters(TelemetryStore& store, std::vector<Backend> backends, bool exports);
  /// Waits for the threads as long as they take.
  ~Exporters();
  Exporters(const Exporters&) = delete;
  Exporters& operator=(const Exporters&) = delete;

  /// Whether anything may leave the device. Once this has returned from taking that back, nothing
  /// is under way any more.
  void setExports(bool exports) QUARVEL_EXCLUDES(mutex_);

  /// While one lives, nothing is sent and no row is in anybody's hands.
  class Hold {
   public:
    explicit Hold(Exporters& exporters);
    ~Hold();
    Hold(const Hold&) = delete;
    Hold& operator=(const Hold&) = delete;

   private:
    Exporters& exporters_;
  };

  /// Abandons what is under way; waits for the threads until `deadline`.
  void stop(std::chrono::steady_clock::time_point deadline);

  [[nodiscard]] const std::vector<std::unique_ptr<ExportThread>>& threads() const {
    return threads_;
  }

 private:
  void hold();
  void release();

  TelemetryStore& store_;
  std::vector<std::unique_ptr<ExportThread>> threads_;  // constant after construction
  Mutex mutex_;                                         // held while threads come to a halt
  bool exports_ QUARVEL_GUARDED_BY(mutex_) = true;
};

}  // namespace quarvel
