#include "tools/PreferencesFile.h"

#include <fmt/format.h>
#include <toml++/toml.h>

#include <cerrno>
#include <sstream>
#include <utility>

#include "base/Files.h"
#include "base/FlatValue.h"
#include "base/StandardPaths.h"
#include "base/Utf8.h"

namespace quarvel {
namespace {

using std::filesystem::path;

Error Failed(std::string reason) {
  return Error::because("quarvel.preferences", 1, std::move(reason));
}

Error CannotBe(const path& file, std::string_view what, int error) {
  return Failed(fmt::format("{} cannot be {}: {}.{}", file.native(), what,
                            std::generic_category().message(error),
                            error == EACCES ? " Try it as root." : ""));
}

Result<toml::table> Parsed(const std::string& text, const path& file) {
  const auto fault = [&](const toml::source_region& place, std::string_view reason) {
    return Failed(fmt::format("{}:{}: {}. The file is left as it is; correct or remove that line.",
                              file.native(), place.begin.line, reason));
  };
  try {
    toml::table table = toml::parse(text);
    for (const auto& [key, node] : table) {
      if (FlatValue(node).isNil()) {
        return fault(key.source(),
                     fmt::format("\"{}\" must be a string, a number or a boolean", key.str()));
      }
    }
    return table;
  } catch (const toml::parse_error& error) {
    return fault(error.source(), error.description());
  }
}

Dictionary EntriesOf(const toml::table& table) {
  Dictionary entries;
  for (const auto& [key, node] : table) entries.set(key.str(), FlatValue(node));
  return entries;
}

// `key = value` as a line of its own.
std::string LineOf(const std::string& key, const Value& value) {
  toml::table table;
  if (value.boolean()) table.insert(key, *value.boolean());
  if (value.integer()) table.insert(key, *value.integer());
  if (value.real()) table.insert(key, *value.real());
  if (value.string()) table.insert(key, *value.string());
  std::ostringstream line;
  line << toml::toml_formatter(table, toml::format_flags::none);
  return line.str() + "\n";
}

// Where a line begins; lines are counted from 1.
std::size_t OffsetOf(const std::string& text, std::size_t line) {
  std::size_t offset = 0;
  for (std::size_t i = 1; i < line && offset < text.size(); ++i) {
    const std::size_t end = text.find('\n', offset);
    offset = end == std::string::npos ? text.size() : end + 1;
  }
  return offset;
}

/// The text without the lines of an entry, and where they were.
std::pair<std::string, std::size_t> Without(std::string text, const toml::table& table,
                                            const std::string& key) {
  const auto entry = table.find(key);
  if (entry == table.end()) {
    if (!text.empty() && !text.ends_with('\n')) text.push_back('\n');
    const std::size_t end = text.size();
    return {std::move(text), end};
  }
  const std::size_t begin = OffsetOf(text, entry->first.source().begin.line);
  text.erase(begin, OffsetOf(text, entry->second.source().end.line + 1) - begin);
  return {std::move(text), begin};
}

/// A new file is for all to read.
Outcome WriteWhole(const path& file, std::string_view text) {
  constexpr mode_t kReadable = 0644;
  std::error_code error;
  std::filesystem::create_directories(file.parent_path(), error);
  if (error) return CannotBe(file.parent_path(), "made", error.value());
  const auto written = RewriteFile(file, text, kReadable);
  if (written) return Success();
  return CannotBe(file, "written", static_cast<int>(written.error().code));
}

}  // namespace

PreferencesFile::PreferencesFile(std::filesystem::path path, std::string text, Dictionary entries)
    : path_(std::move(path)), text_(std::move(text)), entries_(std::move(entries)) {}

std::filesystem::path PreferencesFile::pathOf(std::string_view domain) {
  const std::filesystem::path directory = StandardPaths::fromEnvironment().configuration;
  return directory / "preferences" / fmt::format("{}.toml", domain);
}

Result<PreferencesFile> PreferencesFile::open(std::filesystem::path path) {
  auto read = ReadWholeFile(path);
  if (!read && read.error().code != ENOENT) {
    return CannotBe(path, "read", static_cast<int>(read.error().code));
  }
  std::string text = read ? std::move(read.value()) : std::string();
  auto table = Parsed(text, path);
  if (!table) return std::move(table.error());
  return PreferencesFile(std::move(path), std::move(text), EntriesOf(table.value()));
}

Outcome PreferencesFile::set(const std::string& key, const Value& value) {
  const std::string* string = value.string();
  if (!IsUtf8(key) || (string && !IsUtf8(*string))) {
    return Failed("A key or a string that is not UTF-8 cannot be kept.");
  }
  const auto table = Parsed(text_, path_);
  if (!table) return table.error();
  auto [text, offset] = Without(text_, table.value(), key);
  text.insert(offset, LineOf(key, value));
  return replace(std::move(text), key, &value);
}

Outcome PreferencesFile::remove(const std::string& key) {
  const auto table = Parsed(text_, path_);
  if (!table) return table.error();
  return replace(Without(text_, table.value(), key).first, key, nullptr);
}

Outcome PreferencesFile::replace(std::string text, const std::string& key, const Value* value) {
  Dictionary expected;
  for (const auto& [name, kept] : entries_) {
    if (name != Key(key)) expected.set(name, kept);
  }
  if (value) expected.set(key, *value);
  // Lines were edited as text: write them only when they parse to the intended entries.
  const auto table = Parsed(text, path_);
  if (!table || EntriesOf(table.value()) != expected) {
    return Failed(fmt::format("{} cannot be changed safely; edit it by hand.", path_.native()));
  }
  if (auto written = WriteWhole(path_, text); !written) return written;
  text_ = std::move(text);
  entries_ = std::move(expected);
  return Success();
}

}  // namespace quarvel
