#pragma once

#include <filesystem>
#include <map>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "base/Mutex.h"
#include "base/Value.h"
#include "platform/Preferences.h"

namespace quarvel {

/// Preferences domains as TOML files, `<directory>/<domain>.toml`: flat keys to strings, numbers
/// and booleans. One for each process, as long as the process. Any thread; a read waits for another
/// one to end.
class PreferencesStore {
 public:
  /// Larger files are an error: settings made by people are far below.
  static constexpr std::size_t kMaximumBytes = 65'536;

  /// Reads nothing yet. A directory that is missing means that no domain has values.
  explicit PreferencesStore(std::filesystem::path directory) : directory_(std::move(directory)) {}

  /// Reads the file of the domain `name` now and returns its values, which later changes of the
  /// file leave alone. While the file is wrong or unreadable, the last valid values. The same error
  /// is logged once, until the file is right again.
  [[nodiscard]] PreferencesDomain open(std::string_view name);

 private:
  /// A domain that has been opened.
  struct Domain {
    Dictionary lastValid;   // empty when the file is missing
    std::string lastError;  // as it was logged; empty while the file is right
  };

  const std::filesystem::path directory_;
  Mutex mutex_;  // held while a file is read
  std::map<std::string, Domain, std::less<>> domains_ QUARVEL_GUARDED_BY(mutex_);
};

/// Reads the text of a preferences file. Errors: domain "quarvel.preferences", code 1; the reason
/// names file and line and the allowed kinds.
[[nodiscard]] Result<Dictionary> PreferencesFromText(std::string_view text,
                                                     const std::filesystem::path& file);

}  // namespace quarvel
