#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "base/Mutex.h"
#include "platform/Log.h"
#include "system/LogWriter.h"

namespace quarvel {

/// A registered scope. Owned by `LogScopes`, never destroyed. Constant after construction, except
/// for the switch, which any thread may set and read.
class LogScope {
 public:
  /// `domain` and `key` must live as long as the process.
  LogScope(std::string fullName, std::string_view domain, std::string_view key, int mask)
      : name(std::move(fullName)), subsystem(domain), verboseKey(key), levelMask(mask) {}

  const std::string name;             // "subsystem[name]", as lines show it
  const std::string_view subsystem;   // the preferences domain
  const std::string_view verboseKey;  // the preference that switches verbose lines on
  /// Bit n: lines of level n may be written at all.
  const int levelMask;

  [[nodiscard]] bool isVerbose() const { return verbose_.load(std::memory_order_relaxed); }
  /// Off until this is called.
  void setVerbose(bool verbose) const { verbose_.store(verbose, std::memory_order_relaxed); }

 private:
  mutable std::atomic<bool> verbose_{false};
};

/// The scopes of the process. They outlive every service of the process, since the places that log
/// keep their handles in static variables. Any thread.
class LogScopes {
 public:
  using Follower = std::function<void(LogHandle)>;

  /// The one set of the process, made on first use.
  [[nodiscard]] static LogScopes& process();

  /// Registers a scope under its four-character `code`. A code that is registered already keeps its
  /// first scope, which is returned. Never null.
  [[nodiscard]] LogHandle add(std::uint32_t code, std::string_view scope,
                              std::string_view subsystem, std::string_view verboseKey,
                              int levelMask) QUARVEL_EXCLUDES(mutex_);

  /// Calls `follower` for every scope: for the registered ones now, on the calling thread; for each
  /// later one on the thread that registers it, before `add` returns there. There is one follower;
  /// an empty one ends that.
  void follow(const Follower& follower) QUARVEL_EXCLUDES(mutex_);

 private:
  Mutex mutex_;
  std::map<std::uint32_t, std::unique_ptr<const LogScope>> byCode_ QUARVEL_GUARDED_BY(mutex_);
  Follower follower_ QUARVEL_GUARDED_BY(mutex_);
};

/// The log of a service, its owner: decides which lines are written and writes them. Any thread;
/// a line that is being written may still be judged by the level before.
class Log {
 public:
  /// `standard` until `setLevel`.
  static constexpr LogLevel kFirstLevel = LogLevel::standard;

  /// The least urgent level that is written. Verbose lines follow their scope's switch instead; the
  /// verbose lines of the default log, which has none, are written at `debug`.
  void setLevel(LogLevel level) { level_.store(level, std::memory_order_relaxed); }
  /// The level set last.
  [[nodiscard]] LogLevel level() const { return level_.load(std::memory_order_relaxed); }

  /// As `ZQLogEnabled`, with `level` as the least urgent level that is written.
  [[nodiscard]] static bool isEnabled(LogLevel line, LogHandle scope, LogLevel level);

  /// Formats a line on the calling thread and queues it. `scope` is null for the default log;
  /// `file` and `function` live as long as the process. May block as `LogWriter::write` does.
  void write(LogHandle scope, LogLevel level, const char* file, int line, const char* function,
             std::string_view message);
  /// As `write`, straight to standard error: for a process that has no log.
  static void writeDirectly(LogHandle scope, LogLevel level, const char* file, int line,
                            const char* function, std::string_view message);

  /// As `LogWriter::flush`.
  bool flush() { return writer_.flush(); }

 private:
  std::atomic<LogLevel> level_{kFirstLevel};
  LogWriter writer_;  // ends first, with all lines written
};

}  // namespace quarvel
