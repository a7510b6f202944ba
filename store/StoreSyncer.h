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

/// Waits for the medium, so that the store's writer need not: syncs the write-ahead log and moves
/// it into the database file, one of the two at a time, on a thread and a connection of its own,
/// while the writer goes on committing. Sleeps, without a timer, while it has nothing to do.
///
/// Used by the thread that owns it.
class StoreSyncer {
 public:
  enum class Task : std::uint8_t { sync, checkpoint };
  struct End {
    Task task;
    /// Whether all that was committed when the task began is on the medium now.
    bool isSafe;
    /// A sync has failed: what is written from now on must wait for the log to be written again.
    bool logIsDoubtful;
    /// Of a checkpoint: up to where the log has been moved.
    int movedPages;
  };

  /// Null when there is no descriptor or thread for it, or `path` is not the file that `writer` has
  /// open. `ended` is called on the syncer's thread whenever a task has ended.
  [[nodiscard]] static std::unique_ptr<StoreSyncer> open(const std::filesystem::path& path,
                                                         const SqliteConnection& writer,
                                                         std::function<void()> ended);
  /// Waits for the task under way.
  ~StoreSyncer();
  StoreSyncer(const StoreSyncer&) = delete;
  StoreSyncer& operator=(const StoreSyncer&) = delete;

  /// Only when the end of the task before has been taken.
  void begin(Task task) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::optional<End> takeEnd() QUARVEL_EXCLUDES(mutex_);
  /// Returns when no task is under way.
  void await() QUARVEL_EXCLUDES(mutex_);

 private:
  StoreSyncer(SqliteConnection connection, std::function<void()> ended);
  void run() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] End carryOut(Task task);

  const std::function<void()> ended_;
  SqliteConnection connection_;  // the syncer's thread's

  Mutex mutex_;
  ConditionVariable changed_;
  std::optional<Task> task_ QUARVEL_GUARDED_BY(mutex_);  // to be done, or under way
  std::optional<End> end_ QUARVEL_GUARDED_BY(mutex_);
  bool closing_ QUARVEL_GUARDED_BY(mutex_) = false;

  std::thread thread_;  // the last, so that all else is there for it
};

}  // namespace quarvel
