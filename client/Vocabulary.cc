#include <array>

#include <quarvel/vocabulary.hpp>

namespace quarvel::vocabulary {
namespace {

constexpr std::string_view kUndefined = "Undefined";

constexpr std::array<std::string_view, 11> kKinds = {
    "Generic",     "Record", "Playback",  "PlaybackAndRecord", "Setup", "ClientRequest",
    "RouteChange", "Error",  "Tallixing", "Performance",       "Volume"};

constexpr std::array<std::string_view, 6> kTypes = {"Generic", "Start", "Stop",
                                                    "Setup",   "Error", "IssueDetector"};

constexpr std::array<std::string_view, 12> kServiceTypes = {
    "generic",          "kivo",          "telephony",
    "haptics",          "alarms",        "standalone",
    "soundautoconfig",  "longformaudio", "nonlongformaudio",
    "audiodeviceusage", "alerts",        "test"};

std::string_view NameOf(Component component) {
  switch (component) {
    case Component::session:
      return "Session";
    case Component::dsp:
      return "DSP";
    case Component::hal:
      return "HAL";
    case Component::routing:
      return "Routing";
    case Component::toolbox:
      return "Toolbox";
    case Component::none:
      break;
  }
  return {};
}

}  // namespace

std::string NameOf(Category category) {
  constexpr std::uint32_t kHighHalf = 0xffff'0000;
  std::string name;
  // The code that stands for every category names no component.
  if ((category.code & kHighHalf) != 0 && category.code != 0xffff'ffff) {
    name = NameOf(static_cast<Component>(category.code & kHighHalf));
    name += '_';
  }
  const std::uint32_t kind = category.code & ~kHighHalf;
  return name.append(kind >= 1 && kind <= kKinds.size() ? kKinds[kind - 1] : kUndefined);
}

std::string_view NameOf(MessageType type) {
  if (type == MessageType::unknown) return "Unknown";
  const auto code = static_cast<std::size_t>(type);
  return code < kTypes.size() ? kTypes[code] : kUndefined;
}

std::string_view NameOf(ServiceType serviceType) {
  if (serviceType == ServiceType::unknown) return "unknown";
  const auto code = static_cast<std::size_t>(serviceType);
  return code < kServiceTypes.size() ? kServiceTypes[code] : std::string_view();
}

}  // namespace quarvel::vocabulary
