#include "platform/Orientation.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {

void SimulatedOrientation::turn(const Handlers& handlers, Orientation orientation) {
  Simulation::current().spawn("orientation", [&handlers, orientation] {
    for (const auto& [callbackID, handler] : handlers) handler(orientation);
  });
}
void RegisterDeviceOrientationHandler(std::string_view callbackID, OrientationHandler handler) {
  Simulation::current().orientation.device[std::string(callbackID)] = std::move(handler);
}
void UnregisterDeviceOrientationHandler(std::string_view callbackID) {
  Simulation::current().orientation.device.erase(std::string(callbackID));
}
void RegisterUIOrientationHandler(std::string_view callbackID, OrientationHandler handler) {
  Simulation::current().orientation.ui[std::string(callbackID)] = std::move(handler);
}
void UnregisterUIOrientationHandler(std::string_view callbackID) {
  Simulation::current().orientation.ui.erase(std::string(callbackID));
}

}  // namespace quarvel
