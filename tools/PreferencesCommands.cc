#include <fmt/format.h>

#include <charconv>
#include <cmath>

#include "base/Json.h"
#include "tools/Commands.h"
#include "tools/PreferencesFile.h"
#include "tools/ServiceFiles.h"
#include "tools/Table.h"

namespace quarvel::commands {
namespace {

template <class Number>
std::optional<Number> Read(std::string_view text) {
  Number number{};
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return number;
}

// The value that a person means by this text. A text that a number would not preserve stays a
// string: 007, and integers beyond 64 bits.
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
  const auto posted = Post(options, name);
  if (!posted) return posted.error();
  if (options.json) {
    fmt::print("{}\n",
               JsonText(Dictionary{{"notification", name}, {"file", posted.value().native()}}));
  } else {
    fmt::print("{} is posted.\n", name);
  }
  return Success();
}

}  // namespace quarvel::commands
