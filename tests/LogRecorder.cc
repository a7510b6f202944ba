#include "tests/LogRecorder.h"

#include <utility>

#include "tests/device/Collected.h"

namespace quarvel {

namespace {

Collected<testing::LogRecorder::Line> lines;

}  // namespace

bool ZQLogEnabled(LogLevel, LogHandle) {
  return true;
}

void ZQLogWrite(LogHandle, LogLevel level, const char*, int, const char*,
                std::string_view message) {
  lines.add({level, std::string(message)});
}

std::vector<testing::LogRecorder::Line> testing::LogRecorder::take() {
  return lines.take();
}

std::vector<std::string> testing::LogRecorder::takeErrors() {
  std::vector<std::string> errors;
  for (Line& line : take()) {
    if (line.level == LogLevel::error) errors.push_back(std::move(line.message));
  }
  return errors;
}

std::string testing::LogRecorder::nextError() {
  while (const auto line = lines.next()) {
    if (line->level == LogLevel::error) return line->message;
  }
  return {};
}

}  // namespace quarvel
