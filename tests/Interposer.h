#pragma once

#include <sys/types.h>

#include <array>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Mutex.h"

namespace quarvel::testing {

/// Stands between this program, SQLite included, and the C library: counts and records calls, holds
/// them up, makes them fail. Watches calls for files below one directory, and all calls of threads
/// that ask for it. One for the process, never destroyed; any thread.
class Interposer {
 public:
  [[nodiscard]] static Interposer& instance();
  /// Forgets everything and watches files below `directory` that are opened from now on; no files
  /// when it is empty.
  static Interposer& watch(const std::filesystem::path& directory = {});
  /// Watches all calls of the thread on which it lives.
  class WatchedThread {
   public:
    WatchedThread();
    ~WatchedThread();
    WatchedThread(const WatchedThread&) = delete;
    WatchedThread& operator=(const WatchedThread&) = delete;
  };

  // Counts.

  struct Counts {
    int commits = 0;   // transactions written to a write-ahead log
    int logSyncs = 0;  // syncs of a write-ahead log
    int unsynced = 0;  // transactions since the last of them
  };
  [[nodiscard]] Counts counts() QUARVEL_EXCLUDES(mutex_);
  /// Watched calls, by function.
  [[nodiscard]] std::map<std::string, std::size_t> calls() QUARVEL_EXCLUDES(mutex_);

  // Faults.

  enum class Purpose : std::uint8_t { open, write, sync, other };
  struct Fault {
    /// The first call that may fail: its number since `watch`, counted from 0, among all calls,
    /// calls for `only` or calls of `function`.
    std::size_t at = 0;
    /// The system's error number; 0: a write, or a send, transfers half of its bytes.
    int error = 0;
    /// Whether all later calls fail too, until `lift`.
    bool forever = false;
    std::optional<Purpose> only{};
    std::string function{};
  };
  static Fault fullDisk() { return {.error = ENOSPC, .forever = true, .only = Purpose::write}; }
  void inject(const Fault& fault) QUARVEL_EXCLUDES(mutex_);
  void lift() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::size_t failedCalls() QUARVEL_EXCLUDES(mutex_);

  /// From now on writes to a write-ahead log, or syncs of any file, block until `release`, which
  /// releases all calls that block then.
  void hold(Purpose purpose = Purpose::write) QUARVEL_EXCLUDES(mutex_);
  void release() QUARVEL_EXCLUDES(mutex_);
  /// Whether a call blocks.
  [[nodiscard]] bool holdsOne() QUARVEL_EXCLUDES(mutex_);

  // The record of changes to files and names, and of the syncs that make them durable.

  struct Change {
    enum class Kind : std::uint8_t {
      create,    // of `path`
      rename,    // of `path` to `text`
      remove,    // of `path`
      write,     // of `text` at `offset`
      truncate,  // to `offset`
      sync,      // of a file's content, or of a directory's names
      mark,      // no change: `offset` tells the promise from here on
    };
    Kind kind;
    std::string path;
    std::string text{};
    off_t offset = 0;
    bool failed = false;    // a sync
    std::size_t begun = 0;  // a sync: the number of changes recorded when it began
  };
  void record() QUARVEL_EXCLUDES(mutex_);
  void mark(off_t promise) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::vector<Change> takeRecord() QUARVEL_EXCLUDES(mutex_);

  // Called by the stand-ins for the C library's functions.

  [[nodiscard]] static bool watchesThread();
  /// The path of a descriptor of a watched file.
  [[nodiscard]] std::optional<std::string> pathOf(int descriptor) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool watches(const char* path) QUARVEL_EXCLUDES(mutex_);
  /// Counts a call. Returns the error number with which it has to fail, -1 for half a transfer, or
  /// 0.
  [[nodiscard]] int admit(const char* function, Purpose purpose) QUARVEL_EXCLUDES(mutex_);
  /// Blocks while writes to a log are held.
  void passWrite(std::string_view path) QUARVEL_EXCLUDES(mutex_);
  void opened(int descriptor, const char* path, bool created) QUARVEL_EXCLUDES(mutex_);
  void closed(int descriptor) QUARVEL_EXCLUDES(mutex_);
  void changed(Change change) QUARVEL_EXCLUDES(mutex_);
  /// A sync covers the changes and commits from before its beginning.
  struct Sync {
    std::size_t changes;
    int commits;
  };
  /// Blocks while syncs are held.
  [[nodiscard]] Sync syncBegins() QUARVEL_EXCLUDES(mutex_);
  void synced(const std::string& path, const Sync& begun, bool failed) QUARVEL_EXCLUDES(mutex_);

 private:
  void reset(const std::filesystem::path& directory) QUARVEL_EXCLUDES(mutex_);
  void releaseHeld() QUARVEL_REQUIRES(mutex_);
  void passHold(Purpose purpose) QUARVEL_REQUIRES(mutex_);

  Mutex mutex_;
  ConditionVariable released_;
  std::string directory_ QUARVEL_GUARDED_BY(mutex_);
  std::map<int, std::string> open_ QUARVEL_GUARDED_BY(mutex_);
  Counts counts_ QUARVEL_GUARDED_BY(mutex_);
  std::map<std::string, std::size_t> calls_ QUARVEL_GUARDED_BY(mutex_);
  std::array<std::size_t, 4> callsFor_ QUARVEL_GUARDED_BY(mutex_){};  // in the order of `Purpose`
  std::size_t allCalls_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t failedCalls_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::optional<Fault> fault_ QUARVEL_GUARDED_BY(mutex_);
  bool commitIsNext_ QUARVEL_GUARDED_BY(mutex_) = false;  // the page of a last frame
  std::optional<Purpose> hold_ QUARVEL_GUARDED_BY(mutex_);
  int held_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t releases_ QUARVEL_GUARDED_BY(mutex_) = 0;
  bool recording_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::vector<Change> record_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel::testing
