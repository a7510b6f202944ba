#include "tools/Notification.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <string_view>
#include <system_error>
#include <vector>

#include <quarvel/client.hpp>

namespace quarvel::commands {
namespace {

using std::filesystem::path;

std::string WhyNotPosted(const path& directory, int error) {
  if (error == ENOENT || error == ENOTDIR) {
    return fmt::format(
        "The service is not running: there is no directory {}. If its runtime directory is "
        "elsewhere, name it in RUNTIME_DIRECTORY.",
        directory.native());
  }
  return fmt::format("{} cannot be written: {}.{}", directory.native(),
                     std::generic_category().message(error),
                     error == EACCES ? " Try it as root or as the service's user." : "");
}

}  // namespace

path RuntimeDirectory(const Options& options) {
  const path socket = options.socket.empty() ? Client::defaultSocketPath() : options.socket;
  std::vector<path> candidates{socket.parent_path()};
  if (const char* own = std::getenv("RUNTIME_DIRECTORY")) {
    const std::string_view directories = own;
    candidates.emplace_back(directories.substr(0, directories.find(':')));
  }
  if (const char* user = std::getenv("XDG_RUNTIME_DIR"); user && ::geteuid() != 0) {
    candidates.push_back(path(user) / "quarvel");
  }
  for (const path& candidate : candidates) {
    if (::access((candidate / "notify").c_str(), F_OK) == 0) return candidate;
  }
  return candidates.front();
}

bool ServiceIsUp(const Options& options) {
  return Client::connect(options.socket).ok();
}

Result<path> Post(const Options& options, const std::string& name) {
  const path directory = RuntimeDirectory(options) / "notify";
  path file = directory / name;
  const int posted =
      ::open(file.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0640);
  if (posted < 0 || ::futimens(posted, nullptr) != 0) {
    const int error = errno;
    if (posted >= 0) ::close(posted);
    return Error::because("quarvel.notification", 1, WhyNotPosted(directory, error));
  }
  ::close(posted);
  return file;
}

}  // namespace quarvel::commands
