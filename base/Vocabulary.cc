#include "base/Vocabulary.h"

#include <array>

namespace quarvel::vocabulary {
namespace {

constexpr std::string_view kUndefined = "Undefined";
constexpr std::uint32_t kUnknownCode = 65535;
constexpr std::uint32_t kHighHalf = 0xffff'0000;
constexpr std::uint32_t kEveryCategory = 0xffff'ffff;

constexpr std::array<std::string_view, 12> kKinds = {
    kUndefined,      "Generic",     "Record", "Playback",  "PlaybackAndRecord", "Setup",
    "ClientRequest", "RouteChange", "Error",  "Tallixing", "Performance",       "Volume"};

constexpr std::array<std::string_view, 6> kTypes = {"Generic", "Start", "Stop",
                                                    "Setup",   "Error", "IssueDetector"};

constexpr std::array<std::string_view, 12> kServiceTypes = {
    "generic",          "kivo",          "telephony",
    "haptics",          "alarms",        "standalone",
    "soundautoconfig",  "longformaudio", "nonlongformaudio",
    "audiodeviceusage", "alerts",        "test"};

std::string_view prefixOf(Component component) {
  switch (component) {
    case Component::session:
      return "Session_";
    case Component::dsp:
      return "DSP_";
    case Component::hal:
      return "HAL_";
    case Component::routing:
      return "Routing_";
    case Component::toolbox:
      return "Toolbox_";
    case Component::none:
      break;
  }
  return "_";
}

}  // namespace

CategoryName PiecesOf(Category category) {
  const bool hasComponent = (category.code & kHighHalf) != 0 && category.code != kEveryCategory;
  const std::uint32_t kind = category.code & ~kHighHalf;
  return {hasComponent ? prefixOf(static_cast<Component>(category.code & kHighHalf))
                       : std::string_view(),
          kind < kKinds.size() ? kKinds[kind] : kUndefined};
}

std::string NameOf(Category category) {
  const CategoryName name = PiecesOf(category);
  return std::string(name.component).append(name.kind);
}

std::string_view TypeName(std::uint32_t code) {
  if (code < kTypes.size()) return kTypes[code];
  return code == kUnknownCode ? "Unknown" : kUndefined;
}

std::string_view NameOf(MessageType type) {
  return TypeName(static_cast<std::uint16_t>(type));
}

std::string_view ServiceTypeName(std::uint32_t code) {
  if (code < kServiceTypes.size()) return kServiceTypes[code];
  return code == kUnknownCode ? "unknown" : std::string_view();
}

std::string_view NameOf(ServiceType serviceType) {
  return ServiceTypeName(static_cast<std::uint16_t>(serviceType));
}

}  // namespace quarvel::vocabulary
