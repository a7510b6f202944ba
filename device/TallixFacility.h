#pragma once

#include <filesystem>
#include <optional>
#include <string_view>
#include <vector>

#include "base/Error.h"
#include "device/TallixChannels.h"
#include "platform/Tallix.h"
#include "system/Configuration.h"

namespace quarvel {

/// Finds channels: a tree of files ROOT/<group>/<channel> and ROOT/<group>/<subgroup>/<channel>,
/// one integer each, and the single channels of the configuration. A single one takes the place of
/// one in the tree that has the same group, subgroup and name. Symbolic links are followed, hidden
/// files are not looked at. Immutable; from any thread.
class TallixFacility {
 public:
  /// A single channel whose pattern is wrong is logged and left out.
  explicit TallixFacility(const Configuration::Tallix& configuration);

  /// As `TallixCopyChannelsInGroup`.
  [[nodiscard]] TallixChannels channelsInGroup(std::optional<std::string_view> group,
                                               std::optional<std::string_view> subgroup,
                                               std::optional<Error>& error) const;

 private:
  std::filesystem::path root_;
  std::vector<DriverChannel> single_;
};

}  // namespace quarvel
