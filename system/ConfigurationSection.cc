#include "system/ConfigurationSection.h"

#include <fmt/format.h>
#include <fmt/ranges.h>
#include <toml++/toml.h>

#include <algorithm>
#include <set>

namespace quarvel {

namespace {

/// A value as it is written in the file, or the name of its kind.
std::string DescribeNode(const toml::node& node) {
  if (const auto* integer = node.as_integer()) return fmt::format("{}", integer->get());
  if (const auto* text = node.as_string()) return fmt::format("\"{}\"", text->get());
  if (const auto* boolean = node.as_boolean()) return fmt::format("{}", boolean->get());
  if (const auto* real = node.as_floating_point()) return fmt::format("the real {}", real->get());
  if (node.is_array()) return "a list";
  if (node.is_table()) return "a table";
  return "a date or time";
}

/// The first error of a file, and its warnings.
class Findings {
 public:
  Findings(const std::filesystem::path& file, std::vector<std::string>& warnings)
      : file_(file.native()), warnings_(warnings) {}

  [[nodiscard]] const std::optional<Error>& error() const { return error_; }

  void syntaxError(const toml::parse_error& error) {
    add(fmt::format("{}:{}: {}", file_, error.source().begin.line, error.description()));
  }
  void wrongValue(const std::string& key, const toml::node& node, std::string_view allowed) {
    add(fmt::format("{}:{}: {} must be {}, but is {}.", file_, node.source().begin.line, key,
                    allowed, DescribeNode(node)));
  }
  void missingKey(const toml::table& table, const std::string& key) {
    add(fmt::format("{}:{}: {} is missing.", file_, table.source().begin.line, key));
  }
  void unknownKey(const std::string& key, const toml::key& place) {
    warnings_.push_back(
        fmt::format("{}:{}: {} is no key of ours.", file_, place.source().begin.line, key));
  }

 private:
  void add(std::string reason) {
    if (!error_) error_ = Error::because("quarvel.configuration", 1, std::move(reason));
  }

  const std::string file_;
  std::vector<std::string>& warnings_;
  std::optional<Error> error_;
};

}  // namespace

struct ConfigurationSection::State {
  Findings& findings;
  const toml::table* const table;  // null: the section is absent
  const std::string name;
  std::set<std::string, std::less<>> known{};

  ~State() {
    if (table == nullptr) return;
    for (const auto& [key, node] : *table) {
      if (!known.contains(key.str())) findings.unknownKey(path(key.str()), key);
    }
  }

  [[nodiscard]] std::string path(std::string_view key) const {
    return name.empty() ? std::string(key) : fmt::format("{}.{}", name, key);
  }
  const toml::node* find(std::string_view key) {
    known.emplace(key);
    return table == nullptr ? nullptr : table->get(key);
  }
  void wrongValue(std::string_view key, const toml::node& node, std::string_view allowed) {
    findings.wrongValue(path(key), node, allowed);
  }

