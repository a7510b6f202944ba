#include "platform/FileSystem.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {

std::string DiagnosticsPath(std::string_view path) {
  return std::string(path);
}
Outcome CreateDirectory(std::string_view, std::uint32_t) {
  const auto& error = Simulation::current().files.directoryError;
  return error ? Outcome(*error) : Success();
}
Outcome WriteFileAtomically(std::string_view path, std::string_view content) {
  SimulatedFiles& files = Simulation::current().files;
  files.writes.emplace_back(path, content);
  return files.writeError ? Outcome(*files.writeError) : Success();
}

}  // namespace quarvel
