#include "platform/DeviceProperties.h"

#include "linux/Service.h"

namespace quarvel {
namespace {

template <class Kind>
std::optional<Kind> property(std::string_view name) {
  const auto& device = Service::current().configuration().device;
  const auto found = device.find(name);
  if (found == device.end()) return std::nullopt;
  const Kind* value = std::get_if<Kind>(&found->second);
  return value == nullptr ? std::nullopt : std::optional<Kind>(*value);
}

}  // namespace

std::optional<bool> DevicePropertyBoolean(std::string_view name) {
  return property<bool>(name);
}

std::optional<std::int64_t> DevicePropertyInteger(std::string_view name) {
  return property<std::int64_t>(name);
}

}  // namespace quarvel