  template <class Kind, class Out>
  void readAs(std::string_view key, std::string_view allowed, Out& out) {
    const toml::node* const node = find(key);
    if (node == nullptr) return;
    if (const auto* const value = node->as<Kind>()) {
      out = value->get();
    } else {
      wrongValue(key, *node, allowed);
    }
  }
};

ConfigurationSection::ConfigurationSection(std::unique_ptr<State> state)
    : state_(std::move(state)) {}
ConfigurationSection::ConfigurationSection(ConfigurationSection&& other) noexcept = default;
ConfigurationSection::~ConfigurationSection() = default;

void ConfigurationSection::read(std::string_view key, bool& out) {
  state_->readAs<bool>(key, "true or false", out);
}

void ConfigurationSection::read(std::string_view key, std::string& out) {
  state_->readAs<std::string>(key, "a string", out);
}

void ConfigurationSection::read(std::string_view key, std::filesystem::path& out) {
  state_->readAs<std::string>(key, "a string, a path", out);
}

void ConfigurationSection::read(std::string_view key, std::string_view allowed,
                                const IsAllowed& isAllowed, std::string& out) {
  const toml::node* const node = state_->find(key);
  if (node == nullptr) return;
  const auto* const text = node->as_string();
  if (text == nullptr || !isAllowed(text->get())) {
    return state_->wrongValue(key, *node, allowed);
  }
  out = text->get();
}

void ConfigurationSection::read(std::string_view key, std::string_view allowed,
                                const IsAllowed& isAllowed, std::vector<std::string>& out) {
  const toml::node* const node = state_->find(key);
  if (node == nullptr) return;
  const toml::array* const list = node->as_array();
  if (list == nullptr) return state_->wrongValue(key, *node, allowed);
  std::vector<std::string> read;
  for (const toml::node& item : *list) {
    const auto* const text = item.as_string();
    if (text == nullptr || !isAllowed(text->get()) ||
        std::ranges::find(read, text->get()) != read.end()) {
      return state_->wrongValue(fmt::format("{}[{}]", key, read.size()), item, allowed);
    }
    read.push_back(text->get());
  }
  out = std::move(read);
}

void ConfigurationSection::read(std::string_view key, std::string_view allowed,
                                const IsAllowedPair& isAllowed,
                                std::map<std::string, std::string>& out) {
  const toml::node* const node = state_->find(key);
  if (node == nullptr) return;
  const toml::table* const names = node->as_table();
  if (names == nullptr) return state_->wrongValue(key, *node, "a table");
  out.clear();
  for (const auto& [name, value] : *names) {
    const auto* const text = value.as_string();
    if (text == nullptr || !isAllowed(name.str(), text->get())) {
      return state_->wrongValue(fmt::format("{}.{}", key, name.str()), value, allowed);
    }
    out.emplace(name.str(), text->get());
  }
}

void ConfigurationSection::readAll(std::map<std::string, Scalar, std::less<>>& out) {
  if (state_->table == nullptr) return;
  for (const auto& [key, node] : *state_->table) {
    std::string name(key.str());
    state_->known.insert(name);
    if (const auto* boolean = node.as_boolean()) {
      out.insert_or_assign(std::move(name), boolean->get());
    } else if (const auto* integer = node.as_integer()) {
      out.insert_or_assign(std::move(name), integer->get());
    } else if (const auto* text = node.as_string()) {
      out.insert_or_assign(std::move(name), text->get());
    } else {
      state_->wrongValue(name, node, "a boolean, an integer or a string");
    }
  }
}

ConfigurationSection ConfigurationSection::section(std::string_view key) {
  const toml::node* const node = state_->find(key);
  const toml::table* const table = node == nullptr ? nullptr : node->as_table();
  if (node != nullptr && table == nullptr) state_->wrongValue(key, *node, "a table");
  return ConfigurationSection(
      std::unique_ptr<State>(new State{state_->findings, table, state_->path(key)}));
}

std::vector<ConfigurationSection> ConfigurationSection::sections(std::string_view key) {
  const toml::node* const node = state_->find(key);
  if (node == nullptr) return {};
  std::vector<ConfigurationSection> sections;
  const toml::array* const list = node->as_array();
  if (list == nullptr || !list->is_homogeneous(toml::node_type::table)) {
    state_->wrongValue(key, *node, "tables, each [[" + state_->path(key) + "]]");
    return sections;
  }
  for (const toml::node& item : *list) {
    sections.push_back(ConfigurationSection(
        std::unique_ptr<State>(new State{state_->findings, item.as_table(), state_->path(key)})));
  }
  return sections;
}

void ConfigurationSection::require(std::string_view key, bool isGiven) {
  if (!isGiven) state_->findings.missingKey(*state_->table, state_->path(key));
}

std::optional<std::int64_t> ConfigurationSection::readInteger(std::string_view key,
                                                              std::int64_t least,
                                                              std::int64_t most) {
  const toml::node* const node = state_->find(key);
  if (node == nullptr) return std::nullopt;
  const auto* const value = node->as_integer();
  if (value != nullptr && value->get() >= least && value->get() <= most) return value->get();
  state_->wrongValue(key, *node,
                     most == kAnyPositive ? fmt::format("an integer of at least {}", least)
                                          : fmt::format("an integer from {} to {}", least, most));
  return std::nullopt;
}

std::optional<std::size_t> ConfigurationSection::readChoice(
    std::string_view key, std::span<const std::string_view> names) {
  const toml::node* const node = state_->find(key);
  if (node == nullptr) return std::nullopt;
  if (const auto* const text = node->as_string()) {
    const auto found = std::ranges::find(names, text->get());
    if (found != names.end()) return static_cast<std::size_t>(found - names.begin());
  }
  state_->wrongValue(key, *node, fmt::format("one of \"{}\"", fmt::join(names, "\", \"")));
  return std::nullopt;
}

std::optional<Error> ReadConfigurationText(
    std::string_view text, const std::filesystem::path& file,
    const std::function<void(ConfigurationSection& root)>& read,
    std::vector<std::string>& warnings) {
  Findings findings(file, warnings);
  try {
    const toml::table table = toml::parse(text, file.native());
    ConfigurationSection root(std::unique_ptr<ConfigurationSection::State>(
        new ConfigurationSection::State{findings, &table, ""}));
    read(root);
  } catch (const toml::parse_error& error) {
    findings.syntaxError(error);
  }
  return findings.error();
}

}  // namespace quarvel
