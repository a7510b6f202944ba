#pragma once

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "base/Mutex.h"
#include "export/ExportThread.h"
#include "store/TelemetryStore.h"

namespace quarvel {

/// The exporters of one store, each with a thread. Owned by the service; must end before the store.
/// All operations from any thread.
class Exporters {
 public:
  /// One exporter to start: its options, and its engine, which the exporter then owns.
  struct Backend {
    Exporter::Options options;
    std::unique_ptr<ExportEngine> engine;
  };
  /// `store` must outlive this. The exporters begin at once, but send nothing unless `exports`.
  Exporters(TelemetryStore& store, std::vector<Backend> backends, bool exports);
  /// Waits for the threads without a time limit.
  ~Exporters();
  Exporters(const Exporters&) = delete;
  Exporters& operator=(const Exporters&) = delete;

  /// Sets whether rows may leave the device (consent). When this returns after a withdrawal, no row
  /// is in flight.
  void setExports(bool exports) QUARVEL_EXCLUDES(mutex_);

  /// While one lives, nothing is sent and no exporter holds a row. The constructor waits for
  /// deliveries in flight to be abandoned.
  class Hold {
   public:
    explicit Hold(Exporters& exporters);  // which outlives this
    ~Hold();
    Hold(const Hold&) = delete;
    Hold& operator=(const Hold&) = delete;

   private:
    Exporters& exporters_;
  };

  /// Abandons batches in flight and ends the threads; waits for them until `deadline`.
  void stop(std::chrono::steady_clock::time_point deadline);

  /// One for each backend, in the order of the constructor's list.
  [[nodiscard]] const std::vector<std::unique_ptr<ExportThread>>& threads() const {
    return threads_;
  }

 private:
  void hold();     // all threads, one after the other
  void release();  // likewise

  TelemetryStore& store_;
  std::vector<std::unique_ptr<ExportThread>> threads_;  // constant after construction
  Mutex mutex_;  // held while the threads are held or released
  bool exports_ QUARVEL_GUARDED_BY(mutex_) = true;
};

}  // namespace quarvel
