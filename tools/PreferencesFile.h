#pragma once

#include <filesystem>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "base/Value.h"

namespace quarvel {

/// One domain of preferences: a file of flat keys with strings, numbers and booleans. A change
/// leaves every other line untouched, comments included. Owned by one command; one thread. Errors:
/// domain "quarvel.preferences", with a reason that names file and line.
class PreferencesFile {
 public:
  /// preferences/`domain`.toml in the service's configuration directory.
  [[nodiscard]] static std::filesystem::path pathOf(std::string_view domain);
  /// Reads the file; an absent file is empty. Errors: a file that the service could not read
  /// either.
  [[nodiscard]] static Result<PreferencesFile> open(std::filesystem::path path);

  /// The file, which need not exist.
  [[nodiscard]] const std::filesystem::path& path() const { return path_; }
  /// The values as the service reads them, with the changes made here.
  [[nodiscard]] const Dictionary& entries() const { return entries_; }

  /// Both write the file at once: a reader sees the old file or the new one, never a part.
  [[nodiscard]] Outcome set(const std::string& key, const Value& value);
  /// Precondition: the key is set.
  [[nodiscard]] Outcome remove(const std::string& key);

 private:
  PreferencesFile(std::filesystem::path path, std::string text, Dictionary entries);

  /// Writes `text` when it parses to the entries with this one change; null: the key is removed.
  [[nodiscard]] Outcome replace(std::string text, const std::string& key, const Value* value);

  std::filesystem::path path_;
  std::string text_;
  Dictionary entries_;
};

}  // namespace quarvel
