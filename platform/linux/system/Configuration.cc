#include "platform/linux/system/Configuration.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <fmt/ranges.h>
#include <toml++/toml.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <concepts>
#include <cstring>
#include <initializer_list>
#include <limits>
#include <optional>
#include <set>
#include <utility>

#include "platform/Log.h"
#include "platform/Process.h"
#include "platform/linux/system/Directories.h"
#include "platform/linux/system/LogControl.h"

namespace quarvel {
namespace {

constexpr std::string_view kFileName = "quarvel.toml";
constexpr std::int64_t kMebibyte = 1024 * 1024;
constexpr std::int64_t kGibibyte = 1024 * kMebibyte;
constexpr std::int64_t kDaySeconds = 24 * 60 * 60;
constexpr std::int64_t kAnyPositive = std::numeric_limits<std::int64_t>::max();

/// A value as a person would write it, or what kind it is of.
std::string described(const toml::node& node) {
  if (const auto* integer = node.as_integer()) return fmt::format("{}", integer->get());
  if (const auto* text = node.as_string()) return fmt::format("\"{}\"", text->get());
  if (const auto* boolean = node.as_boolean()) return fmt::format("{}", boolean->get());
  if (const auto* real = node.as_floating_point()) return fmt::format("the real {}", real->get());
  if (node.is_array()) return "a list";
  if (node.is_table()) return "a table";
  return "a date or time";
}

/// What reading a file has found: its first fault, and the keys nobody knows.
class Findings {
 public:
  Findings(const std::filesystem::path& file, std::vector<std::string>& warnings)
      : file_(file.native()), warnings_(warnings) {}

  [[nodiscard]] const std::optional<Error>& error() const { return error_; }

  void fault(std::string reason) {
    if (!error_) error_ = Error::because("quarvel.configuration", 1, std::move(reason));
  }
  void syntaxFault(const toml::parse_error& fault) {
    this->fault(fmt::format("{}:{}: {}", file_, fault.source().begin.line, fault.description()));
  }
  void wrongValue(const std::string& key, const toml::node& node, std::string_view allowed) {
    fault(fmt::format("{}:{}: {} must be {}, but is {}.", file_, node.source().begin.line, key,
                      allowed, described(node)));
  }
  void missingKey(const toml::node& table, const std::string& key) {
    fault(fmt::format("{}:{}: {} is missing.", file_, table.source().begin.line, key));
  }
  void unknownKey(const std::string& key, const toml::key& place) {
    warnings_.push_back(
        fmt::format("{}:{}: {} is no key of ours.", file_, place.source().begin.line, key));
  }

 private:
  const std::string file_;
  std::vector<std::string>& warnings_;
  std::optional<Error> error_;
};

/// One table of the file, or none. Each key that is read is known; once the last has been, what is
/// left over is not ours. An absent key leaves what it is read into as it was.
class Section {
 public:
  Section(Findings& findings, const toml::table* table, std::string name)
      : findings_(findings), table_(table), name_(std::move(name)) {}
  Section(const Section&) = delete;
  Section& operator=(const Section&) = delete;

  ~Section() {
    if (table_ == nullptr) return;
    for (const auto& [key, node] : *table_) {
      if (!known_.contains(key.str())) findings_.unknownKey(path(key.str()), key);
    }
  }

  void read(std::string_view key, bool& out) {
    readAs<bool>(key, "true or false", [&](bool value) { out = value; });
  }

  void read(std::string_view key, std::string& out) {
    readAs<std::string>(key, "a string", [&](const std::string& value) { out = value; });
  }

  void read(std::string_view key, std::filesystem::path& out) {
    readAs<std::string>(key, "a string, a path", [&](const std::string& value) { out = value; });
  }

  /// An integer, or a duration by its count.
  template <class Number>
  void read(std::string_view key, std::int64_t least, std::int64_t most, Number& out) {
    const std::string allowed = most == kAnyPositive
                                    ? fmt::format("an integer of at least {}", least)
                                    : fmt::format("an integer from {} to {}", least, most);
    const toml::node* const node = find(key);
    if (node == nullptr) return;
    const auto* const integer = node->as_integer();
    if (integer == nullptr || integer->get() < least || integer->get() > most) {
      findings_.wrongValue(path(key), *node, allowed);
    } else if constexpr (std::integral<Number>) {
      out = static_cast<Number>(integer->get());
    } else {
      out = Number(static_cast<typename Number::rep>(integer->get()));
    }
  }

  /// One of several names.
  template <class Choice>
  void read(std::string_view key,
            std::initializer_list<std::pair<std::string_view, Choice>> choices, Choice& out) {
    const toml::node* const node = find(key);
    if (node == nullptr) return;
    const auto* const text = node->as_string();
    std::vector<std::string_view> names;
    for (const auto& [name, choice] : choices) {
      if (text != nullptr && text->get() == name) {
        out = choice;
        return;
      }
      names.push_back(name);
    }
    findings_.wrongValue(path(key), *node,
                         fmt::format("one of \"{}\"", fmt::join(names, "\", \"")));
  }

