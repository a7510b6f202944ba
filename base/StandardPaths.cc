#include "base/StandardPaths.h"

#include <pwd.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <string_view>

namespace quarvel {
namespace {

using std::filesystem::path;

/// A variable's value; empty when it is not set.
path variable(const char* name) {
  const char* const value = std::getenv(name);
  return value == nullptr ? path() : path(value);
}

/// The first directory that systemd names: it separates several by colons.
path systemdDirectory(const char* name) {
  const std::string directories = variable(name).native();
  return std::string_view(directories).substr(0, directories.find(':'));
}

/// XDG has relative paths ignored.
path absoluteVariable(const char* name) {
  path value = variable(name);
  return value.is_absolute() ? value : path();
}

path homeDirectory() {
  if (path home = absoluteVariable("HOME"); !home.empty()) return home;
  const passwd* const user = getpwuid(geteuid());
  return user == nullptr ? path("/") : path(user->pw_dir);
}

path userRuntimeDirectory() {
  if (path runtime = absoluteVariable("XDG_RUNTIME_DIR"); !runtime.empty()) return runtime;
  return path("/run/user") / std::to_string(geteuid());
}

path userDirectory(const char* name, const char* belowHome) {
  if (path directory = absoluteVariable(name); !directory.empty()) return directory;
  return homeDirectory() / belowHome;
}

}  // namespace

StandardPaths StandardPaths::fromEnvironment(bool root) {
  StandardPaths directories;
  directories.runtime = systemdDirectory("RUNTIME_DIRECTORY");
  if (directories.runtime.empty()) {
    directories.runtime = root ? path("/run/quarvel") : userRuntimeDirectory() / "quarvel";
  }
  directories.state = systemdDirectory("STATE_DIRECTORY");
  if (directories.state.empty()) {
    directories.state = root ? path("/var/lib/quarvel")
                             : userDirectory("XDG_STATE_HOME", ".local/state") / "quarvel";
  }
  directories.configuration = systemdDirectory("CONFIGURATION_DIRECTORY");
  if (directories.configuration.empty()) {
    directories.configuration =
        root ? path("/etc/quarvel") : userDirectory("XDG_CONFIG_HOME", ".config") / "quarvel";
  }
  directories.socket = variable("QUARVEL_SOCKET");
  if (directories.socket.empty()) directories.socket = directories.runtime / "reporting.sock";
  directories.diagnosticsPrefix = variable("QUARVEL_DIAGNOSTICS_PREFIX");
  return directories;
}

}  // namespace quarvel
