#pragma once

#include <chrono>
#include <filesystem>
#include <memory>
#include <string>
#include <thread>

#include "base/Mutex.h"
#include "export/ExportEngine.h"
#include "export/ExportSource.h"
#include "export/Exporter.h"
#include "store/TelemetryStore.h"

namespace quarvel {

/// An exporter on a thread of its own, so that an engine that is down delays no other. Sleeps while
/// there is nothing to send. Owned by `Exporters` and lives as long. All operations from any
/// thread.
class ExportThread {
 public:
  /// `store` must outlive this. Nothing runs before `start`.
  ExportThread(Exporter::Options options, std::unique_ptr<ExportEngine> engine,
               TelemetryStore& store);
  /// Stops, and waits for the thread without a time limit.
  ~ExportThread();
  ExportThread(const ExportThread&) = delete;
  ExportThread& operator=(const ExportThread&) = delete;

  /// Starts the thread; called once, at most.
  void start();
  /// Tells how far the store is durable now. Takes the lock only; called by the store's writer.
  void extend(const DurableExtent& extent) QUARVEL_EXCLUDES(mutex_);

  /// Sends nothing until `release`. Abandons a batch in flight; when this returns, the thread holds
  /// no row. May be called several times, each with its `release`.
  void hold() QUARVEL_EXCLUDES(mutex_);
  /// Ends one `hold`; the last one lets the thread go on, with a new connection.
  void release() QUARVEL_EXCLUDES(mutex_);

  /// Abandons a batch in flight and ends the thread. `awaitEnd`, for one caller only, waits for the
  /// end and returns false after `deadline`.
  void stop() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool awaitEnd(std::chrono::steady_clock::time_point deadline)
      QUARVEL_EXCLUDES(mutex_);

  /// A copy of the exporter's state, with the thread's wake-ups.
  [[nodiscard]] ExportStatus status() const QUARVEL_EXCLUDES(mutex_);

 private:
  /// The thread: steps of the exporter, with waits in between.
  void run() QUARVEL_EXCLUDES(mutex_);
  /// Waits until the next step is due; false when the thread is to end.
  [[nodiscard]] bool awaitWork(const Exporter::Next& next) QUARVEL_REQUIRES(mutex_);
  /// Waits while held, without a connection.
  void park() QUARVEL_REQUIRES(mutex_);
  /// Interrupts the engine and the source.
  void stopWork() QUARVEL_REQUIRES(mutex_);

  const std::string backend_;
  const std::unique_ptr<ExportEngine> engine_;
  ExportSource source_;
  Exporter exporter_;

  mutable Mutex mutex_;
  ConditionVariable changed_;  // any of the members below
  // The durable part of the store, as `extend` said last.
  DurableExtent extent_ QUARVEL_GUARDED_BY(mutex_);
  bool extended_ QUARVEL_GUARDED_BY(mutex_) = false;  // since the last step
  int holds_ QUARVEL_GUARDED_BY(mutex_) = 0;          // without a release so far
  bool parked_ QUARVEL_GUARDED_BY(mutex_) = true;     // the thread holds no row
  bool stopping_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool ended_ QUARVEL_GUARDED_BY(mutex_) = true;  // the thread; also before `start`
  std::uint64_t wakeUps_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::thread thread_;  // constant after `start`
};

}  // namespace quarvel
