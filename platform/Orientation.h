#pragma once

#include <cstdint>
#include <functional>
#include <string_view>

namespace quarvel {

/// How the device is held, or how its user interface is turned. The numbers are part of what other
/// programs write; they do not change.
enum class Orientation : std::int32_t {
  unknown = 0,
  portrait = 1,            // upright
  portraitUpsideDown = 2,  // upright, upside down
  landscapeLeft = 3,       // on its side, the top to the left
  landscapeRight = 4,      // on its side, the top to the right
  faceUp = 5,              // lying flat, the screen up
  faceDown = 6,            // lying flat, the screen down
};

/// "portrait" for `Orientation::portrait` and so on; "unknown" for a number that is none of them.
[[nodiscard]] std::string_view OrientationName(Orientation orientation);

using OrientationHandler = std::function<void(Orientation)>;

// A handler is registered under an ID; another one under the same ID takes its place. It is told of
// each change from then on, not of the orientation at that moment. Handlers are called on a thread
// of the platform, for each kind one at a time. On a device that cannot tell its orientation they
// are never called. Registering returns at once. When unregistering returns, the handler is not
// running and will not be called again (a handler that unregisters itself is let finish); so the
// caller holds no lock that the handler takes. An ID that is not registered is ignored. From any
// thread.

void RegisterDeviceOrientationHandler(std::string_view callbackID, OrientationHandler handler);
void UnregisterDeviceOrientationHandler(std::string_view callbackID);
void RegisterUIOrientationHandler(std::string_view callbackID, OrientationHandler handler);
void UnregisterUIOrientationHandler(std::string_view callbackID);

}  // namespace quarvel
