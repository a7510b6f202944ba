#include "platform/Log.h"

#include <fmt/format.h>

#include "tests/simulated/Simulation.h"

namespace quarvel {

std::string LogLine::text() const {
  constexpr const char* kLevels[] = {"error", "default", "info", "debug"};
  return fmt::format("{} {} {}: {}", kLevels[static_cast<std::size_t>(level)], scope, function,
                     message);
}
std::vector<std::string> SimulatedLog::texts(std::string_view prefix) const {
  std::vector<std::string> texts;
  for (const LogLine& line : lines) {
    if (std::string text = line.text(); text.starts_with(prefix)) texts.push_back(std::move(text));
  }
  return texts;
}
std::vector<std::string> SimulatedLog::messages() const {
  std::vector<std::string> messages;
  for (const LogLine& line : lines) messages.push_back(line.message);
  return messages;
}
LogHandle ZQLogRegister(std::uint32_t code, std::string_view scope, std::string_view,
                        std::string_view, int, int) {
  static std::map<std::uint32_t, LogScope> scopes;
  return &scopes.try_emplace(code, LogScope{std::string(scope)}).first->second;
}
bool ZQLogEnabled(LogLevel level, LogHandle scope) {
  if (level != LogLevel::debug) return true;
  return scope != nullptr && Simulation::current().log.verbose.contains(scope->name);
}
void ZQLogWrite(LogHandle scope, LogLevel level, const char*, int, const char* function,
                std::string_view message) {
  if (TheScheduler().stopped()) return;
  EXPECT_TRUE(ZQLogEnabled(level, scope)) << "written without asking: " << message;
  auto& lines = Simulation::current().log.lines;
  lines.push_back(
      {level, scope == nullptr ? "[default]" : scope->name, function, std::string(message)});
  Simulation::current().note("log " + lines.back().text());
}

}  // namespace quarvel
