// Where clients find the service: its socket file, or the socket it was started with.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/connection/ListeningSocket.h"
#include "tests/UnixSocket.h"
#include "tests/linux/ConnectionFixture.h"

namespace quarvel {
namespace {

using ::testing::HasSubstr;

/// A bound socket; listening when `backlog` is not negative.
UniqueDescriptor BoundSocket(const std::filesystem::path& path, int type, int backlog) {
  UniqueDescriptor socket(quarvel::BoundSocket(path, type));
  if (backlog >= 0) {
    EXPECT_EQ(::listen(socket.get(), backlog), 0);
  }
  return socket;
}

mode_t ModeOf(const std::filesystem::path& path) {
  struct stat status {};
  EXPECT_EQ(::stat(path.c_str(), &status), 0);
  return status.st_mode & 07777;
}

TEST(ListeningSocket, MakesItsDirectoryAndRemovesItsFile) {
  const TemporaryDirectory directory;
  const auto path = directory.path() / "run" / "quarvel" / "reporting.sock";
  const mode_t umaskBefore = ::umask(0027);
  {
    auto socket = ListeningSocket::listeningAt(path);
    ::umask(umaskBefore);
    ASSERT_TRUE(socket) << socket.error().description();
    EXPECT_EQ(ModeOf(path), 0660U);
    EXPECT_EQ(ModeOf(path.parent_path()), 0750U);
  }
  EXPECT_FALSE(std::filesystem::exists(path));
}

TEST(ListeningSocket, ReplacesOnlyWhatNobodyListensAt) {
  const struct {
    const char* name;
    int type;
    int backlog;
    bool closed;
    const char* refusal;  // empty: is replaced
  } cases[] = {
      {"dead", SOCK_STREAM, 5, true, ""},
      {"dead before it listened", SOCK_STREAM, -1, true, ""},
      {"dead, of another type", SOCK_DGRAM, -1, true, ""},
      {"live", SOCK_STREAM, 5, false, "another service is listening there"},
      {"live, with its queue full", SOCK_STREAM, 0, false, "another service is listening there"},
      {"about to listen", SOCK_STREAM, -1, false, "another service is listening there"},
      {"live, of another type", SOCK_DGRAM, -1, false, "another service is listening there"},
  };
  for (const auto& row : cases) {
    SCOPED_TRACE(row.name);
    const TemporaryDirectory directory;
    const auto path = directory.path() / "socket";
    UniqueDescriptor there = BoundSocket(path, row.type, row.backlog);
    if (row.closed) there = UniqueDescriptor();
    const auto socket = ListeningSocket::listeningAt(path);
    EXPECT_EQ(socket.ok(), std::string(row.refusal).empty());
    if (!socket) {
      EXPECT_THAT(socket.error().description(), HasSubstr(row.refusal));
    }
    EXPECT_TRUE(std::filesystem::exists(path));
  }
}

TEST(ListeningSocket, LeavesAFileThatIsNoSocketAlone) {
  const TemporaryDirectory directory;
  const auto path = directory.path() / "socket";
  std::ofstream(path) << "precious";
  const auto socket = ListeningSocket::listeningAt(path);
  ASSERT_FALSE(socket);
  EXPECT_THAT(socket.error().description(), HasSubstr("no socket"));
  EXPECT_EQ(std::filesystem::file_size(path), 8U);

  const auto tooLong = ListeningSocket::listeningAt(directory.path() / std::string(108, 'l'));
  ASSERT_FALSE(tooLong);
  EXPECT_THAT(tooLong.error().description(), HasSubstr("1 to 107 bytes"));
}

TEST(ListeningSocket, OfServicesThatStartAtOnceExactlyOneSucceeds) {
  for (int round = 0; round < 50; ++round) {
    const TemporaryDirectory directory;
    const auto path = directory.path() / "socket";
    BoundSocket(path, SOCK_STREAM, 5);  // stale
    std::atomic<int> listening{0};
    std::atomic<bool> go{false};
    std::vector<std::optional<ListeningSocket>> sockets(4);
    std::vector<std::thread> services;
    for (auto& mine : sockets) {
      services.emplace_back([&] {
        while (!go) std::this_thread::yield();
        if (auto socket = ListeningSocket::listeningAt(path)) {
          mine.emplace(std::move(socket.value()));
          ++listening;
        }
      });
    }
    go = true;
    for (std::thread& service : services) service.join();
    ASSERT_EQ(listening, 1);
  }
}

TEST(ListeningSocket, LeavesTheFileOfASuccessorAlone) {
  const TemporaryDirectory directory;
  const auto path = directory.path() / "socket";
  auto socket = ListeningSocket::listeningAt(path);
  ASSERT_TRUE(socket);
  std::filesystem::remove(path);
  const auto successor = ListeningSocket::listeningAt(path);
  ASSERT_TRUE(successor);
  socket.value().removeFile();
  EXPECT_TRUE(std::filesystem::exists(path));
}

TEST(ListeningSocket, ServesAtAnInheritedSocketAndLeavesItsFile) {
  const TemporaryDirectory directory;
  const auto path = directory.path() / "socket";
  auto socket = ListeningSocket::inherited(BoundSocket(path, SOCK_STREAM, 5));
  ASSERT_TRUE(socket) << socket.error().description();
  {
    Service service({}, std::move(socket.value()));
    EXPECT_TRUE(Client(path).isServed());
  }
  EXPECT_TRUE(std::filesystem::exists(path));

  EXPECT_FALSE(
      ListeningSocket::inherited(BoundSocket(directory.path() / "quiet", SOCK_STREAM, -1)));
}

}  // namespace
}  // namespace quarvel
