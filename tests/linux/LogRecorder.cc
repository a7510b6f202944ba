#include "tests/linux/LogRecorder.h"

#include <utility>

#include "base/Mutex.h"

namespace quarvel {

namespace {

Mutex linesMutex;
std::vector<testing::LogRecorder::Line> lines QUARVEL_GUARDED_BY(linesMutex);

}  // namespace

bool ZQLogEnabled(LogLevel, LogHandle) {
  return true;
}

void ZQLogWrite(LogHandle, LogLevel level, const char*, int, const char*,
                std::string_view message) {
  MutexLock lock(linesMutex);
  lines.push_back({level, std::string(message)});
}

std::vector<testing::LogRecorder::Line> testing::LogRecorder::take() {
  MutexLock lock(linesMutex);
  return std::exchange(lines, {});
}

}  // namespace quarvel
