#include "linux/Service.h"

#include <gmock/gmock.h>
#include <pthread.h>
#include <sqlite3.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <thread>

#include <quarvel/client.hpp>

#include "Statistics/Service/ServiceMain.h"
#include "platform/DeviceProperties.h"
#include "platform/Log.h"
#include "platform/Process.h"
#include "platform/Random.h"
#include "tests/TemporaryDirectory.h"
#include "tests/UnixSocket.h"

namespace quarvel {
namespace {

using namespace std::chrono_literals;
using std::chrono::steady_clock;
using ::testing::HasSubstr;
using ::testing::Not;

constexpr Client::Category kCategory{3};

std::ptrdiff_t threadCount() {
  return std::distance(std::filesystem::directory_iterator("/proc/self/task"), {});
}

/// The first value of a query.
std::string valueIn(const std::filesystem::path& store, const char* query) {
  sqlite3* connection = nullptr;
  EXPECT_EQ(sqlite3_open(store.c_str(), &connection), SQLITE_OK);
  std::string value;
  const auto keep = [](void* out, int, char** values, char**) {
    *static_cast<std::string*>(out) = values[0] == nullptr ? "null" : values[0];
    return 0;
  };
  EXPECT_EQ(sqlite3_exec(connection, query, keep, &value, nullptr), SQLITE_OK);
  sqlite3_close(connection);
  return value;
}

/// The environment of one service, and a client's view of it.
struct Life {
  Life() {
    for (const char* name : {"RUNTIME_DIRECTORY", "STATE_DIRECTORY", "CONFIGURATION_DIRECTORY"}) {
      ::setenv(name, directory.path().c_str(), 1);
    }
    ::unsetenv("QUARVEL_SOCKET");
  }

  /// Runs a service from its start to its end; `use` is given a client on another thread.
  template <class Use>
  void serve(Use use) {
    Service service;
    std::thread outside([&] {
      auto client = Client::connect((directory.path() / "reporting.sock").native());
      EXPECT_TRUE(client) << client.error().description();
      if (client) use(client.value());
      directory.write("notify/tarnwick.quarvel.status", "");
      const auto patience = steady_clock::now() + 30s;
      while (status.empty() && steady_clock::now() < patience) {
        std::ifstream file(directory.path() / "status.json");
        status.assign(std::istreambuf_iterator<char>(file), {});
      }
      service.listener().requestEnd();
    });
    EXPECT_EQ(ServiceMain(), 0);
    outside.join();
  }

