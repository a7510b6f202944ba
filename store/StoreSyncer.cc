#include "store/StoreSyncer.h"

#include <pthread.h>

#include <system_error>
#include <utility>

namespace quarvel {

std::unique_ptr<StoreSyncer> StoreSyncer::open(const std::filesystem::path& path,
                                               const SqliteConnection& writer,
                                               std::function<void()> done) {
  SqliteConnection connection;
  if (!connection.open(path) || !connection.isSameFileAs(writer)) return nullptr;
  // Only reading opens the log.
  if (!connection.integer("PRAGMA user_version")) return nullptr;
  try {
    return std::unique_ptr<StoreSyncer>(new StoreSyncer(std::move(connection), std::move(done)));
  } catch (const std::system_error&) {
    return nullptr;
  }
}

StoreSyncer::StoreSyncer(SqliteConnection connection, std::function<void()> done)
    : done_(std::move(done)), connection_(std::move(connection)), thread_([this] { run(); }) {}

StoreSyncer::~StoreSyncer() {
  {
    MutexLock lock(mutex_);
    closing_ = true;
  }
  changed_.notifyAll();
  thread_.join();
}

void StoreSyncer::begin(Task task) {
  {
    MutexLock lock(mutex_);
    task_ = task;
  }
  changed_.notifyAll();
}

std::optional<StoreSyncer::TaskResult> StoreSyncer::takeResult() {
  MutexLock lock(mutex_);
  return std::exchange(result_, std::nullopt);
}

void StoreSyncer::wait() {
  MutexLock lock(mutex_);
  while (task_) changed_.wait(mutex_);
}

void StoreSyncer::run() {
  pthread_setname_np(pthread_self(), "quarvel.sync");
  for (;;) {
    Task task{};
    {
      MutexLock lock(mutex_);
      while (!task_ && !closing_) changed_.wait(mutex_);
      if (!task_) return;
      task = *task_;
    }
    const TaskResult result = runTask(task);
    {
      MutexLock lock(mutex_);
      task_.reset();
      result_ = result;
    }
    changed_.notifyAll();
    done_();
  }
}

StoreSyncer::TaskResult StoreSyncer::runTask(Task task) {
  if (task == Task::sync) {
    const bool synced = connection_.syncLog();
    return {task, synced, !synced, 0};
  }
  const SqliteConnection::Checkpoint moved = connection_.checkpoint();
  const bool failed = connection_.logSyncFailed();
  return {task, moved.complete, failed, moved.pages};
}

}  // namespace quarvel
