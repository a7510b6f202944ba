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
/// and booleans. From any thread.
class PreferencesStore {
 public:
  static constexpr std::size_t kMaximumBytes = 65'536;

  explicit PreferencesStore(std::filesystem::path directory) : directory_(std::move(directory)) {}

  /// As `OpenPreferencesDomain`. The same fault is logged once, until the file was right
  /// again.
  [[nodiscard]] PreferencesDomain open(std::string_view name);

 private:
  struct Domain {
    Dictionary lastUnderstood;
    std::string lastFault;  // as it was logged; empty while all is well
  };

  const std::filesystem::path directory_;
  Mutex mutex_;  // held while a file is read
  std::map<std::string, Domain, std::less<>> domains_ QUARVEL_GUARDED_BY(mutex_);
};

/// Reads the text of a preferences file. Errors: domain "quarvel.preferences", code 1; the reason
/// is
/// "<file>:<line>: " and what is wrong and allowed.
[[nodiscard]] Result<Dictionary> PreferencesFromText(std::string_view text,
                                                     const std::filesystem::path& file);

}  // namespace quarvel
