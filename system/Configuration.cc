#include "system/Configuration.h"

#include <fmt/format.h>
#include <toml++/toml.h>

#include <cerrno>
#include <cstring>
#include <optional>
#include <utility>

#include "base/Files.h"
#include "platform/Log.h"
#include "system/ConfigurationSection.h"

namespace quarvel {
namespace {

using configuration::Findings;
using configuration::kAnyPositive;
using configuration::Section;

constexpr std::int64_t kMebibyte = 1024 * 1024;
constexpr std::int64_t kGibibyte = 1024 * kMebibyte;
constexpr std::int64_t kDaySeconds = 24 * 60 * 60;

void readDevice(Findings& findings, const toml::table* table, Configuration& out) {
  if (table == nullptr) return;
  for (const auto& [key, node] : *table) {
    std::string name(key.str());
    if (const auto* boolean = node.as_boolean()) {
      out.device.insert_or_assign(std::move(name), boolean->get());
    } else if (const auto* integer = node.as_integer()) {
      out.device.insert_or_assign(std::move(name), integer->get());
    } else if (const auto* text = node.as_string()) {
      out.device.insert_or_assign(std::move(name), text->get());
    } else {
      findings.wrongValue("device." + name, node, "a boolean, an integer or a string");
    }
  }
}

void readLog(Findings& findings, const toml::table* table, Configuration& out) {
  Section log(findings, table, "log");
  log.read<LogLevel>("level",
                     {{"error", LogLevel::error},
                      {"default", LogLevel::standard},
                      {"info", LogLevel::info},
                      {"debug", LogLevel::debug}},
                     out.logLevel);
}

void readStore(Findings& findings, const toml::table* table, Configuration::Store& out) {
  Section store(findings, table, "store");
  store.read("path", out.path);
  store.read("sync_ms", 0, 60'000, out.sync);
  store.read("max_bytes", kMebibyte, kAnyPositive, out.maximumBytes);
  store.read("max_age_days", 1, 36'500, out.maximumAge);
}

bool isDeviceName(std::string_view name) {
  constexpr std::string_view kAllowed =
      "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789-_";
  return name.size() <= 64 && name.find_first_not_of(kAllowed) == std::string_view::npos;
}

/// Whether `url` is `<scheme>://` and more, without blanks, a query or a fragment.
bool isUrl(std::string_view url, std::initializer_list<std::string_view> schemes) {
  for (const std::string_view scheme : schemes) {
    if (!url.starts_with(scheme) || !url.substr(scheme.size()).starts_with("://")) continue;
    const std::string_view rest = url.substr(scheme.size() + 3);
    return !rest.empty() && rest.front() != '/' && rest.find_first_of(" \t\r\n?#") == url.npos;
  }
  return false;
}

bool isHeader(std::string_view name, std::string_view value) {
  return !name.empty() && name.find_first_of(" \t\r\n:") == name.npos &&
         value.find_first_of("\r\n") == value.npos;
}

void readTls(Section& section, Configuration::Tls& out) {
  section.read("tls_ca", out.authority);
  section.read("tls_certificate", out.certificate);
  section.read("tls_key", out.key);
  section.require("tls_key", !out.key.empty() || out.certificate.empty());
  section.require("tls_certificate", !out.certificate.empty() || out.key.empty());
}

void readNats(Findings& findings, const toml::table* table, Configuration::Nats& out) {
  Section nats(findings, table, "agent.nats");
  nats.read(
      "urls", "a list of addresses, each \"nats://…\" or \"tls://…\", none twice",
      [](std::string_view url) {
        return isUrl(url, {"nats", "tls"});
      },
      out.urls);
  nats.require("urls", !out.urls.empty());
  nats.read(
      "stream", "a name without blanks, \".\", \"*\", \">\", \"/\" and \"\\\"",
      [](std::string_view name) { return name.find_first_of(" \t\r\n.*>/\\") == name.npos; },
      out.stream);
  nats.read("create_stream", out.createStream);
  nats.require("stream", !out.stream.empty() || !out.createStream);
  nats.read("replicas", 1, 5, out.replicas);
  nats.read("duplicate_window_seconds", 1, 30 * kDaySeconds, out.duplicateWindow);
  nats.read("credentials", out.credentials);
  readTls(nats, out.tls);
  nats.read("acknowledge_seconds", 1, 600, out.acknowledge);
  nats.read("gather_seconds", 0, kDaySeconds, out.gather);
}

void readOtlp(Findings& findings, const toml::table* table, Configuration::Otlp& out) {
  Section otlp(findings, table, "agent.otlp");
  otlp.read(
      "endpoint", "an address, \"http://…\" or \"https://…\"",
      [](std::string_view url) {
        return isUrl(url, {"http", "https"});
      },
      out.endpoint);
  otlp.read("headers", "a string without line breaks, for a header's name", isHeader, out.headers);
  otlp.read("gzip", out.gzip);
  readTls(otlp, out.tls);
  otlp.read("connect_seconds", 1, 600, out.connect);
  otlp.read("timeout_seconds", 1, 600, out.timeout);
  otlp.read("gather_seconds", 0, kDaySeconds, out.gather);
}

void readAgent(Findings& findings, const toml::table* table, Configuration::Agent& out) {
  Section agent(findings, table, "agent");
  agent.read(
      "backends", R"(a list of "store", "nats", "otlp", each at most once)",
      [](std::string_view name) { return name == "store" || name == "nats" || name == "otlp"; },
      out.backends);
  agent.read("export", out.exports);
  agent.read("drain_rows_per_second", 1, 1'000'000, out.drainRowsPerSecond);
  agent.read("device", "a name of letters, digits, \"-\" and \"_\", 64 at most", isDeviceName,
             out.device);
  readNats(findings, agent.table("nats"), out.nats);
  readOtlp(findings, agent.table("otlp"), out.otlp);
}

void readAnalytics(Findings& findings, const toml::table* table, Configuration& out) {
  Section analytics(findings, table, "analytics");
  analytics.read(
      "wanted", "a list of patterns of event names, none empty and none twice",
      [](std::string_view pattern) { return !pattern.empty(); }, out.analyticsWanted);
}

void readTallix(Findings& findings, const toml::table* table, Configuration::Tallix& out) {
  Section tallix(findings, table, "tallix");
  tallix.read("root", out.root);
  for (const toml::table* channelTable : tallix.tables("channel")) {
    Configuration::TallixChannel channel;
    Section section(findings, channelTable, "tallix.channel");
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

void readOrientation(Findings& findings, const toml::table* table, Configuration& out) {
  using Source = Configuration::OrientationSource;
  Section orientation(findings, table, "orientation");
  orientation.read<Source>("source",
                           {{"none", Source::none}, {"files", Source::files}, {"iio", Source::iio}},
                           out.orientation);
}

void readLimits(Findings& findings, const toml::table* table, Configuration::Limits& out) {
  Section limits(findings, table, "limits");
  limits.read("message_bytes", 1024, kGibibyte, out.messageBytes);
  limits.read("reply_bytes", 1024, kGibibyte, out.replyBytes);
  limits.read("frame_seconds", 1, kDaySeconds, out.frame);
  limits.read("stall_seconds", 1, kDaySeconds, out.stall);
  limits.read("depth", 1, 128, out.depth);
  limits.read("queued_calls", 1, 1'000'000, out.queuedCalls);
  limits.read("queued_bytes", 1024, kGibibyte, out.queuedBytes);
  limits.read("connections", 1, 1'000'000, out.connections);
}

Configuration readRoot(Findings& findings, const toml::table& table) {
  Configuration out;
  Section root(findings, &table, "");
  readDevice(findings, root.table("device"), out);
  readLog(findings, root.table("log"), out);
  readStore(findings, root.table("store"), out.store);
  readAgent(findings, root.table("agent"), out.agent);
  readAnalytics(findings, root.table("analytics"), out);
  readTallix(findings, root.table("tallix"), out.tallix);
  readOrientation(findings, root.table("orientation"), out);
  readLimits(findings, root.table("limits"), out.limits);
  return out;
}

}  // namespace

std::vector<std::string> Configuration::Agent::remoteBackends() const {
  std::vector<std::string> remote = backends;
  std::erase(remote, "store");
  return remote;
}

Result<Configuration> Configuration::read(const std::filesystem::path& file,
                                          std::vector<std::string>& warnings) {
  const Result<std::string> content = ReadWholeFile(file);
  if (!content) {
    const std::int64_t status = content.error().code;
    if (status == ENOENT || status == ENOTDIR) return Configuration{};
    return Error::because(
        "quarvel.configuration", 1,
        fmt::format("{}: {}.", file.native(), std::strerror(static_cast<int>(status))));
  }
  Findings findings(file, warnings);
  Configuration configuration;
  try {
    configuration = readRoot(findings, toml::parse(content.value(), file.native()));
  } catch (const toml::parse_error& fault) {
    findings.syntaxFault(fault);
  }
  if (findings.error()) return *findings.error();
  return configuration;
}

}  // namespace quarvel
