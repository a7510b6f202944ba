#include "system/Configuration.h"

#include <fmt/format.h>
#include <fmt/ranges.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <optional>
#include <utility>

#include "base/Files.h"

namespace quarvel {
namespace {

using Section = ConfigurationSection;

constexpr std::string_view kStore = "store";  // the backend that is not remote
constexpr std::int64_t kMebibyte = 1024 * 1024;
constexpr std::int64_t kGibibyte = 1024 * kMebibyte;
constexpr std::int64_t kDaySeconds = 24 * 60 * 60;

void readLog(Section log, Configuration& out) {
  log.read<LogLevel>("level",
                     {{"error", LogLevel::error},
                      {"default", LogLevel::standard},
                      {"info", LogLevel::info},
                      {"debug", LogLevel::debug}},
                     out.logLevel);
}

void readStore(Section store, Configuration::Store& out) {
  store.read("path", out.path);
  store.read("sync_ms", 0, 60'000, out.sync);
  store.read("max_bytes", kMebibyte, Section::kAnyPositive, out.maximumBytes);
  store.read("max_age_days", 1, 36'500, out.maximumAge);
}

bool isDeviceName(std::string_view name) {
  constexpr std::string_view kAllowed =
      "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789-_";
  return name.size() <= 64 && name.find_first_not_of(kAllowed) == std::string_view::npos;
}

void readAgent(Section agent, std::span<const BackendKind> backends, Configuration::Agent& out) {
  std::vector<std::string_view> names{kStore};
  for (const BackendKind& backend : backends) names.push_back(backend.name);
  agent.read(
      "backends", fmt::format("a list of \"{}\", each at most once", fmt::join(names, "\", \"")),
      [&names](std::string_view name) { return std::ranges::find(names, name) != names.end(); },
      out.backends);
  agent.read("export", out.exports);
  agent.read("drain_rows_per_second", 1, 1'000'000, out.drainRowsPerSecond);
  agent.read("device", "a name of letters, digits, \"-\" and \"_\", 64 at most", isDeviceName,
             out.device);
  for (const BackendKind& backend : backends) {
    Section section = agent.section(backend.name);
    out.settings.insert_or_assign(std::string(backend.name), backend.readSettings(section));
  }
}

void readAnalytics(Section analytics, Configuration& out) {
  analytics.read(
      "wanted", "a list of patterns of event names, none empty and none twice",
      [](std::string_view pattern) { return !pattern.empty(); }, out.analyticsWanted);
}

void readTallix(Section tallix, Configuration::Tallix& out) {
  tallix.read("root", out.root);
  for (Section& section : tallix.sections("channel")) {
    Configuration::TallixChannel channel;
    section.read("group", channel.group);
    section.read("subgroup", channel.subgroup);
    section.read("name", channel.name);
    section.read("file", channel.file);
    section.read("pattern", channel.pattern);
    section.require("group", !channel.group.empty());
    section.require("name", !channel.name.empty());
    section.require("file", !channel.file.empty());
    out.channels.push_back(std::move(channel));
  }
}

void readOrientation(Section orientation, Configuration& out) {
  using Source = Configuration::OrientationSource;
  orientation.read<Source>("source",
                           {{"none", Source::none}, {"files", Source::files}, {"iio", Source::iio}},
                           out.orientation);
}

void readLimits(Section limits, Configuration::Limits& out) {
  limits.read("message_bytes", 1024, kGibibyte, out.messageBytes);
  limits.read("reply_bytes", 1024, kGibibyte, out.replyBytes);
  limits.read("frame_seconds", 1, kDaySeconds, out.frame);
  limits.read("stall_seconds", 1, kDaySeconds, out.stall);
  limits.read("depth", 1, 128, out.depth);
  limits.read("queued_calls", 1, 1'000'000, out.queuedCalls);
  limits.read("queued_bytes", 1024, kGibibyte, out.queuedBytes);
  limits.read("connections", 1, 1'000'000, out.connections);
}

void readRoot(Section& root, std::span<const BackendKind> backends, Configuration& out) {
  root.section("device").readAll(out.device);
  readLog(root.section("log"), out);
  readStore(root.section("store"), out.store);
  readAgent(root.section("agent"), backends, out.agent);
  readAnalytics(root.section("analytics"), out);
  readTallix(root.section("tallix"), out.tallix);
  readOrientation(root.section("orientation"), out);
  readLimits(root.section("limits"), out.limits);
}

}  // namespace

std::vector<std::string> Configuration::Agent::remoteBackends() const {
  std::vector<std::string> remote = backends;
  std::erase(remote, kStore);
  return remote;
}

Result<Configuration> Configuration::read(const std::filesystem::path& file,
                                          std::span<const BackendKind> backends,
                                          std::vector<std::string>& warnings) {
  const Result<std::string> text = ReadWholeFile(file);
  const int status = text ? 0 : static_cast<int>(text.error().code);
  if (status != 0 && status != ENOENT && status != ENOTDIR) {
    return Error::because("quarvel.configuration", 1,
                          fmt::format("{}: {}.", file.native(), std::strerror(status)));
  }
  Configuration configuration;
  auto error = ReadConfigurationText(
      status == 0 ? text.value() : std::string(), file,
      [&](Section& root) { readRoot(root, backends, configuration); }, warnings);
  if (error) return *std::move(error);
  return configuration;
}

}  // namespace quarvel
