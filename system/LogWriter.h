#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "base/Mutex.h"
#include "queues/Thread.h"
#include "system/LogLine.h"

namespace quarvel {

/// Writes lines, in the order in which they came, on a thread of its own: to the journal when
/// standard error leads there, else to standard error. A queue of 1 MiB lies between; a caller that
/// finds it full blocks until there is room (`BlockingScope`). Without a thread, because the system
/// had none to give, callers write themselves. Owned by `Log`. Any thread.
class LogWriter {
 public:
  LogWriter();
  LogWriter(const LogWriter&) = delete;
  LogWriter& operator=(const LogWriter&) = delete;
  /// Writes the lines taken so far, however long the reader of standard error takes, and ends the
  /// thread.
  ~LogWriter();

  void write(const LogLine& line) QUARVEL_EXCLUDES(mutex_, output_);
  /// Writes a line to standard error on the calling thread, past any writer.
  static void writeDirectly(const LogLine& line);

  /// Waits until every line taken so far is written, for 2 s at most: the reader of standard error
  /// may have stopped. Returns whether they are.
  bool flush() QUARVEL_EXCLUDES(mutex_);

 private:
  static constexpr std::size_t kQueuedBytes = std::size_t{1024} * 1024;
  static constexpr std::chrono::seconds kPatience{2};

  /// Lines and their texts, one after the other.
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

  void run() QUARVEL_EXCLUDES(mutex_, output_);
  void put(const Lines& lines) QUARVEL_EXCLUDES(mutex_, output_);
  void put(const Lines& lines, std::size_t first, std::size_t last) const QUARVEL_REQUIRES(output_);

  const bool toJournal_;

  Mutex output_;  // held while writing
  Mutex mutex_;
  ConditionVariable arrived_;
  ConditionVariable written_;
  Lines queue_ QUARVEL_GUARDED_BY(mutex_);
  bool ending_ QUARVEL_GUARDED_BY(mutex_) = false;
  // Lines that are queued or being written.
  std::size_t bytes_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::uint64_t linesTaken_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::uint64_t linesWritten_ QUARVEL_GUARDED_BY(mutex_) = 0;

  JoinedThread thread_;  // uses all of the above
  const bool isThreaded_;
};

}  // namespace quarvel
