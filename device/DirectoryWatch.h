#pragma once

#include <filesystem>
#include <functional>
#include <memory>
#include <string_view>
#include <vector>

#include "base/Mutex.h"

namespace quarvel {

/// Tells when files directly in certain directories are written, touched or replaced. One thread
/// for all directories, blocked until the kernel has news, started with the first of them. From any
/// thread.
class DirectoryWatch {
 public:
  /// Is given the file's name without its directory, or an empty name when so much has happened
  /// that news was lost and any file may have changed. One change may be reported more than once.
  using Handler = std::function<void(std::string_view file)>;

  DirectoryWatch() = default;
  DirectoryWatch(const DirectoryWatch&) = delete;
  DirectoryWatch& operator=(const DirectoryWatch&) = delete;
  /// As `end`.
  ~DirectoryWatch();

  /// Makes `directory` if it is missing and calls `handler` on the watch's thread from now on. It
  /// may take the locks of its owner but not wait. Returns 0 or the system's error number.
  [[nodiscard]] int add(const std::filesystem::path& directory, Handler handler);

  /// Ends the thread: when this returns, no handler is running or will be called. Not from a
  /// handler; nothing is added any more.
  void end() QUARVEL_EXCLUDES(mutex_);

 private:
  struct Watched {
    int identifier;  // the kernel's
    std::filesystem::path directory;
    std::shared_ptr<const Handler> handler;
  };

  [[nodiscard]] int start() QUARVEL_REQUIRES(mutex_);
  void run(int descriptor);
  void reportUntilEnd(int descriptor);
  void report(int identifier, std::string_view file);
  /// A directory was removed. Returns whether the watch itself is to end.
  [[nodiscard]] bool forget(int identifier);

  Mutex mutex_;
  int descriptor_ QUARVEL_GUARDED_BY(mutex_) = -1;
  bool ending_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool running_ QUARVEL_GUARDED_BY(mutex_) = false;  // the thread
  ConditionVariable ended_;                          // it no longer runs
  std::vector<Watched> watched_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
