#include "system/LogWriter.h"

#include <fmt/format.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <ctime>
#include <string>
#include <utility>

// The place in the source is a line's own, not that of the call to the journal.
#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

#include "base/Mutex.h"
#include "queues/BlockingScope.h"

namespace quarvel {

namespace {

std::string_view levelName(LogLevel level) {
  switch (level) {
    case LogLevel::error:
      return "error";
    case LogLevel::standard:
      return "default";
    case LogLevel::info:
      return "info";
    case LogLevel::debug:
      break;
  }
  return "debug";
}

/// A second of local time: "2026-01-31T14:25:01" and "+01:00". Without a destructor, since a thread
/// may log after its other thread-locals have gone.
struct LocalSecond {
  std::time_t second = -1;
  char text[32] = "";
  char offset[16] = "";
};

/// One per thread: local time is looked up once a second, not once per line.
const LocalSecond& localSecond(std::time_t second) {
  thread_local LocalSecond local;
  if (local.second == second) return local;
  std::tm time{};
  {
    // The C library locks by itself, but a thread sanitizer cannot see that.
    static Mutex& zone = *new Mutex;
    const MutexLock lock(zone);
    tzset();  // the device may have travelled
    localtime_r(&second, &time);
  }
  local.second = second;
  std::strftime(local.text, sizeof local.text, "%Y-%m-%dT%H:%M:%S", &time);
  const long minutes = std::abs(time.tm_gmtoff) / 60;
  *fmt::format_to_n(local.offset, sizeof local.offset - 1, "{}{:02}:{:02}",
                    time.tm_gmtoff < 0 ? '-' : '+', minutes / 60, minutes % 60)
       .out = '\0';
  return local;
}

void append(fmt::memory_buffer& out, std::string_view text) {
  out.append(text.data(), text.data() + text.size());
}

void appendOnOneLine(fmt::memory_buffer& out, std::string_view message) {
  for (std::size_t end = 0; (end = message.find('\n')) != std::string_view::npos;) {
    append(out, message.substr(0, end));
    append(out, "\\n");
    message.remove_prefix(end + 1);
  }
  append(out, message);
}

/// Blocked callers hear of room each time about this much has been written.
constexpr std::size_t kBytesAtOnce = std::size_t{32} * 1024;

/// Memory that has grown beyond this in a burst is freed after it.
constexpr std::size_t kKeptBytes = std::size_t{64} * 1024;

std::size_t bytesOf(std::size_t lines, std::size_t text) {
  return lines * sizeof(LogLine) + text;
}

/// Whether standard error is the stream that the journal made for this service. Sending to a
/// journal that does not listen succeeds and loses the line, so its socket must be there too.
bool standardErrorIsJournal() {
  const char* const stream = std::getenv("JOURNAL_STREAM");
  struct stat own {};
  if (stream == nullptr || ::fstat(STDERR_FILENO, &own) != 0) return false;
  return fmt::format("{}:{}", own.st_dev, own.st_ino) == stream &&
         ::access("/run/systemd/journal/socket", W_OK) == 0;
}

int priorityOf(LogLevel level) {
  switch (level) {
    case LogLevel::error:
      return 3;
    case LogLevel::standard:
      return 5;
    case LogLevel::info:
      return 6;
    case LogLevel::debug:
      break;
  }
  return 7;
}

bool sendToJournal(const LogLine& line) {
  const std::string fields[] = {
      fmt::format("MESSAGE={}", line.message()),
      fmt::format("PRIORITY={}", priorityOf(line.level)),
      fmt::format("CODE_FILE={}", line.file),
      fmt::format("CODE_LINE={}", line.line),
      fmt::format("CODE_FUNC={}", line.function),
      fmt::format("QUARVEL_SCOPE={}", line.scope),
  };
  iovec parts[std::size(fields)];
  for (std::size_t i = 0; i < std::size(fields); ++i) {
    parts[i] = {const_cast<char*>(fields[i].data()), fields[i].size()};
  }
  return sd_journal_sendv(parts, static_cast<int>(std::size(parts))) == 0;
}

/// Blocks while the reader is slow. Gives up only when standard error has failed.
void writeToStandardError(std::string_view text) {
  while (!text.empty()) {
    const ssize_t count = ::write(STDERR_FILENO, text.data(), text.size());
    if (count >= 0) {
      text.remove_prefix(static_cast<std::size_t>(count));
    } else if (errno == EAGAIN) {
      pollfd writable{STDERR_FILENO, POLLOUT, 0};
      ::poll(&writable, 1, -1);
    } else if (errno != EINTR) {
      return;
    }
  }
}

}  // namespace

LogLine FormatLogLine(fmt::memory_buffer& buffer, Date date, LogLevel level, std::string_view scope,
                      const char* file, int line, const char* function, std::string_view message) {
  const auto second = std::chrono::floor<std::chrono::seconds>(date);
  const LocalSecond& local = localSecond(std::chrono::system_clock::to_time_t(second));
  buffer.clear();
  const auto out = fmt::appender(buffer);
  fmt::format_to(out, "{}.{:06}{} {} {} ", local.text, (date - second).count(), local.offset,
                 levelName(level), scope);
  const std::size_t messageStart = buffer.size();
  fmt::format_to(out, "{}:{}:{}: ", file, line, function);
  appendOnOneLine(buffer, message);
  buffer.push_back('\n');
  return {level, scope, file, line, function, {buffer.data(), buffer.size()}, messageStart};
}

LogWriter::LogWriter()
    : toJournal_(standardErrorIsJournal()),
      isThreaded_(thread_.start("log", 0, [this] { run(); }) == 0) {}

LogWriter::~LogWriter() {
  {
    const MutexLock lock(mutex_);
    ending_ = true;
  }
  arrived_.notifyOne();
  thread_.join();
}

void LogWriter::writeDirectly(const LogLine& line) {
  writeToStandardError(line.text);
}

void LogWriter::Lines::add(const LogLine& line) {
  text += line.text;
  entries.push_back({line, text.size()});
}

void LogWriter::Lines::clear() {
  if (text.capacity() > kKeptBytes) {
    *this = {};
  } else {
    entries.clear();
    text.clear();
  }
}

void LogWriter::write(const LogLine& line) {
  if (!isThreaded_) {
    Lines lines;
    lines.add(line);
    const MutexLock lock(output_);
    put(lines, 0, 1);
    return;
  }
  {
    const MutexLock lock(mutex_);
    if (bytes_ >= kQueuedBytes) {
      const BlockingScope blocking;
      while (bytes_ >= kQueuedBytes) written_.wait(mutex_);
    }
    bytes_ += bytesOf(1, line.text.size());
    ++linesTaken_;
    queue_.add(line);
    if (queue_.entries.size() > 1) return;  // the thread has been woken already
  }
  arrived_.notifyOne();
}

bool LogWriter::flush() {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  const MutexLock lock(mutex_);
  const std::uint64_t last = linesTaken_;
  bool inTime = true;
  while (inTime && linesWritten_ < last) inTime = written_.waitUntil(mutex_, deadline);
  return linesWritten_ >= last;
}

void LogWriter::run() {
  Lines lines;
  for (;;) {
    {
      const MutexLock lock(mutex_);
      while (queue_.entries.empty() && !ending_) arrived_.wait(mutex_);
      if (queue_.entries.empty()) return;
      std::swap(lines, queue_);
    }
    put(lines);
    lines.clear();
  }
}

void LogWriter::put(const Lines& lines) {
  const std::vector<Lines::Entry>& entries = lines.entries;
  std::size_t begin = 0;
  for (std::size_t first = 0; first < entries.size();) {
    std::size_t last = first + 1;
    while (last < entries.size() && entries[last].end - begin <= kBytesAtOnce) ++last;
    {
      const MutexLock lock(output_);
      put(lines, first, last);
    }
    const std::size_t end = entries[last - 1].end;
    {
      const MutexLock lock(mutex_);
      bytes_ -= bytesOf(last - first, end - begin);
      linesWritten_ += last - first;
    }
    written_.notifyAll();
    first = last;
    begin = end;
  }
}

void LogWriter::put(const Lines& lines, std::size_t first, std::size_t last) const {
  const std::string_view text = lines.text;
  std::size_t begin = first == 0 ? 0 : lines.entries[first - 1].end;
  std::string unsent;
  if (!toJournal_)
    return writeToStandardError(text.substr(begin, lines.entries[last - 1].end - begin));
  for (std::size_t i = first; i < last; ++i) {
    LogLine line = lines.entries[i].line;
    line.text = text.substr(begin, lines.entries[i].end - begin);
    if (!sendToJournal(line)) unsent += line.text;
    begin = lines.entries[i].end;
  }
  writeToStandardError(unsent);
}

}  // namespace quarvel
