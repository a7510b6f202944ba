#include "transport/ListeningSocket.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <system_error>
#include <utility>

namespace quarvel {

namespace {

constexpr mode_t kSocketMode = 0660;
constexpr mode_t kDirectoryMode = 0750;

Error Failure(std::string reason) {
  return Error::because("quarvel.listener", 1, std::move(reason));
}

/// Precondition: `errno` is set.
Error SystemFailure(const std::filesystem::path& path, const char* what) {
  const int code = errno;
  return Failure(
      fmt::format("{}: {}: {}", path.native(), what, std::generic_category().message(code)));
}

Outcome MakeDirectory(const std::filesystem::path& directory) {
  std::error_code error;
  std::filesystem::create_directories(directory.parent_path(), error);
  // A parent that could not be made fails here too, with the error that the log needs.
  if (::mkdir(directory.c_str(), kDirectoryMode) != 0 && errno != EEXIST) {
    return SystemFailure(directory, "cannot make the directory");
  }
  return Success();
}

/// Succeeds when `path` is free, or held a stale socket file, which is removed.
Outcome RemoveStaleSocket(const std::filesystem::path& path, const sockaddr_un& address) {
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0) {
    return errno == ENOENT ? Success() : SystemFailure(path, "cannot be looked at");
  }
  if (!S_ISSOCK(status.st_mode)) {
    return Failure(fmt::format("{}: there is a file that is no socket", path.native()));
  }
  // Probed with a datagram socket, which never becomes a client: a stream socket in use refuses it
  // for its type, a closed one refuses the connection.
  const UniqueDescriptor probe(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (!probe) return SystemFailure(path, "cannot be probed");
  const int refused =
      ::connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0
          ? EPROTOTYPE
          : errno;
  if (refused == EPROTOTYPE) {
    return Failure(fmt::format("{}: another service is listening there", path.native()));
  }
  if (refused != ECONNREFUSED) return SystemFailure(path, "cannot be probed");
  if (::unlink(path.c_str()) != 0) return SystemFailure(path, "cannot replace the stale socket");
  return Success();
}

}  // namespace

Result<ListeningSocket> ListeningSocket::inherited(UniqueDescriptor descriptor) {
  if (::sd_is_socket_unix(descriptor.get(), SOCK_STREAM, 1, nullptr, 0) <= 0) {
    return Failure("the socket passed in is not a Unix stream socket that listens");
  }
  const int flags = ::fcntl(descriptor.get(), F_GETFL);
  if (flags < 0 || ::fcntl(descriptor.get(), F_SETFL, flags | O_NONBLOCK) != 0) {
    return SystemFailure("the socket passed in", "cannot be made non-blocking");
  }
  ListeningSocket socket;
  socket.descriptor_ = std::move(descriptor);
  return socket;
}

Result<ListeningSocket> ListeningSocket::listeningAt(const std::filesystem::path& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.native().empty() || path.native().size() >= sizeof address.sun_path) {
    return Failure(fmt::format("{}: a socket's path has 1 to {} bytes", path.native(),
                               sizeof address.sun_path - 1));
  }
  std::memcpy(address.sun_path, path.c_str(), path.native().size());

  const std::filesystem::path directory = std::filesystem::absolute(path).parent_path();
  if (auto made = MakeDirectory(directory); !made) return std::move(made.error());
  // Locked from the probe until the socket listens, so that two services cannot both find it stale.
  const UniqueDescriptor lock(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!lock || ::flock(lock.get(), LOCK_EX) != 0) {
    return SystemFailure(directory, "cannot be locked");
  }
  if (auto free = RemoveStaleSocket(path, address); !free) return std::move(free.error());

  ListeningSocket socket;
  socket.descriptor_ =
      UniqueDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  // The mode is set before the file exists, so that it is never too open, and once more since the
  // umask may have removed bits.
  if (!socket.descriptor_ || ::fchmod(socket.descriptor(), kSocketMode) != 0 ||
      ::bind(socket.descriptor(), reinterpret_cast<const sockaddr*>(&address), sizeof address) !=
          0) {
    return SystemFailure(path, "cannot be bound");
  }
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0) return SystemFailure(path, "cannot be looked at");
  socket.path_ = path;
  socket.device_ = status.st_dev;
  socket.inode_ = status.st_ino;
  if (::chmod(path.c_str(), kSocketMode) != 0 || ::listen(socket.descriptor(), SOMAXCONN) != 0) {
    return SystemFailure(path, "cannot be listened at");
  }
  return socket;
}

ListeningSocket::~ListeningSocket() {
  removeFile();
}

bool ListeningSocket::removeFile() {
  if (path_.empty()) return false;
  struct stat status {};
  if (::lstat(path_.c_str(), &status) == 0 && status.st_dev == device_ && status.st_ino == inode_) {
    ::unlink(path_.c_str());
  }
  path_.clear();
  return true;
}

}  // namespace quarvel
