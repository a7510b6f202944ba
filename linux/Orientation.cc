#include "platform/Orientation.h"

#include <utility>

#include "base/StandardPaths.h"
#include "device/OrientationCenter.h"
#include "device/OrientationFiles.h"
#include "device/OrientationSensor.h"
#include "system/Configuration.h"

namespace quarvel {

namespace {

OrientationCenter& processCenter() {
  static OrientationCenter& center = *[] {
    auto* made = new OrientationCenter;
    switch (Configuration::process().orientation) {
      case Configuration::OrientationSource::files:
        made->setSource(std::make_unique<OrientationFiles>(*made, StandardPaths::process().runtime,
                                                           DirectoryWatch::process()));
        break;
      case Configuration::OrientationSource::iio:
        made->setSource(std::make_unique<OrientationSensor>(*made));
        break;
      case Configuration::OrientationSource::none:
        break;
    }
    return made;
  }();
  return center;
}

}  // namespace

void RegisterDeviceOrientationHandler(std::string_view callbackID, OrientationHandler handler) {
  processCenter().add(OrientationKind::device, callbackID, std::move(handler));
}
void UnregisterDeviceOrientationHandler(std::string_view callbackID) {
  processCenter().remove(OrientationKind::device, callbackID);
}
void RegisterUIOrientationHandler(std::string_view callbackID, OrientationHandler handler) {
  processCenter().add(OrientationKind::ui, callbackID, std::move(handler));
}
void UnregisterUIOrientationHandler(std::string_view callbackID) {
  processCenter().remove(OrientationKind::ui, callbackID);
}

}  // namespace quarvel
