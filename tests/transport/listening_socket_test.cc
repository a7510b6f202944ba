// The socket file that clients connect to, and a socket that was passed in.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <latch>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "tests/TemporaryDirectory.h"
#include "tests/UnixSocket.h"
#include "transport/ListeningSocket.h"

namespace quarvel {
namespace {

using ::testing::HasSubstr;

class ListeningSocketTest : public ::testing::Test {
 protected:
  const TemporaryDirectory directory_;
  const std::filesystem::path path_ = directory_.path() / "socket";
};

TEST_F(ListeningSocketTest, MakesItsDirectoryAndRemovesItsOwnFile) {
  const auto path = directory_.path() / "run" / "quarvel" / "reporting.sock";
  const auto modeOf = [](const std::filesystem::path& file) {
    return static_cast<mode_t>(std::filesystem::status(file).permissions());
  };
  const mode_t umaskBefore = ::umask(0027);
  {
    auto socket = ListeningSocket::listeningAt(path);
    ::umask(umaskBefore);
    ASSERT_TRUE(socket) << socket.error().description();
    EXPECT_EQ(modeOf(path), 0660U);
    EXPECT_EQ(modeOf(path.parent_path()), 0750U);
  }
  EXPECT_FALSE(std::filesystem::exists(path));

  auto socket = ListeningSocket::listeningAt(path);
  ASSERT_TRUE(socket);
  std::filesystem::remove(path);
  const auto successor = ListeningSocket::listeningAt(path);
  ASSERT_TRUE(successor);
  socket.value().removeFile();
  EXPECT_TRUE(std::filesystem::exists(path)) << "the file of a successor";
}

TEST_F(ListeningSocketTest, ReplacesOnlyAStaleFile) {
  const struct {
    const char* name;
    int type;
    int backlog;  // -1: does not listen
    bool stale;   // closed before, so replaced
  } cases[] = {
      {"dead", SOCK_STREAM, 5, true},
      {"dead before it listened", SOCK_STREAM, -1, true},
      {"dead, of another type", SOCK_DGRAM, -1, true},
      {"live", SOCK_STREAM, 5, false},
      {"live, with its queue full", SOCK_STREAM, 0, false},
      {"about to listen", SOCK_STREAM, -1, false},
      {"live, of another type", SOCK_DGRAM, -1, false},
  };
  for (const auto& row : cases) {
    SCOPED_TRACE(row.name);
    std::filesystem::remove(path_);
    UniqueDescriptor there(BoundSocket(path_, row.type));
    if (row.backlog >= 0) {
      ASSERT_EQ(::listen(there.get(), row.backlog), 0);
    }
    if (row.stale) there = UniqueDescriptor();
    const auto socket = ListeningSocket::listeningAt(path_);
    EXPECT_EQ(socket.ok(), row.stale);
    if (!socket) {
      EXPECT_THAT(socket.error().description(), HasSubstr("another service is listening there"));
    }
    EXPECT_TRUE(std::filesystem::exists(path_));
  }
}

TEST_F(ListeningSocketTest, RefusesAPathThatIsNoSocketOrTooLongAndASocketThatDoesNotListen) {
  directory_.write("socket", "precious");
  const auto socket = ListeningSocket::listeningAt(path_);
  ASSERT_FALSE(socket);
  EXPECT_THAT(socket.error().description(), HasSubstr("no socket"));
  EXPECT_EQ(std::filesystem::file_size(path_), 8U);

  const auto tooLong = ListeningSocket::listeningAt(directory_.path() / std::string(108, 'l'));
  ASSERT_FALSE(tooLong);
  EXPECT_THAT(tooLong.error().description(), HasSubstr("1 to 107 bytes"));

  EXPECT_FALSE(ListeningSocket::inherited(
      UniqueDescriptor(BoundSocket(directory_.path() / "quiet", SOCK_STREAM))));
}

TEST_F(ListeningSocketTest, OfServicesThatStartAtOnceExactlyOneSucceeds) {
  for (int round = 0; round < 50; ++round) {
    ::close(BoundSocket(path_, SOCK_STREAM));  // stale
    std::latch go(4);
    std::vector<std::optional<ListeningSocket>> sockets(4);
    std::vector<std::thread> services;
    for (auto& mine : sockets) {
      services.emplace_back([&] {
        go.arrive_and_wait();
        if (auto socket = ListeningSocket::listeningAt(path_))
          mine.emplace(std::move(socket.value()));
      });
    }
    for (std::thread& service : services) service.join();
    ASSERT_EQ(std::ranges::count_if(sockets, [](const auto& each) { return each.has_value(); }), 1);
  }
}

}  // namespace
}  // namespace quarvel
