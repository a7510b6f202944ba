#include "platform/linux/sources/TallixFacility.h"

#include <fmt/format.h>

#include <algorithm>
#include <map>
#include <system_error>
#include <tuple>
#include <utility>

#include "base/Utf8.h"
#include "platform/Log.h"

namespace quarvel {

namespace {

namespace fs = std::filesystem;

Error tallixError(TallixErrorCode code, std::string reason) {
  return Error::because(kTallixErrorDomain, static_cast<std::int64_t>(code), std::move(reason));
}

bool matches(std::optional<std::string_view> wanted, std::string_view name) {
  return !wanted || *wanted == name;
}

/// Looks through the tree for what a lookup asks for.
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
      // A name becomes part of a message, so it has to be text.
      if (!name.starts_with('.') && IsUtf8(name)) visit(*entry, name);
    }
    if (failure && !error) {
      error = tallixError(TallixErrorCode::unreadableGroups,
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

TallixSubscription::TallixSubscription(const TallixChannelSet& channels) {
  ZQ_FUNCTION("TallixCreateSubscription");
  const MutexLock lock(mutex_);
  std::map<fs::path, std::vector<const DriverChannel*>> files;
  for (const DriverChannel& channel : channels.channels) files[channel.file].push_back(&channel);

  std::map<fs::path, std::size_t> opened;
  for (const auto& [path, contents] : files) {
    const bool report = std::ranges::any_of(
        contents, [](const DriverChannel* channel) { return channel->pattern.has_value(); });
    CounterFile file(path, report ? CounterFile::Extent::lines : CounterFile::Extent::oneInteger);
    if (const int status = file.open(); status != 0) {
      ZQ_LOG(nullptr, error, "driver channel {} is left out: {}", contents.front()->description(),
             std::generic_category().message(status));
      continue;
    }
    opened.emplace(path, sources_.size());
    sources_.push_back({std::move(file), {}});
  }

  std::vector<DriverChannel> subscribed;
  for (const DriverChannel& channel : channels.channels) {
    const auto source = opened.find(channel.file);
    if (source == opened.end()) continue;
    sources_[source->second].channels.push_back(subscribed.size());
    subscribed.push_back(channel);
  }
  subscribed_ = std::make_shared<const TallixChannelSet>(std::move(subscribed));
}

Result<TallixSamples> TallixSubscription::sample() {
  const MutexLock lock(mutex_);
  const std::vector<DriverChannel>& channels = subscribed_->channels;
  std::vector<std::int64_t> values(channels.size());
  for (Source& source : sources_) {
    std::string_view content;
    if (const int status = source.file.read(buffer_, content); status != 0) {
      return tallixError(
          TallixErrorCode::channelUnreadable,
          fmt::format("driver channel {}: {}", channels[source.channels.front()].description(),
                      std::generic_category().message(status)));
    }
    for (const std::size_t index : source.channels) {
      const DriverChannel& channel = channels[index];
      const std::string_view text = channel.pattern ? channel.pattern->find(content) : content;
      if (const auto fault = CounterFromText(text, values[index])) {
        return tallixError(*fault, fmt::format("driver channel {} holds {}", channel.description(),
                                               *fault == TallixErrorCode::noInteger
                                                   ? "no decimal integer"
                                                   : "an integer beyond signed 64 bits"));
      }
    }
  }
  return TallixSamples(std::make_shared<const TallixSampleSet>(subscribed_, std::move(values)));
}

}  // namespace quarvel
