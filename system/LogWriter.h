#pragma once

#include <fmt/format.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "base/Date.h"
#include "base/Mutex.h"
#include "platform/Log.h"
#include "queues/Thread.h"

namespace quarvel {

/// One formatted line of the log, and the parts that the journal keeps as fields of their own. A
/// view: `scope`, `file` and `function` live as long as the process, the text is its maker's.
struct LogLine {
  LogLevel level;
  std::string_view scope;  // "subsystem[name]"
  const char* file;        // without its folder
  int line;
  const char* function;  // its full keyword name
  /// The line on standard error, with its end: date, level, scope, then the message.
  std::string_view text;
  /// The place in `text` where "file:line:function: " and the logged text begin.
  std::size_t messageStart;

  /// The text from `messageStart` on, without the line's end: the journal's MESSAGE.
  [[nodiscard]] std::string_view message() const {
    return text.substr(messageStart, text.size() - messageStart - 1);
  }
};

/// Formats a line into `buffer`, which must outlive the result. `date` is shown in local time with
/// its offset. Newlines in `message` become "\n", so that a line stays a line.
[[nodiscard]] LogLine FormatLogLine(fmt::memory_buffer& buffer, Date date, LogLevel level,
                                    std::string_view scope, const char* file, int line,
                                    const char* function, std::string_view message);

/// Writes lines, in the order in which they came, on a thread of its own: to the journal when
/// standard error leads there, else to standard error. A queue of 1 MiB lies between; a caller that
/// finds it full blocks until there is room (`BlockingScope`). Without a thread, because the system
/// had none to give, callers write themselves. Owned by `Log`. Any thread.
class LogWriter {
 public:
  /// Starts the thread. Looks at `$JOURNAL_STREAM` once.
  LogWriter();
  LogWriter(const LogWriter&) = delete;
  LogWriter& operator=(const LogWriter&) = delete;
  /// Writes the lines taken so far, however long the reader of standard error takes, and ends the
  /// thread.
  ~LogWriter();

  /// Queues a copy of the line. Blocks while the queue is full.
  void write(const LogLine& line) QUARVEL_EXCLUDES(mutex_, output_);
  /// Writes a line to standard error on the calling thread, past any writer.
  static void writeDirectly(const LogLine& line);

  /// Waits until every line taken so far is written, for 2 s at most: the reader of standard error
  /// may have stopped. Returns whether they are.
  bool flush() QUARVEL_EXCLUDES(mutex_);

 private:
  /// Memory of queued lines above which callers block.
  static constexpr std::size_t kQueuedBytes = std::size_t{1024} * 1024;
  /// Time limit of `flush`: the end of the process may take 5 s in all.
  static constexpr std::chrono::seconds kPatience{2};

  /// Lines and their texts, one after the other.
  struct Lines {
    struct Entry {
      LogLine line;     // without its text
      std::size_t end;  // of its text in `text`
    };
    std::vector<Entry> entries;
    std::string text;

    void add(const LogLine& line);
    void clear();  // frees the memory of a burst
  };

  /// The thread.
  void run() QUARVEL_EXCLUDES(mutex_, output_);
  /// Writes lines in portions and lets blocked callers go on after each.
  void put(const Lines& lines) QUARVEL_EXCLUDES(mutex_, output_);
  void put(const Lines& lines, std::size_t first, std::size_t last) const QUARVEL_REQUIRES(output_);

  const bool toJournal_;  // standard error is the journal's stream

  Mutex output_;  // held while writing
  Mutex mutex_;
  ConditionVariable arrived_;  // a line was queued, or the end begins
  ConditionVariable written_;  // lines were written: there is room
  Lines queue_ QUARVEL_GUARDED_BY(mutex_);
  bool ending_ QUARVEL_GUARDED_BY(mutex_) = false;
  // Lines that are queued or being written.
  std::size_t bytes_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::uint64_t linesTaken_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::uint64_t linesWritten_ QUARVEL_GUARDED_BY(mutex_) = 0;

  JoinedThread thread_;    // uses all of the above
  const bool isThreaded_;  // false: callers write themselves
};

}  // namespace quarvel
