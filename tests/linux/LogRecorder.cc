#include "tests/linux/LogRecorder.h"

#include <chrono>
#include <utility>

#include "base/Mutex.h"

namespace quarvel {

namespace {

Mutex linesMutex;
ConditionVariable lineAdded;
std::vector<testing::LogRecorder::Line> lines QUARVEL_GUARDED_BY(linesMutex);

}  // namespace

bool ZQLogEnabled(LogLevel, LogHandle) {
  return true;
}

void ZQLogWrite(LogHandle, LogLevel level, const char*, int, const char*,
                std::string_view message) {
  MutexLock lock(linesMutex);
  lines.push_back({level, std::string(message)});
  lineAdded.notifyAll();
}

std::vector<testing::LogRecorder::Line> testing::LogRecorder::take() {
  MutexLock lock(linesMutex);
  return std::exchange(lines, {});
}

std::vector<std::string> testing::LogRecorder::takeErrors() {
  std::vector<std::string> errors;
  for (Line& line : take()) {
    if (line.level == LogLevel::error) errors.push_back(std::move(line.message));
  }
  return errors;
}

std::string testing::LogRecorder::nextError() {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  MutexLock lock(linesMutex);
  for (;;) {
    while (!lines.empty()) {
      const Line line = std::move(lines.front());
      lines.erase(lines.begin());
      if (line.level == LogLevel::error) return line.message;
    }
    if (!lineAdded.waitUntil(linesMutex, deadline)) return {};
  }
}

}  // namespace quarvel
