#include "platform/Tallix.h"

#include <utility>

#include "linux/Service.h"
#include "platform/Log.h"

namespace quarvel {

TallixChannels TallixCopyChannelsInGroup(std::optional<std::string_view> group,
                                         std::optional<std::string_view> subgroup,
                                         std::optional<Error>& error) {
  ZQ_FUNCTION("TallixCopyChannelsInGroup");
  std::optional<Error> failure;
  TallixChannels channels = Service::current().tallix().channelsInGroup(group, subgroup, failure);
  if (failure) {
    // The caller logs the code alone.
    ZQ_LOG(nullptr, error, "{}", failure->description());
    error = std::move(failure);
  }
  return channels;
}

}  // namespace quarvel
