#include "platform/linux/system/LogWriter.h"

#include <errno.h>
#include <fmt/format.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <utility>

// The place in the source is a line's own, not that of the call to the journal.
#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

#include "platform/linux/work/BlockingScope.h"
#include "platform/linux/work/Thread.h"

namespace quarvel {
namespace {

std::size_t bytesOf(const LogLine& line) {
  return sizeof line + line.text.size();
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

/// Waits for a reader where it must. Gives up only when standard error takes nothing any more.
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

LogWriter& LogWriter::instance() {
  // Never destroyed: other threads may log until the very end.
  static LogWriter& writer = *new LogWriter;
  return writer;
}

LogWriter::LogWriter() : toJournal_(standardErrorIsJournal()) {
  if (StartThread("log", 0, [this] { run(); }) != 0) {
    const MutexLock lock(mutex_);
    way_ = Way::direct;
  }
  std::atexit([] { instance().end(); });
}

void LogWriter::write(LogLine line) {
  Way way = Way::queued;
  {
    const MutexLock lock(mutex_);
    if (way_ == Way::queued && bytes_ >= kQueuedBytes) {
      const BlockingScope blocking;
      while (way_ == Way::queued && bytes_ >= kQueuedBytes) written_.wait(mutex_);
    }
    way = way_;
    if (way == Way::queued) {
      bytes_ += bytesOf(line);
      ++linesTaken_;
      queue_.push_back(std::move(line));
      if (queue_.size() > 1) return;  // the writer has been called already
    }
  }
  if (way == Way::queued) {
    arrived_.notifyOne();
  } else if (way == Way::direct) {
    std::vector<LogLine> lines;
    lines.push_back(std::move(line));
    put(lines);
  }
}

bool LogWriter::flush() {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  const MutexLock lock(mutex_);
  const std::uint64_t last = linesTaken_;
  bool inTime = true;
  while (inTime && linesWritten_ < last) inTime = written_.waitUntil(mutex_, deadline);
  return linesWritten_ >= last;
}

void LogWriter::end() {
  const bool flushed = flush();
  {
    const MutexLock lock(mutex_);
    way_ = flushed ? Way::direct : Way::none;
  }
  written_.notifyAll();
}

void LogWriter::run() {
  std::vector<LogLine> lines;
  mutex_.lock();
  for (;;) {
    while (queue_.empty()) arrived_.wait(mutex_);
    std::swap(lines, queue_);
    mutex_.unlock();
    put(lines);
    std::size_t bytes = 0;
    for (const LogLine& line : lines) bytes += bytesOf(line);
    const std::size_t count = lines.size();
    lines.clear();
    mutex_.lock();
    bytes_ -= bytes;
    linesWritten_ += count;
    written_.notifyAll();
  }
}

void LogWriter::put(const std::vector<LogLine>& lines) {
  const MutexLock lock(output_);
  std::string text;
  for (const LogLine& line : lines) {
    if (!toJournal_ || !sendToJournal(line)) text += line.text;
  }
  writeToStandardError(text);
}

}  // namespace quarvel
