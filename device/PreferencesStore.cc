#include "device/PreferencesStore.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <toml++/toml.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>
#include <utility>

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

/// Nil when the node is neither string, number nor boolean.
Value flatValue(const toml::node& node) {
  if (const auto* text = node.as_string()) return text->get();
  if (const auto* integer = node.as_integer()) return integer->get();
  if (const auto* real = node.as_floating_point()) return real->get();
  if (const auto* boolean = node.as_boolean()) return boolean->get();
  return nullptr;
}

/// The whole of a small file; an absent file is empty.
Result<std::string> contentOf(const std::filesystem::path& file) {
  const int descriptor = ::open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
  if (descriptor < 0 && errno == ENOENT) return std::string();
  if (descriptor < 0) return preferencesError(file, std::generic_category().message(errno));
  std::string content(PreferencesStore::kMaximumBytes + 1, '\0');
  std::size_t length = 0;
  ssize_t count = 0;
  do {
    count = ::read(descriptor, content.data() + length, content.size() - length);
    if (count > 0) length += static_cast<std::size_t>(count);
  } while (count > 0 || (count < 0 && errno == EINTR));
  const int status = count < 0 ? errno : 0;
  ::close(descriptor);
  if (status != 0) return preferencesError(file, std::generic_category().message(status));
  if (length > PreferencesStore::kMaximumBytes) {
    return preferencesError(
        file, fmt::format("longer than the {} bytes allowed", PreferencesStore::kMaximumBytes));
  }
  content.resize(length);
  return content;
}

Result<Dictionary> readDomain(const std::filesystem::path& file) {
  const Result<std::string> content = contentOf(file);
  if (!content) return content.error();
  return PreferencesFromText(content.value(), file);
}

}  // namespace

Result<Dictionary> PreferencesFromText(std::string_view text, const std::filesystem::path& file) {
  try {
    Dictionary entries;
    for (const auto& [key, node] : toml::parse(text)) {
      Value value = flatValue(node);
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
