#include "tools/PreferencesFile.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <toml++/toml.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <fstream>
#include <sstream>
#include <utility>

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

// Nil for what is not allowed.
Value FlatValue(const toml::node& node) {
  if (const auto* text = node.as_string()) return text->get();
  if (const auto* integer = node.as_integer()) return integer->get();
  if (const auto* real = node.as_floating_point()) return real->get();
  if (const auto* boolean = node.as_boolean()) return boolean->get();
  return nullptr;
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

Outcome WriteAll(int descriptor, std::string_view text) {
  while (!text.empty()) {
    const ssize_t count = ::write(descriptor, text.data(), text.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return Failed({});
    text.remove_prefix(static_cast<std::size_t>(count));
  }
  return Success();
}

/// Its mode stays, and for root its owner; a new file is for all to read.
Outcome WriteWhole(path file, std::string_view text) {
  std::error_code error;
  // The file that a link stands for, not the link.
  if (const path real = std::filesystem::canonical(file, error); !error) file = real;
  std::filesystem::create_directories(file.parent_path(), error);
  if (error) return CannotBe(file.parent_path(), "made", error.value());

  std::string temporary = file.parent_path() / ("." + file.filename().native() + ".XXXXXX");
  const int descriptor = ::mkostemp(temporary.data(), O_CLOEXEC);
  if (descriptor < 0) return CannotBe(file, "written", errno);
  struct stat old {};
  const bool replaces = ::stat(file.c_str(), &old) == 0;
  // Only root may give a file away; anybody else's becomes their own.
  if (replaces && ::geteuid() == 0 && ::fchown(descriptor, old.st_uid, old.st_gid) != 0) {
    const int refused = errno;
    ::close(descriptor);
    ::unlink(temporary.c_str());
    return CannotBe(file, "written", refused);
  }
  const bool written = ::fchmod(descriptor, replaces ? old.st_mode & 0777 : 0644) == 0 &&
                       WriteAll(descriptor, text) && ::fsync(descriptor) == 0;
  const int fault = written ? 0 : errno;
  ::close(descriptor);
  if (written && ::rename(temporary.c_str(), file.c_str()) == 0) return Success();
  const int reason = written ? errno : fault;
  ::unlink(temporary.c_str());
  return CannotBe(file, "written", reason);
}

path Variable(const char* name) {
  const char* value = std::getenv(name);
  return value == nullptr ? path() : path(value);
}

}  // namespace

PreferencesFile::PreferencesFile(std::filesystem::path path, std::string text, Dictionary entries)
    : path_(std::move(path)), text_(std::move(text)), entries_(std::move(entries)) {}

std::filesystem::path PreferencesFile::pathOf(std::string_view domain) {
  const std::string own = Variable("CONFIGURATION_DIRECTORY").native();
  std::filesystem::path directory = own.substr(0, own.find(':'));
  if (directory.empty() && ::geteuid() == 0) directory = "/etc/quarvel";
  if (directory.empty()) {
    const auto user = Variable("XDG_CONFIG_HOME");
    directory = (user.is_absolute() ? user : Variable("HOME") / ".config") / "quarvel";
  }
  return directory / "preferences" / fmt::format("{}.toml", domain);
}

Result<PreferencesFile> PreferencesFile::open(std::filesystem::path path) {
  std::string text;
  errno = 0;
  std::ifstream in(path, std::ios::binary);
  if (!in && errno != ENOENT) return CannotBe(path, "read", errno);
  char piece[4'096];
  while (in.read(piece, sizeof piece), in.gcount() > 0) {
    text.append(piece, static_cast<std::size_t>(in.gcount()));
  }
  if (in.bad()) return CannotBe(path, "read", errno);
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
  // The text was changed by lines: it is written only when that did what was meant.
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
