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

/// Stands between this program, SQLite included, and the C library for what is done to the files
/// below one directory: counts and records calls, holds them up, makes them fail. One for the
/// process.
class FileCalls {
 public:
  /// Forgets everything and looks at the files below `directory` from now on, those that are open
  /// not included; at none when it is empty.
  static FileCalls& watch(const std::filesystem::path& directory);

  // Counts.

  struct Counts {
    int commits = 0;   // transactions written to a write-ahead log
    int logSyncs = 0;  // syncs of a write-ahead log
    int unsynced = 0;  // transactions since the last of them
  };
  [[nodiscard]] Counts counts() QUARVEL_EXCLUDES(mutex_);

  enum class Purpose : std::uint8_t { open, write, sync, other };

  // Switches.

  /// From now on writes to a write-ahead log wait, or syncs of any file, until released: those that
  /// wait then, though the next ones may be held at once.
  void hold(Purpose purpose = Purpose::write) QUARVEL_EXCLUDES(mutex_);
  void release() QUARVEL_EXCLUDES(mutex_);
  /// Whether one waits.
  [[nodiscard]] bool holdsOne() QUARVEL_EXCLUDES(mutex_);

  // Faults.

  struct Fault {
    /// Which call fails: its number among all since `watch`, or among those that serve `only`,
    /// counted from 0; one that has been made already means the next.
    std::size_t at = 0;
    /// The system's error number; 0: a write writes half of what it was given.
    int error = 0;
    /// Whether every such call after it fails too, until `lift`.
    bool forever = false;
    std::optional<Purpose> only{};
  };
  static constexpr Fault fullDisk() {
    return {.error = ENOSPC, .forever = true, .only = Purpose::write};
  }
  void inject(const Fault& fault) QUARVEL_EXCLUDES(mutex_);
  void lift() QUARVEL_EXCLUDES(mutex_);
  /// How many calls were made to fail.
  [[nodiscard]] std::size_t failedCalls() QUARVEL_EXCLUDES(mutex_);

  // The record of what changes files and names, and what makes that safe.

  struct Change {
    enum class Kind : std::uint8_t {
      create,    // of `path`
      rename,    // of `path` to `text`
      remove,    // of `path`
      write,     // of `text` at `offset`
      truncate,  // to `offset`
      sync,      // of a file's content, or of a directory's names
      mark,      // not a change: `offset` says what is promised from here on
    };
    Kind kind;
    std::string path;
    std::string text{};
    off_t offset = 0;
    bool failed = false;    // a sync
    std::size_t begun = 0;  // a sync: how many changes had been recorded when it began
  };
  void record() QUARVEL_EXCLUDES(mutex_);
  void mark(off_t promise) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::vector<Change> takeRecord() QUARVEL_EXCLUDES(mutex_);

  // From the C library's functions.

  [[nodiscard]] static FileCalls& instance();
  /// What a file descriptor stands for, when it is one of those looked at.
  [[nodiscard]] std::optional<std::string> pathOf(int descriptor) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool watches(const char* path) QUARVEL_EXCLUDES(mutex_);
  /// Counts a call; returns the error number with which it has to fail, -1 for half a write, or 0.
  [[nodiscard]] int admit(Purpose purpose) QUARVEL_EXCLUDES(mutex_);
  /// As `admit`, for a write; waits while writes are held.
  [[nodiscard]] int admitWrite(std::string_view path) QUARVEL_EXCLUDES(mutex_);
  void opened(int descriptor, const char* path, bool created) QUARVEL_EXCLUDES(mutex_);
  void closed(int descriptor) QUARVEL_EXCLUDES(mutex_);
  void changed(Change change) QUARVEL_EXCLUDES(mutex_);
  /// What comes to pass while a sync is under way is not covered by it.
  struct Sync {
    std::size_t changes;
    int commits;
  };
  /// Waits while syncs are held.
  [[nodiscard]] Sync syncBegins() QUARVEL_EXCLUDES(mutex_);
  void synced(const std::string& path, const Sync& begun, bool failed) QUARVEL_EXCLUDES(mutex_);

 private:
  void reset(const std::filesystem::path& directory) QUARVEL_EXCLUDES(mutex_);
  void letGo() QUARVEL_REQUIRES(mutex_);
  void passHold(Purpose purpose) QUARVEL_REQUIRES(mutex_);
  [[nodiscard]] int admitLocked(Purpose purpose) QUARVEL_REQUIRES(mutex_);

  Mutex mutex_;
  ConditionVariable released_;
  std::string directory_ QUARVEL_GUARDED_BY(mutex_);
  std::map<int, std::string> open_ QUARVEL_GUARDED_BY(mutex_);
  Counts counts_ QUARVEL_GUARDED_BY(mutex_);
  bool commits_ QUARVEL_GUARDED_BY(mutex_) =
      false;  // the page of a transaction's last frame is next
  std::optional<Purpose> hold_ QUARVEL_GUARDED_BY(mutex_);
  int held_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t releases_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::optional<Fault> fault_ QUARVEL_GUARDED_BY(mutex_);
  std::array<std::size_t, 4> calls_ QUARVEL_GUARDED_BY(mutex_){};  // in the order of `Purpose`
  std::size_t failedCalls_ QUARVEL_GUARDED_BY(mutex_) = 0;
  bool recording_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::vector<Change> record_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel::testing
