#pragma once

#include <filesystem>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "base/Value.h"

namespace quarvel {

/// One domain of preferences: a file of flat keys with strings, numbers and booleans. A change
/// leaves every other line as somebody wrote it, comments included. For one thread.
/// Errors: domain "quarvel.preferences", with a reason that names file and line.
class PreferencesFile {
 public:
  /// preferences/`domain`.toml in the service's configuration directory.
  [[nodiscard]] static std::filesystem::path pathOf(std::string_view domain);
  /// Reads it; one that is not there is empty. Errors: what the service could not understand.
  [[nodiscard]] static Result<PreferencesFile> open(std::filesystem::path path);

  [[nodiscard]] const std::filesystem::path& path() const { return path_; }
  [[nodiscard]] const Dictionary& entries() const { return entries_; }

  /// Both write the file at once and whole: whoever reads it meanwhile sees the old or the new one.
  [[nodiscard]] Outcome set(const std::string& key, const Value& value);
  /// Precondition: there is such a key.
  [[nodiscard]] Outcome remove(const std::string& key);

 private:
  PreferencesFile(std::filesystem::path path, std::string text, Dictionary entries);

  [[nodiscard]] Outcome replace(std::string text, const std::string& key, const Value* value);

  std::filesystem::path path_;
  std::string text_;
  Dictionary entries_;
};

}  // namespace quarvel
