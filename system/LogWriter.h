#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "base/Mutex.h"
#include "system/LogLine.h"

namespace quarvel {

/// Takes lines from any thread and writes them, in that order, on a thread of its own: to the
/// journal when standard error leads there, else to standard error. A bounded queue lies between;
/// who finds it full is held back until there is room. Lives as long as the process.
class LogWriter {
 public:
  [[nodiscard]] static LogWriter& instance();

  void write(const LogLine& line) QUARVEL_EXCLUDES(mutex_);

  /// Waits until every line taken so far is written, at most `kPatience`: whoever reads standard
  /// error may have stopped. Returns whether they are.
  bool flush() QUARVEL_EXCLUDES(mutex_);

 private:
  static constexpr std::size_t kQueuedBytes = std::size_t{1024} * 1024;
  static constexpr std::chrono::seconds kPatience{2};

  /// Lines with their texts, one after the other.
  struct Lines {
    struct Entry {
      LogLine line;  // without its text
      std::size_t end;
    };
    std::vector<Entry> entries;
    std::string text;

    void add(const LogLine& line);
    void clear();
  };

  enum class Way {
    queued,
    direct,  // callers write themselves: the process is ending, or had no thread to give
    none,    // the process is ending and nobody takes what is written
  };

  LogWriter();
  void run();
  void end() QUARVEL_EXCLUDES(mutex_);
  void put(const Lines& lines) QUARVEL_EXCLUDES(mutex_, output_);
  void put(const Lines& lines, std::size_t first, std::size_t last) const QUARVEL_REQUIRES(output_);

  const bool toJournal_;

  Mutex output_;  // held while writing
  Mutex mutex_;
  ConditionVariable arrived_;
  ConditionVariable written_;
  Way way_ QUARVEL_GUARDED_BY(mutex_) = Way::queued;
  Lines queue_ QUARVEL_GUARDED_BY(mutex_);
  // What is queued or being written.
  std::size_t bytes_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::uint64_t linesTaken_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::uint64_t linesWritten_ QUARVEL_GUARDED_BY(mutex_) = 0;
};

}  // namespace quarvel
