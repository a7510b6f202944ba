#include "device/PreferencesStore.h"

#include <fmt/format.h>
#include <toml++/toml.h>

#include <cerrno>
#include <system_error>
#include <utility>

#include "base/Files.h"
#include "base/FlatValue.h"
#include "platform/Log.h"

namespace quarvel {

namespace {

Error preferencesError(const std::filesystem::path& file, std::string_view fault) {
  return Error::because("quarvel.preferences", 1, fmt::format("{}: {}", file.native(), fault));
}

Error preferencesError(const std::filesystem::path& file, const toml::source_region& place,
                       std::string_view fault) {
  return Error::because("quarvel.preferences", 1,
                        fmt::format("{}:{}: {}", file.native(), place.begin.line, fault));
}

Result<Dictionary> readDomain(const std::filesystem::path& file) {
  const Result<std::string> content = ReadWholeFile(file, PreferencesStore::kMaximumBytes);
  if (content) return PreferencesFromText(content.value(), file);
  const auto status = static_cast<int>(content.error().code);
  if (status == ENOENT) return Dictionary();
  if (status == EFBIG) {
    return preferencesError(
        file, fmt::format("longer than the {} bytes allowed", PreferencesStore::kMaximumBytes));
  }
  return preferencesError(file, std::generic_category().message(status));
}

}  // namespace

Result<Dictionary> PreferencesFromText(std::string_view text, const std::filesystem::path& file) {
  try {
    Dictionary entries;
    for (const auto& [key, node] : toml::parse(text)) {
      Value value = FlatValue(node);
      if (value.isNil()) {
        return preferencesError(
            file, node.source(),
            fmt::format("\"{}\" must be a string, a number or a boolean", key.str()));
      }
      entries.set(key.str(), std::move(value));
    }
    return entries;
  } catch (const toml::parse_error& error) {
    return preferencesError(file, error.source(), error.description());
  }
}

PreferencesDomain PreferencesStore::open(std::string_view name) {
  ZQ_FUNCTION("OpenPreferencesDomain");
  const MutexLock lock(mutex_);
  Result<Dictionary> read = readDomain(directory_ / fmt::format("{}.toml", name));
  Domain& domain = domains_[std::string(name)];
  if (read) {
    domain.lastError.clear();
    domain.lastValid = std::move(read.value());
  } else if (std::string fault = read.error().description(); fault != domain.lastError) {
    ZQ_LOG(nullptr, error, "{}; the preferences stay as they were", fault);
    domain.lastError = std::move(fault);
  }
  return PreferencesDomain(domain.lastValid);
}

}  // namespace quarvel
