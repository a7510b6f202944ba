#pragma once

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>
#include <filesystem>

namespace quarvel {

inline sockaddr_un UnixAddress(const std::filesystem::path& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  return address;
}

/// The descriptor of a socket that is bound to a file; the file stays when it is closed.
inline int BoundSocket(const std::filesystem::path& path, int type) {
  const int bound = ::socket(AF_UNIX, type | SOCK_CLOEXEC, 0);
  const sockaddr_un address = UnixAddress(path);
  EXPECT_EQ(::bind(bound, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  return bound;
}

}  // namespace quarvel
