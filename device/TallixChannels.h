#pragma once

#include <fmt/format.h>

#include <filesystem>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "device/CounterFile.h"
#include "platform/Tallix.h"

namespace quarvel {

/// Where one channel's integer is to be found.
struct DriverChannel {
  std::string group, subgroup, name;  // no subgroup, no name: empty
  std::filesystem::path file;
  std::optional<CounterPattern> pattern;

  /// For messages: "group/subgroup/name (file)".
  [[nodiscard]] std::string description() const {
    return fmt::format("{}/{}{}{} ({})", group, subgroup, subgroup.empty() ? "" : "/", name,
                       file.native());
  }
};

class TallixChannelSet {
 public:
  explicit TallixChannelSet(std::vector<DriverChannel> list) : channels(std::move(list)) {}
  const std::vector<DriverChannel> channels;
};

[[nodiscard]] inline Error TallixError(TallixErrorCode code, std::string reason) {
  return Error::because(kTallixErrorDomain, static_cast<std::int64_t>(code), std::move(reason));
}

}  // namespace quarvel