  /// A list of strings, each of which `admits`.
  template <class Admits>
  void read(std::string_view key, std::string_view allowed, Admits admits,
            std::vector<std::string>& out) {
    const toml::node* const node = find(key);
    if (node == nullptr) return;
    const toml::array* const list = node->as_array();
    if (list == nullptr) return findings_.wrongValue(path(key), *node, allowed);
    std::vector<std::string> read;
    for (const toml::node& item : *list) {
      const auto* const text = item.as_string();
      if (text == nullptr || !admits(text->get()) ||
          std::ranges::find(read, text->get()) != read.end()) {
        return findings_.wrongValue(fmt::format("{}[{}]", path(key), read.size()), item, allowed);
      }
      read.push_back(text->get());
    }
    out = std::move(read);
  }

  /// The table of a key, or none.
  [[nodiscard]] const toml::table* table(std::string_view key) {
    const toml::node* const node = find(key);
    if (node == nullptr) return nullptr;
    if (!node->is_table()) findings_.wrongValue(path(key), *node, "a table");
    return node->as_table();
  }

  /// The tables of a key that may come several times, or none.
  [[nodiscard]] std::vector<const toml::table*> tables(std::string_view key) {
    const toml::node* const node = find(key);
    if (node == nullptr) return {};
    std::vector<const toml::table*> tables;
    const toml::array* const list = node->as_array();
    if (list == nullptr || !list->is_homogeneous(toml::node_type::table)) {
      findings_.wrongValue(path(key), *node, "tables, each [[" + path(key) + "]]");
      return {};
    }
    for (const toml::node& item : *list) tables.push_back(item.as_table());
    return tables;
  }

  void require(std::string_view key, bool given) {
    if (!given) findings_.missingKey(*table_, path(key));
  }

 private:
  [[nodiscard]] std::string path(std::string_view key) const {
    return name_.empty() ? std::string(key) : fmt::format("{}.{}", name_, key);
  }

  const toml::node* find(std::string_view key) {
    known_.emplace(key);
    return table_ == nullptr ? nullptr : table_->get(key);
  }

  template <class Kind, class Take>
  void readAs(std::string_view key, std::string_view allowed, Take take) {
    const toml::node* const node = find(key);
    if (node == nullptr) return;
    if (const auto* const value = node->as<Kind>()) {
      take(value->get());
    } else {
      findings_.wrongValue(path(key), *node, allowed);
    }
  }

  Findings& findings_;
  const toml::table* const table_;
  const std::string name_;
  std::set<std::string, std::less<>> known_;
};

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

void readAgent(Findings& findings, const toml::table* table, Configuration::Agent& out) {
  Section agent(findings, table, "agent");
  agent.read(
      "backends", R"(a list of "store", "nats", "otlp", each at most once)",
      [](std::string_view name) { return name == "store" || name == "nats" || name == "otlp"; },
      out.backends);
  agent.read("export", out.exports);
  agent.read("drain_rows_per_second", 1, 1'000'000, out.drainRowsPerSecond);
  // The exporters' own.
  static_cast<void>(agent.table("nats"));
  static_cast<void>(agent.table("otlp"));
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

/// The whole of a file; none when there is no such file.
Result<std::optional<std::string>> contentOf(const std::filesystem::path& file) {
  const auto failure = [&file] {
    return Error::because("quarvel.configuration", 1,
                          fmt::format("{}: {}.", file.native(), std::strerror(errno)));
  };
  const int descriptor = ::open(file.c_str(), O_RDONLY | O_CLOEXEC);
  if (descriptor < 0 && (errno == ENOENT || errno == ENOTDIR)) return std::optional<std::string>();
  if (descriptor < 0) return failure();
  std::string content;
  char part[4096];
  ssize_t count = 0;
  while ((count = ::read(descriptor, part, sizeof part)) > 0 || (count < 0 && errno == EINTR)) {
    if (count > 0) content.append(part, static_cast<std::size_t>(count));
  }
  std::optional<Error> error;
  if (count < 0) error = failure();
  ::close(descriptor);
  if (error) return *error;
  return std::optional(std::move(content));
}

Configuration readForProcess() {
  ZQ_FUNCTION("ConfigurationRead");
  std::vector<std::string> warnings;
  Result<Configuration> configuration =
      Configuration::read(Directories::process().configuration / kFileName, warnings);
  if (!configuration) {
    const std::string* const reason = configuration.error().userInfo.find("reason")->string();
    ZQ_LOG(nullptr, error, "{}", *reason);
    ExitProcess(1);
  }
  SetLogLevel(configuration.value().logLevel);
  for (const std::string& warning : warnings) ZQ_LOG(nullptr, standard, "{}", warning);
  return std::move(configuration.value());
}

}  // namespace

const Configuration& Configuration::process() {
  // Never destroyed: other threads may ask until the very end.
  static const Configuration& configuration = *new Configuration(readForProcess());
  return configuration;
}

Result<Configuration> Configuration::read(const std::filesystem::path& file,
                                          std::vector<std::string>& warnings) {
  Result<std::optional<std::string>> content = contentOf(file);
  if (!content) return content.error();
  if (!content.value()) return Configuration{};
  Findings findings(file, warnings);
  Configuration configuration;
  try {
    configuration = readRoot(findings, toml::parse(*content.value(), file.native()));
  } catch (const toml::parse_error& fault) {
    findings.syntaxFault(fault);
  }
  if (findings.error()) return *findings.error();
  return configuration;
}

}  // namespace quarvel
