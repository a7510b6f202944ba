#include "platform/Tallix.h"

#include <utility>

#include "device/TallixFacility.h"
#include "platform/Log.h"

namespace quarvel {

TallixChannels TallixCopyChannelsInGroup(std::optional<std::string_view> group,
                                         std::optional<std::string_view> subgroup,
                                         std::optional<Error>& error) {
  ZQ_FUNCTION("TallixCopyChannelsInGroup");
  static const TallixFacility facility(Configuration::process().tallix);
  std::optional<Error> failure;
  TallixChannels channels = facility.channelsInGroup(group, subgroup, failure);
  if (failure) {
    // Who asked logs the code alone.
    ZQ_LOG(nullptr, error, "{}", failure->description());
    error = std::move(failure);
  }
  return channels;
}

}  // namespace quarvel
