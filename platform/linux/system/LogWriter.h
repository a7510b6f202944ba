#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "base/Mutex.h"
#include "platform/linux/system/LogLine.h"

namespace quarvel {

/// Takes lines from any thread and writes them, in that order, on a thread of its own: to the
/// journal when standard error leads there, else to standard error. A bounded queue lies between;
/// who finds it full is held back until there is room. Lives as long as the process.
class LogWriter {
 public:
  [[nodiscard]] static LogWriter& instance();

  void write(LogLine line) QUARVEL_EXCLUDES(mutex_);

  /// Waits until every line taken so far is written, at most `kPatience`: whoever reads standard
  /// error may have stopped. Returns whether they are.
  bool flush() QUARVEL_EXCLUDES(mutex_);

 private:
  static constexpr std::size_t kQueuedBytes = 1024 * 1024;
  static constexpr std::chrono::seconds kPatience{2};

  enum class Way {
    queued,
    direct,  // callers write themselves: the process is ending, or had no thread to give
    none,    // the process is ending and nobody takes what is written
  };

  LogWriter();
  void run();
  void end() QUARVEL_EXCLUDES(mutex_);
  void put(const std::vector<LogLine>& lines) QUARVEL_EXCLUDES(output_);

  const bool toJournal_;

  Mutex output_;  // held while writing
  Mutex mutex_;
  ConditionVariable arrived_;
  ConditionVariable written_;
  Way way_ QUARVEL_GUARDED_BY(mutex_) = Way::queued;
  std::vector<LogLine> queue_ QUARVEL_GUARDED_BY(mutex_);
  // What is queued or being written.
  std::size_t bytes_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::uint64_t linesTaken_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::uint64_t linesWritten_ QUARVEL_GUARDED_BY(mutex_) = 0;
};

}  // namespace quarvel
