#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "base/Value.h"

namespace quarvel {

/// A preferences domain as it was when it was opened: keys to strings, numbers and booleans. A
/// value type; one thread at a time.
class PreferencesDomain {
 public:
  PreferencesDomain() = default;
  explicit PreferencesDomain(Dictionary entries) : entries_(std::move(entries)) {}

  [[nodiscard]] bool hasValue(std::string_view key) const { return entries_.find(key) != nullptr; }
  /// A number yields its text. None when there is no value, or it is neither string nor number.
  [[nodiscard]] std::optional<std::string> string(std::string_view key) const;
  /// A number is true unless it is zero; of the strings only "true", "yes", "on" and "1" are true,
  /// in any case. False when there is no value.
  [[nodiscard]] bool boolean(std::string_view key) const;

 private:
  Dictionary entries_;
};

/// Opens a domain by its name and reads it as it is now; nothing is cached. A domain that does not
/// exist has no values.
/// When what is stored cannot be understood, the domain has the values that could last be read,
/// none if there never were any, and an error line says what is wrong: so a slip of the pen changes
/// no setting. From any thread; reads a small file at most.
[[nodiscard]] PreferencesDomain OpenPreferencesDomain(std::string_view name);

}  // namespace quarvel
