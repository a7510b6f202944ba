#include "tests/simulated/SimulatedSystem.h"

#include <fmt/format.h>

#include "platform/DeviceProperties.h"
#include "platform/FileSystem.h"
#include "platform/Process.h"
#include "platform/Random.h"
#include "platform/Trace.h"
#include "tests/simulated/Simulation.h"

namespace quarvel {

std::uint32_t SimulatedRandom::below(std::uint32_t bound) {
  return largest ? bound - 1 : static_cast<std::uint32_t>(random_() % bound);
}

std::uint32_t RandomBelow(std::uint32_t bound) {
  return Simulation::current().random.below(bound);
}

void EmitKernelTrace(std::uint32_t code, std::uint64_t, std::uint64_t, std::uint64_t,
                     std::uint64_t) {
  Simulation::current().note(fmt::format("trace {:#x}", code));
}

std::int32_t OwnProcessIdentifier() {
  return 4711;
}

std::string OwnProcessName() {
  return "quarveld";
}

std::optional<std::string> ProcessCommandName(std::int32_t processIdentifier) {
  EXPECT_GE(processIdentifier, 1);
  const auto& table = Simulation::current().processes;
  const auto found = table.find(processIdentifier);
  return found == table.end() ? std::nullopt : std::optional(found->second);
}

void ExitProcess(int status) {
  Simulation& simulation = Simulation::current();
  simulation.note(fmt::format("exit {}", status));
  simulation.scheduler.stop();
  throw ThreadEnded{};
}

std::optional<bool> DevicePropertyBoolean(std::string_view name) {
  EXPECT_EQ(name, "InternalBuild");
  return Simulation::current().internalBuild;
}

std::optional<std::int64_t> DevicePropertyInteger(std::string_view name) {
  EXPECT_EQ(name, "DeviceClassNumber");
  return Simulation::current().deviceClass;
}

void SimulatedOrientation::turn(const Handlers& handlers, Orientation orientation) {
  Simulation::current().spawn("orientation", [&handlers, orientation] {
    for (const auto& [callbackID, handler] : handlers) handler(orientation);
  });
}

namespace {

SimulatedOrientation& TheOrientation() {
  return Simulation::current().orientation;
}

void Remove(SimulatedOrientation::Handlers& handlers, std::string_view callbackID) {
  const auto found = handlers.find(callbackID);
  if (found != handlers.end()) handlers.erase(found);
}

}  // namespace

void RegisterDeviceOrientationHandler(std::string_view callbackID, OrientationHandler handler) {
  TheOrientation().device.insert_or_assign(std::string(callbackID), std::move(handler));
}

void UnregisterDeviceOrientationHandler(std::string_view callbackID) {
  Remove(TheOrientation().device, callbackID);
}

void RegisterUIOrientationHandler(std::string_view callbackID, OrientationHandler handler) {
  TheOrientation().ui.insert_or_assign(std::string(callbackID), std::move(handler));
}

void UnregisterUIOrientationHandler(std::string_view callbackID) {
  Remove(TheOrientation().ui, callbackID);
}

std::string DiagnosticsPath(std::string_view path) {
  return std::string(path);
}

Outcome CreateDirectory(std::string_view, std::uint32_t) {
  const SimulatedFiles& files = Simulation::current().files;
  return files.directoryError ? Outcome(*files.directoryError) : Success();
}

Outcome WriteFileAtomically(std::string_view path, std::string_view content) {
  SimulatedFiles& files = Simulation::current().files;
  const bool cut = Simulation::current().tells(Lie::historyCut);
  files.writes.emplace_back(path, cut ? content.substr(0, content.size() / 2) : content);
  return files.writeError ? Outcome(*files.writeError) : Success();
}

}  // namespace quarvel
