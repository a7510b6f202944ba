#include "platform/Orientation.h"

namespace quarvel {

std::string_view OrientationName(Orientation orientation) {
  switch (orientation) {
    case Orientation::unknown:
      return "unknown";
    case Orientation::portrait:
      return "portrait";
    case Orientation::portraitUpsideDown:
      return "portraitUpsideDown";
    case Orientation::landscapeLeft:
      return "landscapeLeft";
    case Orientation::landscapeRight:
      return "landscapeRight";
    case Orientation::faceUp:
      return "faceUp";
    case Orientation::faceDown:
      return "faceDown";
  }
  return "unknown";
}

}  // namespace quarvel