  TemporaryDirectory directory;
  std::string status;  // asked for by the notification
  std::string log;
};

// Queues, log, notifications, counters and store of the second must be its own.
TEST(ServiceTest, TwoServicesRunOneAfterTheOtherInOneProcess) {
  std::thread([] {}).join();  // a sanitizer adds its own thread to the first
  const auto threads = threadCount();
  for (const std::int64_t number : {1, 2}) {
    Life run;
    run.directory.write(
        "quarvel.toml",
        "[orientation]\nsource = \"files\"\n[device]\nDeviceClassNumber = 4\n[lgo]\n");
    ::testing::internal::CaptureStderr();
    run.serve([number](Client& client) {
      EXPECT_EQ(DevicePropertyInteger("DeviceClassNumber"), 4);
      EXPECT_FALSE(DevicePropertyBoolean("DeviceClassNumber"));
      EXPECT_FALSE(DevicePropertyBoolean("Absent"));
      EXPECT_TRUE(client.sync(30s).createReportingSession(number).ok());
      client.startReportingSessionForID(number);
      EXPECT_TRUE(client.sync(30s).sendMessage(Dictionary{{"run", number}}, kCategory,
                                               Client::MessageType::generic, number));
      // Of no started session, so a single message after up to 59 s, and its end sends it at once.
      EXPECT_TRUE(client.sync(30s).createReportingSession(99).ok());
      EXPECT_TRUE(client.sync(30s).setServiceType(Client::ServiceType::alarms, 99).ok());
      EXPECT_TRUE(client.sync(30s).sendMessage(Dictionary{{"late", number}}, kCategory,
                                               Client::MessageType::generic, 99));
    });
    run.log = ::testing::internal::GetCapturedStderr();
    EXPECT_EQ(Service::running(), nullptr);
    EXPECT_EQ(valueIn(run.directory.path() / "telemetry.db",
                      "SELECT group_concat(json_extract(payload, '$.run')) || ' ' || "
                      "group_concat(json_extract(payload, '$.late')) FROM message"),
              std::to_string(number) + " " + std::to_string(number));
    EXPECT_THAT(run.status, HasSubstr("\"healthy\":true"));
    EXPECT_THAT(run.status, HasSubstr("\"clients\":1,"));
    EXPECT_THAT(run.log, HasSubstr("quarvel.toml:5: lgo is no key of ours."));
    EXPECT_THAT(run.log, HasSubstr("InvalidationHandler: connection exited"));
  }
  const auto patience = steady_clock::now() + 30s;
  while (threadCount() > threads && steady_clock::now() < patience) std::this_thread::yield();
  EXPECT_EQ(threadCount(), threads) << "threads of the services are left";
}

TEST(ServiceTest, StartsNotAtAllWithoutItsSocketOrItsConfiguration) {
  const Life run;
  const TemporaryDirectory& directory = run.directory;
  const int other = BoundSocket(directory.path() / "reporting.sock", SOCK_STREAM);
  ASSERT_EQ(::listen(other, 1), 0);
  EXPECT_EXIT(Service(), ::testing::ExitedWithCode(1), "another service is listening there");
  EXPECT_FALSE(std::filesystem::exists(directory.path() / "telemetry.db"))
      << "the store of a live service was opened";
  ::close(other);
  directory.write("quarvel.toml", "[log]\nlevel = 5\n");
  EXPECT_EXIT(Service(), ::testing::ExitedWithCode(1), "quarvel.toml:2: log.level");
}

TEST(ServiceTest, LogsToStandardErrorWithoutAService) {
  ZQ_FUNCTION("before");
  ::testing::internal::CaptureStderr();
  ZQ_LOG(nullptr, standard, "a line");
  ZQ_LOG(nullptr, info, "below the level");
  const std::string text = ::testing::internal::GetCapturedStderr();
  EXPECT_THAT(text, HasSubstr("before: a line\n"));
  EXPECT_THAT(text, Not(HasSubstr("below")));
}

// Folding 2^32 numbers onto this bound without care makes the lowest third twice as likely.
TEST(RandomTest, IsUniformWhereTheBoundDoesNotDivideTheRange) {
  constexpr std::uint32_t kThird = std::uint32_t{1} << 30;
  constexpr int kDraws = 200'000;
  std::array<int, 3> thirds{};
  for (int i = 0; i < kDraws; ++i) ++thirds.at(RandomBelow(3 * kThird) / kThird);
  for (const int count : thirds) EXPECT_NEAR(count, kDraws / 3, 7 * std::sqrt(kDraws * 2 / 9.0));
}

TEST(ProcessTest, NamesProcessesByTheirShortCommandNameIfItIsText) {
  EXPECT_EQ(OwnProcessIdentifier(), getpid());
  EXPECT_EQ(OwnProcessName(), "service_test");
  EXPECT_EQ(ProcessCommandName(getpid()), "service_test");
  for (const int none : {0, -5, 0x7fffffff}) EXPECT_EQ(ProcessCommandName(none), std::nullopt);
  std::thread([] {
    pthread_setname_np(pthread_self(), "caf\xc3\xa9 x\n");
    EXPECT_EQ(ProcessCommandName(gettid()), "caf\xc3\xa9 x\n");
    pthread_setname_np(pthread_self(), "\xff\xfe");
    EXPECT_EQ(ProcessCommandName(gettid()), std::nullopt);
  }).join();
}

}  // namespace
}  // namespace quarvel
