#include <fcntl.h>
#include <grp.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "client/Channel.h"
#include "client/Connect.h"
#include "client/Failure.h"

namespace quarvel {
namespace {

constexpr std::string_view kHowToStart =
    "Start it with \"systemctl start quarvel\", or by hand with \"quarveld\"; if it listens "
    "elsewhere, name its socket in QUARVEL_SOCKET.";

std::string Environment(const char* name) {
  const char* value = std::getenv(name);
  return value == nullptr ? std::string() : value;
}

bool Exists(const std::string& path) {
  return ::access(path.c_str(), F_OK) == 0;
}

std::string GroupName(gid_t group) {
  struct group entry {};
  struct group* found = nullptr;
  char buffer[4096];
  if (::getgrgid_r(group, &entry, buffer, sizeof buffer, &found) == 0 && found != nullptr) {
    return "\"" + std::string(found->gr_name) + "\"";
  }
  return std::to_string(group);
}

// Who would have been let in: the group of the socket, or of the directory that hides it.
std::string WhyNotPermitted(const std::string& path) {
  struct stat status {};
  std::string closed = path;
  while (::stat(closed.c_str(), &status) != 0) {
    const std::size_t slash = closed.rfind('/');
    if (slash == std::string::npos || slash == 0) {
      return "This user may not use " + path + ".";
    }
    closed.resize(slash);
  }
  return "This user may not use " + path + ": " + closed + " is for the group " +
         GroupName(status.st_gid) + ". Join that group, or run as a user who is in it.";
}

std::string WhyUnreachable(const std::string& path, int error) {
  switch (error) {
    case ENOENT:
    case ENOTDIR:
      return "The service is not running: there is no socket " + path + ". " +
             std::string(kHowToStart);
    case ECONNREFUSED:
      return "The service is not running: nobody listens on " + path +
             ", which a service that ended has left behind. " + std::string(kHowToStart);
    case EACCES:
    case EPERM:
      return WhyNotPermitted(path);
    default:
      return "The service at " + path + " cannot be reached: " + std::strerror(error) + ".";
  }
}

}  // namespace

std::string Client::defaultSocketPath() {
  if (std::string path = Environment("QUARVEL_SOCKET"); !path.empty()) return path;
  std::vector<std::string> candidates;
  // A client that is itself a unit has a runtime directory of its own, so none is taken unseen.
  // Where a unit has several they are separated by colons; the first counts.
  if (const std::string own = Environment("RUNTIME_DIRECTORY"); !own.empty()) {
    candidates.push_back(own.substr(0, own.find(':')) + "/reporting.sock");
  }
  if (const std::string user = Environment("XDG_RUNTIME_DIR"); !user.empty() && ::geteuid() != 0) {
    candidates.push_back(user + "/quarvel/reporting.sock");
  }
  candidates.emplace_back("/run/quarvel/reporting.sock");
  for (const std::string& path : candidates) {
    if (Exists(path)) return path;
  }
  return candidates.front();
}

Result<int> ConnectTo(const std::string& path, bool mayWait) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) {
    return Failure(Client::Code::unreachable, "The socket's path may have " +
                                                  std::to_string(sizeof address.sun_path - 1) +
                                                  " bytes at most: " + path);
  }
  std::memcpy(address.sun_path, path.data(), path.size());

  const int kind = SOCK_STREAM | SOCK_CLOEXEC | (mayWait ? 0 : SOCK_NONBLOCK);
  const int socket = ::socket(AF_UNIX, kind, 0);
  if (socket < 0) {
    return Failure(Client::Code::unreachable,
                   "This process can make no socket: " + std::string(std::strerror(errno)) + ".");
  }
  while (::connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    if (errno == EINTR) continue;
    const int error = errno;
    ::close(socket);
    return Failure(Client::Code::unreachable, WhyUnreachable(path, error));
  }
  if (mayWait) ::fcntl(socket, F_SETFL, ::fcntl(socket, F_GETFL) | O_NONBLOCK);
  return socket;
}

Result<Client> Client::connect(const Options& options) {
  auto channel = Channel::open(options);
  if (!channel) return std::move(channel.error());
  return Client(std::move(channel.value()));
}

Result<Client> Client::connect(std::string_view socketPath) {
  Options options;
  options.socketPath = socketPath;
  return connect(options);
}

}  // namespace quarvel
