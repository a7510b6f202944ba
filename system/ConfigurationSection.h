#pragma once

#include <chrono>
#include <concepts>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <initializer_list>
#include <limits>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "base/Error.h"

namespace quarvel {

/// One table of quarvel.toml, which may be absent. Reads and checks the values of its keys.
///
/// An absent key leaves its destination unchanged, and so does a wrong value, which is an error of
/// the whole file. Keys that were not read when the section is destroyed are unknown keys: a
/// warning each. Made by `ReadConfigurationText` and by its parent section; must not outlive them.
/// One thread.
class ConfigurationSection {
 public:
  /// Checks one string; the error text says which ones it admits.
  using IsAllowed = std::function<bool(std::string_view value)>;
  /// Checks an entry of a table of strings.
  using IsAllowedPair = std::function<bool(std::string_view name, std::string_view value)>;
  /// The kinds of value in sections with free keys.
  using Scalar = std::variant<bool, std::int64_t, std::string>;

  /// As the upper bound of an integer: none.
  static constexpr std::int64_t kAnyPositive = std::numeric_limits<std::int64_t>::max();

  /// `other` then reports no unknown keys.
  ConfigurationSection(ConfigurationSection&& other) noexcept;
  ConfigurationSection& operator=(ConfigurationSection&&) = delete;
  /// Reports the keys that were not read.
  ~ConfigurationSection();

  // Each `read` replaces `out` by the value of `key` if that is present and right.
  void read(std::string_view key, bool& out);
  void read(std::string_view key, std::string& out);
  void read(std::string_view key, std::filesystem::path& out);  // any string
  /// A string that `isAllowed` admits. `allowed` completes the error text "<key> must be ...", here
  /// and below.
  void read(std::string_view key, std::string_view allowed, const IsAllowed& isAllowed,
            std::string& out);
  /// A list of such strings, none twice.
  void read(std::string_view key, std::string_view allowed, const IsAllowed& isAllowed,
            std::vector<std::string>& out);
  /// A table of names to strings; a right one replaces all of `out`.
  void read(std::string_view key, std::string_view allowed, const IsAllowedPair& isAllowed,
            std::map<std::string, std::string>& out);

  /// An integer from `least` to `most`.
  template <std::integral Number>
  void read(std::string_view key, std::int64_t least, std::int64_t most, Number& out) {
    if (const auto number = readInteger(key, least, most)) out = static_cast<Number>(*number);
  }

  /// A duration from `least` to `most`, in the unit that ends its key: `_ms`, `_seconds`, `_days`.
  template <class Rep, class Period>
  void read(std::string_view key, std::int64_t least, std::int64_t most,
            std::chrono::duration<Rep, Period>& out) {
    const std::chrono::milliseconds unit = key.ends_with("_ms") ? std::chrono::milliseconds(1)
                                           : key.ends_with("_seconds") ? std::chrono::seconds(1)
                                                                       : std::chrono::days(1);
    if (const auto number = readInteger(key, least, most)) {
      out = std::chrono::duration_cast<std::chrono::duration<Rep, Period>>(*number * unit);
    }
  }

  /// One of several names, each with the value that it stands for.
  template <class Choice>
  void read(std::string_view key,
            std::initializer_list<std::pair<std::string_view, Choice>> choices, Choice& out) {
    std::vector<std::string_view> names;
    for (const auto& [name, choice] : choices) names.push_back(name);
    if (const auto chosen = readChoice(key, names)) out = (choices.begin() + *chosen)->second;
  }

  /// Every key of this section, which has no unknown ones: booleans, integers and strings.
  void readAll(std::map<std::string, Scalar, std::less<>>& out);

  /// The section below a key; an absent one when the key is absent or no table.
  [[nodiscard]] ConfigurationSection section(std::string_view key);
  /// The sections of a key that may come several times.
  [[nodiscard]] std::vector<ConfigurationSection> sections(std::string_view key);

  /// Reports `key` as missing unless `isGiven`.
  void require(std::string_view key, bool isGiven);

 private:
  friend std::optional<Error> ReadConfigurationText(
      std::string_view text, const std::filesystem::path& file,
      const std::function<void(ConfigurationSection& root)>& read,
      std::vector<std::string>& warnings);

  struct State;  // the parsed table, its name, and the place of errors and warnings
  explicit ConfigurationSection(std::unique_ptr<State> state);

  // None when the key is absent or its value wrong. `readChoice` returns an index in `names`.
  [[nodiscard]] std::optional<std::int64_t> readInteger(std::string_view key, std::int64_t least,
                                                        std::int64_t most);
  [[nodiscard]] std::optional<std::size_t> readChoice(std::string_view key,
                                                      std::span<const std::string_view> names);

  std::unique_ptr<State> state_;
};

/// Parses the TOML `text` of `file` and lets `read` read its root section. Appends a sentence to
/// `warnings` for each unknown key. Returns the first error: domain "quarvel.configuration", the
/// reason names file, line, key and the allowed values.
[[nodiscard]] std::optional<Error> ReadConfigurationText(
    std::string_view text, const std::filesystem::path& file,
    const std::function<void(ConfigurationSection& root)>& read,
    std::vector<std::string>& warnings);

}  // namespace quarvel
