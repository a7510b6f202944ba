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

#include "base/StandardPaths.h"
#include "client/Channel.h"

namespace quarvel {
namespace {

constexpr std::string_view kHowToStart =
    "Start it with \"systemctl start quarvel\", or by hand with \"quarveld\"; if it listens "
    "elsewhere, name its socket in QUARVEL_SOCKET.";

std::string GroupName(gid_t group) {
  struct group entry {};
  struct group* found = nullptr;
  char buffer[4096];
  if (::getgrgid_r(group, &entry, buffer, sizeof buffer, &found) == 0 && found != nullptr) {
    return std::string("\"").append(found->gr_name).append("\"");
  }
  return std::to_string(group);
}

// Names the group that may connect: that of the socket, or of the directory that hides it.
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
  if (const char* named = std::getenv("QUARVEL_SOCKET"); named != nullptr && *named != '\0') {
    return named;
  }
  return StandardPaths::find(StandardPaths::Kind::runtime, "reporting.sock").native();
}

Result<int> Client::Channel::connectTo(const std::string& path, bool mayWait) {
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
