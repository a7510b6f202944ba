#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "base/Value.h"

namespace quarvel {

/// The content of a preferences domain when it was opened: keys to strings, numbers and booleans. A
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

/// Reads a domain afresh; nothing is cached. A domain that does not exist has no values.
///
/// When the stored text is malformed, an error line names the fault and the domain has the values
/// of its last good version, if any: a typing error changes no setting. From any thread; may block
/// for the reading of one small file.
[[nodiscard]] PreferencesDomain OpenPreferencesDomain(std::string_view name);

}  // namespace quarvel
