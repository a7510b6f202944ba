#include "platform/Orientation.h"

#include <utility>

#include "linux/Service.h"

namespace quarvel {

void RegisterDeviceOrientationHandler(std::string_view callbackID, OrientationHandler handler) {
  Service::current().orientation().add(OrientationKind::device, callbackID, std::move(handler));
}
void UnregisterDeviceOrientationHandler(std::string_view callbackID) {
  Service::current().orientation().remove(OrientationKind::device, callbackID);
}
void RegisterUIOrientationHandler(std::string_view callbackID, OrientationHandler handler) {
  Service::current().orientation().add(OrientationKind::ui, callbackID, std::move(handler));
}
void UnregisterUIOrientationHandler(std::string_view callbackID) {
  Service::current().orientation().remove(OrientationKind::ui, callbackID);
}

}  // namespace quarvel
