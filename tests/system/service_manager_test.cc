#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

#include "queues/BlockingScope.h"
#include "system/ServiceManager.h"
#include "tests/FolderPlatform.h"
#include "tests/Gate.h"
#include "tests/TemporaryDirectory.h"
#include "tests/UnixSocket.h"

namespace quarvel {
namespace {

using std::chrono::milliseconds, std::chrono::seconds;

/// A service manager: the socket to which the process reports.
class ServiceManagerTest : public ::testing::Test {
 protected:
  ServiceManagerTest() { ::setenv("NOTIFY_SOCKET", path_.c_str(), 1); }
  ~ServiceManagerTest() override {
    ::unsetenv("NOTIFY_SOCKET");
    ::close(socket_);
  }

  /// The next report; empty when none comes within the time.
  [[nodiscard]] std::string heard(milliseconds within) const {
    pollfd readable{socket_, POLLIN, 0};
    if (::poll(&readable, 1, static_cast<int>(within.count())) != 1) return {};
    char text[64];
    const ssize_t length = ::recv(socket_, text, sizeof text, 0);
    return {text, static_cast<std::size_t>(length)};
  }

 private:
  const TemporaryDirectory directory_;
  const std::string path_ = directory_.path() / "notify";
  const int socket_ = BoundSocket(path_, SOCK_DGRAM);
};

TEST_F(ServiceManagerTest, PingNeedsTheWorkOfClientsToMove) {
  const auto clients = CreateSerialQueue("test.clients", QualityOfService::userInteractive);
  ServiceManager manager;
  for (const bool lendsItsPlace : {false, true}) {
    testing::Gate begun, release;
    clients->async([&] {
      std::unique_ptr<BlockingScope> blocking;
      if (lendsItsPlace) blocking = std::make_unique<BlockingScope>();
      begun.arrive();
      release.wait();
    });
    begun.wait();
    for (int i = 0; i < 3; ++i) manager.ping();
    if (!lendsItsPlace) {
      EXPECT_EQ(heard(milliseconds(200)), "") << "the work of clients hangs";
      release.arrive();
    }
    EXPECT_EQ(heard(seconds(30)), "WATCHDOG=1");
    EXPECT_TRUE(lendsItsPlace || heard(milliseconds(0)).empty()) << "pings that wait are one";
    release.arrive();
    (void)testing::FolderQueues().drain(std::chrono::steady_clock::now() + seconds(30));
  }
}

TEST_F(ServiceManagerTest, PingsTwiceInTheTimeThatTheManagerWaitsOrNever) {
  for (const char* wrong : {"", "soon", "-5"}) {
    ::setenv("WATCHDOG_USEC", wrong, 1);
    EXPECT_EQ(ServiceManager::pingInterval(), seconds(0)) << wrong;
  }
  ::setenv("WATCHDOG_USEC", "600000000", 1);
  EXPECT_EQ(ServiceManager::pingInterval(), std::chrono::minutes(5));
  ::setenv("WATCHDOG_PID", "1", 1);
  EXPECT_EQ(ServiceManager::pingInterval(), seconds(0)) << "another process is meant";
  ::unsetenv("WATCHDOG_USEC");
  ::unsetenv("WATCHDOG_PID");
}

}  // namespace
}  // namespace quarvel
