#pragma once

#include <cstdint>
#include <functional>
#include <string_view>

namespace quarvel {

/// Position of the device, or of its user interface. Other programs write these numbers, so they do
/// not change.
enum class Orientation : std::int32_t {
  unknown = 0,
  portrait = 1,            // upright
  portraitUpsideDown = 2,  // upright, upside down
  landscapeLeft = 3,       // on its side, the top to the left
  landscapeRight = 4,      // on its side, the top to the right
  faceUp = 5,              // lying flat, the screen up
  faceDown = 6,            // lying flat, the screen down
};

/// The enumerator's name: "portrait" for `Orientation::portrait`. "unknown" for any other number.
[[nodiscard]] std::string_view OrientationName(Orientation orientation);

using OrientationHandler = std::function<void(Orientation)>;

// A handler is registered under an ID and replaces an earlier one with the same ID. It is called
// for each later change, not for the orientation at registration. Handlers run on a platform
// thread, one at a time for each kind. On a device that does not know its orientation they are
// never called.
//
// Registering returns at once. Unregistering waits until the handler has returned, unless the
// handler itself unregisters, and the handler is not called again; the caller therefore holds no
// lock that the handler takes. An unknown ID is ignored. From any thread.

void RegisterDeviceOrientationHandler(std::string_view callbackID, OrientationHandler handler);
void UnregisterDeviceOrientationHandler(std::string_view callbackID);
void RegisterUIOrientationHandler(std::string_view callbackID, OrientationHandler handler);
void UnregisterUIOrientationHandler(std::string_view callbackID);

}  // namespace quarvel
