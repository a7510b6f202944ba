#include "base/StandardPaths.h"

#include <pwd.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <string>

namespace quarvel {
namespace {

using std::filesystem::path;

struct Directory {
  const char* systemdVariable;
  const char* userVariable;
  const char* belowHome;  // null: below /run/user
  const char* installed;
};

// In the order of `StandardPaths::Kind`.
constexpr std::array<Directory, 3> kDirectories = {{
    {"RUNTIME_DIRECTORY", "XDG_RUNTIME_DIR", nullptr, "/run/quarvel"},
    {"STATE_DIRECTORY", "XDG_STATE_HOME", ".local/state", "/var/lib/quarvel"},
    {"CONFIGURATION_DIRECTORY", "XDG_CONFIG_HOME", ".config", "/etc/quarvel"},
}};

/// A variable's value; empty when it is not set.
path variable(const char* name) {
  const char* const value = std::getenv(name);
  return value == nullptr ? path() : path(value);
}

/// The XDG specification has relative paths ignored.
path absoluteVariable(const char* name) {
  path value = variable(name);
  return value.is_absolute() ? value : path();
}

path homeDirectory() {
  if (path home = absoluteVariable("HOME"); !home.empty()) return home;
  const passwd* const user = getpwuid(geteuid());
  return user == nullptr ? path("/") : path(user->pw_dir);
}

path userDirectory(const Directory& directory) {
  if (path base = absoluteVariable(directory.userVariable); !base.empty()) return base / "quarvel";
  const path base = directory.belowHome == nullptr ? path("/run/user") / std::to_string(geteuid())
                                                   : homeDirectory() / directory.belowHome;
  return base / "quarvel";
}

}  // namespace

std::vector<path> StandardPaths::candidates(Kind kind, bool root) {
  const Directory& directory = kDirectories[static_cast<std::size_t>(kind)];
  std::vector<path> candidates;
  const std::string named = variable(directory.systemdVariable).native();
  // systemd separates several directories by colons.
  if (const std::string first = named.substr(0, named.find(':')); !first.empty()) {
    candidates.emplace_back(first);
  }
  if (!root) candidates.push_back(userDirectory(directory));
  candidates.emplace_back(directory.installed);
  return candidates;
}

path StandardPaths::find(Kind kind, std::string_view file) {
  const std::vector<path> directories = candidates(kind, geteuid() == 0);
  for (const path& directory : directories) {
    if (::access((directory / file).c_str(), F_OK) == 0) return directory / file;
  }
  return (errno == EACCES ? directories.back() : directories.front()) / file;
}

StandardPaths StandardPaths::fromEnvironment(bool root) {
  StandardPaths paths;
  paths.runtime = candidates(Kind::runtime, root).front();
  paths.state = candidates(Kind::state, root).front();
  paths.configuration = candidates(Kind::configuration, root).front();
  paths.socket = variable("QUARVEL_SOCKET");
  if (paths.socket.empty()) paths.socket = paths.runtime / "reporting.sock";
  paths.diagnosticsPrefix = variable("QUARVEL_DIAGNOSTICS_PREFIX");
  return paths;
}

StandardPaths StandardPaths::fromEnvironment() {
  return fromEnvironment(geteuid() == 0);
}

}  // namespace quarvel
