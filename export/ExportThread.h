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

/// An exporter on a thread of its own, so that an engine that is down delays nobody else. Sleeps
/// while there is nothing to send. All operations from any thread.
class ExportThread {
 public:
  /// `store` must outlive this. Nothing runs before `start`.
  ExportThread(Exporter::Options options, std::unique_ptr<ExportEngine> engine,
               TelemetryStore& store);
  /// Waits for the thread as long as it takes.
  ~ExportThread();
  ExportThread(const ExportThread&) = delete;
  ExportThread& operator=(const ExportThread&) = delete;

  void start();
  /// The store is safe this far now. Brief.
  void extend(const DurableExtent& extent) QUARVEL_EXCLUDES(mutex_);

  /// Nothing is sent from now on until `release`: a batch under way is abandoned, and when this
  /// returns no row is in the thread's hands. May be called several times, each with its `release`.
  void hold() QUARVEL_EXCLUDES(mutex_);
  void release() QUARVEL_EXCLUDES(mutex_);

  /// Abandons a batch under way and ends. `awaitEnd`, which is for one thread, returns false when
  /// it took longer.
  void stop() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool awaitEnd(std::chrono::steady_clock::time_point deadline)
      QUARVEL_EXCLUDES(mutex_);

  [[nodiscard]] ExportStatus status() const QUARVEL_EXCLUDES(mutex_);

 private:
  void run() QUARVEL_EXCLUDES(mutex_);
  /// Returns once there is something to do; false at the end.
  [[nodiscard]] bool awaitWork(const Exporter::Next& next) QUARVEL_REQUIRES(mutex_);
  void park() QUARVEL_REQUIRES(mutex_);
  void stopWork() QUARVEL_REQUIRES(mutex_);

  const std::string backend_;
  const std::unique_ptr<ExportEngine> engine_;
  ExportSource source_;
  Exporter exporter_;

  mutable Mutex mutex_;
  ConditionVariable changed_;
  DurableExtent extent_ QUARVEL_GUARDED_BY(mutex_);
  bool extended_ QUARVEL_GUARDED_BY(mutex_) = false;  // since the exporter last looked
  int holds_ QUARVEL_GUARDED_BY(mutex_) = 0;
  bool parked_ QUARVEL_GUARDED_BY(mutex_) = true;
  bool stopping_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool ended_ QUARVEL_GUARDED_BY(mutex_) = true;
  std::uint64_t wakeUps_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::thread thread_;  // set by `start`
};

}  // namespace quarvel
