#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cmath>
#include <filesystem>

#include <quarvel/client.hpp>

#include "base/Json.h"
#include "tools/Commands.h"
#include "tools/PreferencesFile.h"
#include "tools/Table.h"

namespace quarvel::commands {
namespace {

using std::filesystem::path;

template <class Number>
std::optional<Number> Read(std::string_view text) {
  Number number{};
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return number;
}

// What somebody means who types this. What a number would not keep as it is stays a string: 007,
// and integers beyond 64 bits.
Value Meant(const std::string& text) {
  if (text == "true" || text == "false") return text == "true";
  const std::size_t first = text.starts_with('-') ? 1 : 0;
  const bool padded = text.size() > first + 1 && text[first] == '0' && text[first + 1] != '.';
  if (padded) return text;
  if (const auto integer = Read<std::int64_t>(text)) return *integer;
  if (text.find_first_of(".eE") == std::string::npos) return text;
  if (const auto real = Read<double>(text); real && std::isfinite(*real)) return *real;
  return text;
}

Error NotSet(const PreferencesFile& file, const std::string& key) {
  return Error::because("quarvel.preferences", 2,
                        fmt::format("\"{}\" is not set in {}.", key, file.path().native()));
}

Outcome Changed(const Options& options, const DefaultsOptions& which, const PreferencesFile& file) {
  const Value* value = file.entries().find(which.key);
  if (options.json) {
    fmt::print("{}\n", JsonText(Dictionary{{"file", file.path().native()},
                                           {"key", which.key},
                                           {"value", value ? *value : Value()}}));
  } else {
    fmt::print("{} in {}.{}\n",
               value ? fmt::format("\"{}\" is now {}", which.key, JsonText(*value))
                     : fmt::format("\"{}\" is no longer set", which.key),
               file.path().native(),
               which.notify ? "" : " \"quarvelctl notify\" makes the service read it.");
  }
  return which.notify ? Notify(options, kReportingNotification) : Success();
}

/// Where the service takes notifications: beside its socket, unless only the socket is elsewhere.
path NotifyDirectory(const Options& options) {
  const path socket = options.socket.empty() ? Client::defaultSocketPath() : options.socket;
  const path beside = socket.parent_path() / "notify";
  std::vector<path> candidates{beside};
  if (const char* own = std::getenv("RUNTIME_DIRECTORY")) {
    const std::string_view directories = own;
    candidates.push_back(path(directories.substr(0, directories.find(':'))) / "notify");
  }
  if (const char* user = std::getenv("XDG_RUNTIME_DIR"); user && ::geteuid() != 0) {
    candidates.push_back(path(user) / "quarvel/notify");
  }
  for (const path& candidate : candidates) {
    if (::access(candidate.c_str(), F_OK) == 0) return candidate;
  }
  return beside;
}

std::string WhyNotPosted(const path& directory, int error) {
  if (error == ENOENT || error == ENOTDIR) {
    return fmt::format(
        "The service is not running: there is no directory {}. It reads its preferences when it "
        "starts; if its runtime directory is elsewhere, name it in RUNTIME_DIRECTORY.",
        directory.native());
  }
  return fmt::format("{} cannot be written: {}.{}", directory.native(),
                     std::generic_category().message(error),
                     error == EACCES ? " Try it as root or as the service's user." : "");
}

}  // namespace

Outcome DefaultsRead(const Options& options, const DefaultsOptions& which) {
  const auto file = PreferencesFile::open(PreferencesFile::pathOf(which.domain));
  if (!file) return file.error();
  const Dictionary& entries = file.value().entries();
  if (!which.key.empty()) {
    const Value* value = entries.find(which.key);
    if (value == nullptr) return NotSet(file.value(), which.key);
    const std::string* text = options.json ? nullptr : value->string();
    fmt::print("{}\n", text ? *text : JsonText(*value));
    return Success();
  }
  if (options.json) {
    fmt::print("{}\n", JsonText(entries));
  } else if (entries.empty()) {
    fmt::print(stderr, "Nothing is set in {}.\n", file.value().path().native());
  } else {
    Table table({{"KEY"}, {"VALUE"}}, Terminal::standardOutput());
    for (const auto& [key, value] : entries) table.add({*key.string(), JsonText(value)});
    table.print();
  }
  return Success();
}

Outcome DefaultsWrite(const Options& options, const DefaultsOptions& which) {
  auto file = PreferencesFile::open(PreferencesFile::pathOf(which.domain));
  if (!file) return std::move(file.error());
  const Value value = which.string ? Value(which.value) : Meant(which.value);
  if (auto set = file.value().set(which.key, value); !set) return set;
  return Changed(options, which, file.value());
}

Outcome DefaultsDelete(const Options& options, const DefaultsOptions& which) {
  auto file = PreferencesFile::open(PreferencesFile::pathOf(which.domain));
  if (!file) return std::move(file.error());
  if (file.value().entries().find(which.key) == nullptr) return NotSet(file.value(), which.key);
  if (auto removed = file.value().remove(which.key); !removed) return removed;
  return Changed(options, which, file.value());
}

Outcome Notify(const Options& options, const std::string& name) {
  const path directory = NotifyDirectory(options);
  const path file = directory / name;
  const int posted =
      ::open(file.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0644);
  if (posted < 0 || ::futimens(posted, nullptr) != 0) {
    const int error = errno;
    if (posted >= 0) ::close(posted);
    return Error::because("quarvel.notification", 1, WhyNotPosted(directory, error));
  }
  ::close(posted);
  if (options.json) {
    fmt::print("{}\n", JsonText(Dictionary{{"notification", name}, {"file", file.native()}}));
  } else {
    fmt::print("{} is posted.\n", name);
  }
  return Success();
}

}  // namespace quarvel::commands
