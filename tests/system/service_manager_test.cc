#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <future>
#include <memory>
#include <string>

#include "platform/WorkQueue.h"
#include "queues/BlockingScope.h"
#include "system/ServiceManager.h"
#include "tests/TemporaryDirectory.h"
#include "tests/UnixSocket.h"

namespace quarvel {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

/// A service manager: the socket to which the process tells how it is.
class ServiceManagerTest : public testing::Test {
 protected:
  ServiceManagerTest() { ::setenv("NOTIFY_SOCKET", path_.c_str(), 1); }
  ~ServiceManagerTest() override {
    ::unsetenv("NOTIFY_SOCKET");
    ::close(socket_);
  }

  /// What it is told next; empty when nothing is within the time.
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
  for (const bool lendsItsPlace : {false, true}) {
    std::promise<void> begun;
    std::promise<void> release;
    clients->async([&begun, lendsItsPlace, released = release.get_future().share()] {
      begun.set_value();
      std::unique_ptr<BlockingScope> blocking;
      if (lendsItsPlace) blocking = std::make_unique<BlockingScope>();
      released.wait();
    });
    begun.get_future().wait();
    for (int i = 0; i < 3; ++i) PingManager();
    if (!lendsItsPlace) {
      EXPECT_EQ(heard(milliseconds(200)), "") << "the work of clients hangs";
      release.set_value();
      EXPECT_EQ(heard(seconds(60)), "WATCHDOG=1");
      EXPECT_EQ(heard(milliseconds(0)), "") << "pings that wait are one";
    } else {
      EXPECT_EQ(heard(seconds(60)), "WATCHDOG=1") << "it waits for room, say";
      release.set_value();
    }
  }
}

TEST_F(ServiceManagerTest, PingsTwiceInTheTimeThatTheManagerWaitsOrNever) {
  ::unsetenv("WATCHDOG_USEC");
  EXPECT_EQ(ManagerPingInterval(), seconds(0));
  ::setenv("WATCHDOG_USEC", "600000000", 1);
  EXPECT_EQ(ManagerPingInterval(), std::chrono::minutes(5));
  ::setenv("WATCHDOG_PID", "1", 1);
  EXPECT_EQ(ManagerPingInterval(), seconds(0)) << "another process is meant";
  for (const char* wrong : {"", "soon", "-5", "99999999999999999999"}) {
    ::setenv("WATCHDOG_USEC", wrong, 1);
    ::unsetenv("WATCHDOG_PID");
    EXPECT_EQ(ManagerPingInterval(), seconds(0)) << wrong;
  }
  ::unsetenv("WATCHDOG_USEC");
}

}  // namespace
}  // namespace quarvel
