#pragma once

#include <filesystem>
#include <functional>
#include <memory>
#include <string_view>
#include <vector>

#include "base/Mutex.h"

namespace quarvel {

/// Reports files that are written, touched or replaced directly in certain directories. One thread
/// for all directories; it starts with the first one and blocks until the kernel has news. Handlers
/// run on that thread. Outlives its users' registrations; operations from any thread.
class DirectoryWatch {
 public:
  /// Receives the file's name without its directory. An empty name: the kernel dropped events, and
  /// any file may have changed. One change may be reported more than once.
  using Handler = std::function<void(std::string_view file)>;

  /// Takes no descriptor and no thread before the first `add`.
  DirectoryWatch() = default;
  DirectoryWatch(const DirectoryWatch&) = delete;
  DirectoryWatch& operator=(const DirectoryWatch&) = delete;
  /// As `end`.
  ~DirectoryWatch();

  /// Makes `directory` if it is missing and calls `handler` for its files from now on. The handler
  /// may take its owner's locks but must not wait. Returns 0 or the system's error number.
  [[nodiscard]] int add(const std::filesystem::path& directory, Handler handler);

  /// Ends the thread: when this returns, no handler is running or will be called. Not from a
  /// handler; nothing is added any more.
  void end() QUARVEL_EXCLUDES(mutex_);

 private:
  /// One call of `add`. Two of them may name the same directory.
  struct Watched {
    int identifier;  // the kernel's
    std::filesystem::path directory;
    std::shared_ptr<const Handler> handler;
  };

  /// Starts the thread if it has not started. Returns 0 or the system's error number.
  [[nodiscard]] int start() QUARVEL_REQUIRES(mutex_);
  /// The thread. `descriptor` is the kernel's queue of events, closed after the thread has ended.
  void run(int descriptor);
  /// Blocks in read(2) between events.
  void reportUntilEnd(int descriptor);
  /// Calls the handlers of one directory, or of all when `file` is empty. Without the lock.
  void report(int identifier, std::string_view file);
  /// Drops a directory that was removed. Returns whether the thread is to end.
  [[nodiscard]] bool dropDirectory(int identifier);

  Mutex mutex_;                                     // never held while a handler runs
  int descriptor_ QUARVEL_GUARDED_BY(mutex_) = -1;  // -1: not started, or ended
  bool ending_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool running_ QUARVEL_GUARDED_BY(mutex_) = false;  // the thread
  ConditionVariable ended_;                          // it no longer runs
  std::vector<Watched> watched_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
