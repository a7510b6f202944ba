#pragma once

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <thread>

#include "base/Mutex.h"
#include "store/database/Sqlite.h"

namespace quarvel {

/// Syncs the write-ahead log and moves it into the database file, one task at a time, on a thread
/// and a connection of its own, so that the store's writer goes on committing. Sleeps without a
/// timer while it has no task.
///
/// Owned by the `StoreDatabase`, and used by its thread alone. Lives from the first task until the
/// file is closed or a sync fails.
class StoreSyncer {
 public:
  /// `sync`: syncs the log. `checkpoint`: syncs it and moves it into the database file.
  enum class Task : std::uint8_t { sync, checkpoint };
  struct TaskResult {
    Task task;
    /// Everything committed before the task began is durable.
    bool durable;
    /// A sync has failed: the log must be rewritten before anything else is written.
    bool logSyncFailed;
    /// After a checkpoint: the number of pages of the log that have been moved.
    int movedPages;
  };

  /// `done` is called on the syncer's thread after each task. Null when there is no descriptor or
  /// thread left, or `path` is not the file that `writer` has open.
  [[nodiscard]] static std::unique_ptr<StoreSyncer> open(const std::filesystem::path& path,
                                                         const SqliteConnection& writer,
                                                         std::function<void()> done);
  /// Waits for the task in flight.
  ~StoreSyncer();
  StoreSyncer(const StoreSyncer&) = delete;
  StoreSyncer& operator=(const StoreSyncer&) = delete;

  /// Only after the result of the task before has been taken.
  void begin(Task task) QUARVEL_EXCLUDES(mutex_);
  /// The result of a task that has ended; none while it runs, and once it was taken.
  [[nodiscard]] std::optional<TaskResult> takeResult() QUARVEL_EXCLUDES(mutex_);
  /// Returns when no task is in flight.
  void wait() QUARVEL_EXCLUDES(mutex_);

 private:
  StoreSyncer(SqliteConnection connection, std::function<void()> done);
  /// The thread: waits for tasks until the destructor.
  void run() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] TaskResult runTask(Task task);

  const std::function<void()> done_;
  SqliteConnection connection_;  // the syncer's thread's

  Mutex mutex_;
  ConditionVariable changed_;
  std::optional<Task> task_ QUARVEL_GUARDED_BY(mutex_);  // to do, or in flight
  std::optional<TaskResult> result_ QUARVEL_GUARDED_BY(mutex_);
  bool closing_ QUARVEL_GUARDED_BY(mutex_) = false;

  std::thread thread_;  // last: it uses all other members
};

}  // namespace quarvel
