#include "device/TallixFacility.h"

#include <fmt/format.h>

#include <map>
#include <system_error>
#include <tuple>
#include <utility>

#include "base/Utf8.h"
#include "platform/Log.h"

namespace quarvel {

namespace {

namespace fs = std::filesystem;

bool matches(std::optional<std::string_view> wanted, std::string_view name) {
  return !wanted || *wanted == name;
}

/// Collects the channels of one lookup. Lives as long as the lookup, on its thread.
class TreeSearch {
 public:
  using Position = std::tuple<std::string, std::string, std::string>;

  TreeSearch(std::optional<std::string_view> group, std::optional<std::string_view> subgroup)
      : group_(group), subgroup_(subgroup) {}

  void searchRoot(const fs::path& root) {
    forEachEntry(root, [this](const fs::directory_entry& entry, const std::string& name) {
      if (matches(group_, name) && isDirectory(entry)) searchGroup(entry.path(), name);
    });
  }
  void add(DriverChannel channel) {
    known = true;
    found.insert_or_assign(Position(channel.group, channel.subgroup, channel.name),
                           std::move(channel));
  }

  std::map<Position, DriverChannel> found;
  bool known = false;
  std::optional<Error> error;

 private:
  static bool isDirectory(const fs::directory_entry& entry) {
    std::error_code ignored;
    return entry.is_directory(ignored);
  }
  static bool isFile(const fs::directory_entry& entry) {
    std::error_code ignored;
    return entry.is_regular_file(ignored);
  }

  template <class Visit>
  void forEachEntry(const fs::path& directory, const Visit& visit) {
    std::error_code failure;
    for (fs::directory_iterator entry(directory, failure), end; !failure && entry != end;
         entry.increment(failure)) {
      const std::string name = entry->path().filename();
      // A name becomes part of a message, which must be UTF-8.
      if (!name.starts_with('.') && IsUtf8(name)) visit(*entry, name);
    }
    if (failure && !error) {
      error = TallixError(TallixErrorCode::unreadableGroups,
                          fmt::format("{}: {}", directory.native(), failure.message()));
    }
  }

  void searchGroup(const fs::path& directory, const std::string& group) {
    known = known || !subgroup_;
    forEachEntry(directory, [&](const fs::directory_entry& entry, const std::string& name) {
      if (!subgroup_ && isFile(entry)) {
        add({group, "", name, entry.path(), std::nullopt});
      } else if (matches(subgroup_, name) && isDirectory(entry)) {
        searchSubgroup(entry.path(), group, name);
      }
    });
  }

  void searchSubgroup(const fs::path& directory, const std::string& group,
                      const std::string& subgroup) {
    known = true;
    forEachEntry(directory, [&](const fs::directory_entry& entry, const std::string& name) {
      if (isFile(entry)) add({group, subgroup, name, entry.path(), std::nullopt});
    });
  }

  std::optional<std::string_view> group_;
  std::optional<std::string_view> subgroup_;
};

}  // namespace

std::string DriverChannel::description() const {
  return fmt::format("{}/{}{}{} ({})", group, subgroup, subgroup.empty() ? "" : "/", name,
                     file.native());
}

Error TallixError(TallixErrorCode code, std::string reason) {
  return Error::because(kTallixErrorDomain, static_cast<std::int64_t>(code), std::move(reason));
}

TallixFacility::TallixFacility(const Configuration::Tallix& configuration)
    : root_(configuration.root) {
  ZQ_FUNCTION("TallixFacility");
  for (const Configuration::TallixChannel& channel : configuration.channels) {
    DriverChannel single{channel.group, channel.subgroup, channel.name, channel.file, std::nullopt};
    if (!channel.pattern.empty()) {
      std::string fault;
      single.pattern = CounterPattern::compile(channel.pattern, fault);
      if (!single.pattern) {
        ZQ_LOG(nullptr, error, "driver channel {} is left out, its pattern \"{}\" is wrong: {}",
               single.description(), channel.pattern, fault);
        continue;
      }
    }
    single_.push_back(std::move(single));
  }
}

TallixChannels TallixFacility::channelsInGroup(std::optional<std::string_view> group,
                                               std::optional<std::string_view> subgroup,
                                               std::optional<Error>& error) const {
  TreeSearch search(group, subgroup);
  if (!root_.empty()) search.searchRoot(root_);
  for (const DriverChannel& channel : single_) {
    if (matches(group, channel.group) && matches(subgroup, channel.subgroup)) search.add(channel);
  }
  if (search.error) error = std::move(search.error);
  if (!search.known) return nullptr;

  std::vector<DriverChannel> channels;
  channels.reserve(search.found.size());
  for (auto& [position, channel] : search.found) channels.push_back(std::move(channel));
  return std::make_shared<const TallixChannelSet>(std::move(channels));
}

}  // namespace quarvel
