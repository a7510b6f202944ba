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
#include <utility>
#include <vector>

#include "base/Mutex.h"

namespace quarvel::testing {

inline thread_local bool onThread = false;  // whether this thread is watched

/// Stands between this program, SQLite included, and the C library: counts and records calls, holds
/// them up, makes them fail. Watches calls for files below one directory, and all calls of threads
/// that ask for it. One for the process, never destroyed; any thread.
class Interposer {
 public:
  [[nodiscard]] static Interposer& instance() {
    static Interposer& interposer = *new Interposer;
    return interposer;
  }
  /// Forgets everything and watches files below `directory` that are opened from now on; no files
  /// when it is empty.
  static Interposer& watch(const std::filesystem::path& directory = {});
  /// Watches all calls of the thread on which it lives.
  struct WatchedThread {
    WatchedThread() { onThread = true; }
    ~WatchedThread() { onThread = false; }
    WatchedThread(const WatchedThread&) = delete;
    WatchedThread& operator=(const WatchedThread&) = delete;
  };

  struct Counts {
    int commits = 0;   // transactions written to a write-ahead log
    int logSyncs = 0;  // syncs of a write-ahead log
    int unsynced = 0;  // transactions since the last of them
  };
  [[nodiscard]] Counts counts() { return get(&Data::counts); }
  /// Watched calls, by function.
  [[nodiscard]] std::map<std::string, std::size_t> calls() { return get(&Data::calls); }
  [[nodiscard]] std::size_t failedCalls() { return get(&Data::failedCalls); }

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
  void inject(const Fault& fault) { set(&Data::fault, fault); }
  void lift() { set(&Data::fault, std::nullopt); }

  /// From now on writes to a write-ahead log, or syncs of any file, block until `release`, which
  /// releases all calls that block then.
  void hold(Purpose purpose = Purpose::write) { set(&Data::hold, purpose); }
  void release();
  /// Whether a call blocks.
  [[nodiscard]] bool holdsOne() { return get(&Data::held) > 0; }

  /// A change of files and names, or a sync that makes changes durable.
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
    std::string path{};
    std::string text{};
    off_t offset = 0;
    bool failed = false;    // a sync
    std::size_t begun = 0;  // a sync: the number of changes recorded when it began
  };
  void record() { set(&Data::recording, true); }
  void mark(off_t promise) { changed({.kind = Change::Kind::mark, .offset = promise}); }
  /// Ends the record.
  [[nodiscard]] std::vector<Change> takeRecord() {
    set(&Data::recording, false);
    return get(&Data::record);
  }

 private:
  friend struct StandIns;  // the C library's functions
  struct Data {
    std::string directory{};
    std::size_t releases = 0;
    std::map<int, std::string> open{};  // watched files by descriptor
    Counts counts{};
    std::map<std::string, std::size_t> calls{};
    std::array<std::size_t, 4> callsFor{};  // in the order of `Purpose`
    std::size_t allCalls = 0;
    std::size_t failedCalls = 0;
    std::optional<Fault> fault{};
    bool commitIsNext = false;  // the page of a last frame
    std::optional<Purpose> hold{};
    int held = 0;
    bool recording = false;
    std::vector<Change> record{};
  };

  template <class T>
  T get(T Data::*member) {
    const MutexLock lock(mutex_);
    return data_.*member;
  }
  template <class T>
  void set(T Data::*member, std::type_identity_t<T> value) {
    const MutexLock lock(mutex_);
    data_.*member = std::move(value);
  }
  void changed(Change change);
  void changedLocked(Change change) QUARVEL_REQUIRES(mutex_);
  void passHold(Purpose purpose) QUARVEL_REQUIRES(mutex_);

  Mutex mutex_;
  ConditionVariable released_;
  Data data_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel::testing
