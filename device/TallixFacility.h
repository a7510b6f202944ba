#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "base/Error.h"
#include "device/CounterFile.h"
#include "platform/Tallix.h"
#include "system/Configuration.h"

namespace quarvel {

/// The place of one channel's integer. A value type.
struct DriverChannel {
  std::string group, subgroup, name;  // an absent subgroup or name is empty
  std::filesystem::path file;
  std::optional<CounterPattern> pattern;  // absent: the file holds the integer alone

  /// For messages: "group/subgroup/name (file)".
  [[nodiscard]] std::string description() const;
};

/// The channels that one lookup found, in the order of group, subgroup and name. Immutable; shared
/// by references from any thread.
class TallixChannelSet {
 public:
  explicit TallixChannelSet(std::vector<DriverChannel> list) : channels(std::move(list)) {}
  const std::vector<DriverChannel> channels;
};

/// An error of the domain of driver counters, with `reason` as its text.
[[nodiscard]] Error TallixError(TallixErrorCode code, std::string reason);

/// Finds channels in two places: a tree of files ROOT/<group>/<channel> and
/// ROOT/<group>/<subgroup>/<channel>, one integer each, and the single channels of the
/// configuration. A single channel replaces the one in the tree with the same group, subgroup and
/// name. Symbolic links are followed, hidden files ignored. One for each process. Immutable; any
/// thread.
class TallixFacility {
 public:
  /// A single channel with a wrong pattern is logged and left out.
  explicit TallixFacility(const Configuration::Tallix& configuration);

  /// The channels with this group and this subgroup; an absent argument admits every one. Reads the
  /// directories of the tree on the calling thread, but no counter. Null when there is no such
  /// group. `error` is set when the tree cannot be read; the single channels are returned all the
  /// same.
  [[nodiscard]] TallixChannels channelsInGroup(std::optional<std::string_view> group,
                                               std::optional<std::string_view> subgroup,
                                               std::optional<Error>& error) const;

 private:
  std::filesystem::path root_;         // empty: no tree
  std::vector<DriverChannel> single_;  // of the configuration, with compiled patterns
};

}  // namespace quarvel
