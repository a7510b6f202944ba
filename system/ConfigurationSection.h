#pragma once

#include <fmt/format.h>
#include <fmt/ranges.h>
#include <toml++/toml.h>

#include <algorithm>
#include <chrono>
#include <concepts>
#include <cstdint>
#include <filesystem>
#include <initializer_list>
#include <limits>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "base/Error.h"

// How the tables of quarvel.toml are read. For Configuration.cc.

namespace quarvel::configuration {

inline constexpr std::int64_t kAnyPositive = std::numeric_limits<std::int64_t>::max();

/// A value as a person would write it, or what kind it is of.
inline std::string described(const toml::node& node) {
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

  /// A string that `admits`.
  template <class Admits>
  void read(std::string_view key, std::string_view allowed, Admits admits, std::string& out) {
    const toml::node* const node = find(key);
    if (node == nullptr) return;
    const auto* const text = node->as_string();
    if (text == nullptr || !admits(text->get())) {
      return findings_.wrongValue(path(key), *node, allowed);
    }
    out = text->get();
  }

  /// A table of names to strings, each pair of which `admits`.
  template <class Admits>
  void read(std::string_view key, std::string_view allowed, Admits admits,
            std::map<std::string, std::string>& out) {
    const toml::table* const names = table(key);
    if (names == nullptr) return;
    out.clear();
    for (const auto& [name, node] : *names) {
      const auto* const text = node.as_string();
      if (text == nullptr || !admits(name.str(), text->get())) {
        return findings_.wrongValue(fmt::format("{}.{}", path(key), name.str()), node, allowed);
      }
      out.emplace(name.str(), text->get());
    }
  }

  template <std::integral Number>
  void read(std::string_view key, std::int64_t least, std::int64_t most, Number& out) {
    if (const auto number = integer(key, least, most)) out = static_cast<Number>(*number);
  }

  /// A duration, in the unit that ends its key: `_ms`, `_seconds` or `_days`.
  template <class Rep, class Period>
  void read(std::string_view key, std::int64_t least, std::int64_t most,
            std::chrono::duration<Rep, Period>& out) {
    using std::chrono::milliseconds;
    const milliseconds unit = key.ends_with("_ms")        ? milliseconds(1)
                              : key.ends_with("_seconds") ? std::chrono::seconds(1)
                                                          : std::chrono::days(1);
    if (const auto number = integer(key, least, most)) {
      out = std::chrono::duration_cast<std::chrono::duration<Rep, Period>>(*number * unit);
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

  std::optional<std::int64_t> integer(std::string_view key, std::int64_t least, std::int64_t most) {
    const toml::node* const node = find(key);
    if (node == nullptr) return std::nullopt;
    const auto* const value = node->as_integer();
    if (value != nullptr && value->get() >= least && value->get() <= most) return value->get();
    findings_.wrongValue(path(key), *node,
                         most == kAnyPositive
                             ? fmt::format("an integer of at least {}", least)
                             : fmt::format("an integer from {} to {}", least, most));
    return std::nullopt;
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

}  // namespace quarvel::configuration
