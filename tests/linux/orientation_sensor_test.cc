#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/linux/sources/OrientationSensor.h"
#include "tests/linux/Collected.h"
#include "tests/linux/LogRecorder.h"
#include "tests/linux/TemporaryDirectory.h"

namespace quarvel {
namespace {

using ::testing::HasSubstr;
using ::testing::IsEmpty;
using testing::LogRecorder;
using ::testing::Optional;

/// A program that runs beside the test and ends with it.
class Companion {
 public:
  explicit Companion(std::vector<std::string> command) {
    std::vector<char*> arguments;
    for (std::string& argument : command) arguments.push_back(argument.data());
    arguments.push_back(nullptr);
    if (posix_spawnp(&process_, arguments[0], nullptr, nullptr, arguments.data(), environ) != 0) {
      process_ = 0;
    }
  }
  Companion(const Companion&) = delete;
  Companion& operator=(const Companion&) = delete;
  ~Companion() {
    if (process_ <= 0) return;
    kill(process_, SIGTERM);
    waitpid(process_, nullptr, 0);
  }

 private:
  pid_t process_ = 0;
};

/// Runs a shell command; its output when it succeeded.
std::optional<std::string> output(const std::string& command) {
  FILE* pipe = popen((command + " 2>&1").c_str(), "r");
  if (pipe == nullptr) return std::nullopt;
  std::string text;
  std::array<char, 512> part{};
  while (const std::size_t count = fread(part.data(), 1, part.size(), pipe)) {
    text.append(part.data(), count);
  }
  if (pclose(pipe) == 0) return text;
  ADD_FAILURE() << command << ": " << text;
  return std::nullopt;
}

class OrientationSensorTest : public ::testing::Test {
 protected:
  void SetUp() override {
    LogRecorder::take();
    const std::string socket = directory.path() / "system.sock";
    setenv("DBUS_SYSTEM_BUS_ADDRESS", ("unix:path=" + socket).c_str(), 1);
    directory.write(
        "bus.conf",
        "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-BUS Bus Configuration 1.0//EN\""
        " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">"
        "<busconfig><type>session</type><listen>unix:path=" +
            socket +
            "</listen><auth>EXTERNAL</auth><policy context=\"default\"><allow own=\"*\"/>"
            "<allow send_destination=\"*\"/><allow receive_sender=\"*\"/><allow user=\"*\"/>"
            "</policy></busconfig>");
    center.setSource(std::make_unique<OrientationSensor>(center));
  }

  void startBus() {
    bus = std::make_unique<Companion>(std::vector<std::string>{
        "dbus-daemon", "--config-file=" + (directory.path() / "bus.conf").native(), "--nofork",
        "--nopidfile"});
    while (!std::filesystem::exists(directory.path() / "system.sock")) std::this_thread::yield();
  }
  void startProxy(const std::string& parameters = "{\"has_accelerometer\": true}") {
    proxy.reset();
    proxy = std::make_unique<Companion>(std::vector<std::string>{
        "/usr/bin/python3", "-m", "dbusmock", "--system", "--template", "iio-sensors-proxy", "-p",
        parameters, "-l", directory.path() / "proxy.log"});
    output("gdbus wait --system --timeout 30 net.hadess.SensorProxy");
  }
  static std::string call(const std::string& method, const std::string& arguments) {
    return output("gdbus call --system -d net.hadess.SensorProxy -o /net/hadess/SensorProxy -m " +
                  method + " " + arguments)
        .value_or("");
  }
  static void hold(const std::string& word) {
    call("org.freedesktop.DBus.Mock.SetInternalProperty",
         "net.hadess.SensorProxy AccelerometerOrientation \"<'" + word + "'>\"");
  }
  static std::size_t claimants() {
    const std::string owners =
        call("org.freedesktop.DBus.Mock.GetInternalProperty", "AccelerometerOwners");
    return static_cast<std::size_t>(std::count(owners.begin(), owners.end(), ':'));
  }
  static void awaitClaimants(std::size_t count) {
    for (int i = 0; i < 500 && claimants() != count; ++i) {
    }
    ASSERT_EQ(claimants(), count);
  }
  void add(const char* callbackID) {
    center.add(OrientationKind::device, callbackID,
               [this](Orientation orientation) { seen.add(orientation); });
  }

  TemporaryDirectory directory;
  std::unique_ptr<Companion> bus;
  std::unique_ptr<Companion> proxy;
  Collected<Orientation> seen;
  OrientationCenter center;
};

TEST_F(OrientationSensorTest, ClaimsWhileSomebodyListensAndFollowsARestartedProxy) {
  startBus();
  startProxy("{\"has_accelerometer\": true, \"accelerometer_orientation\": \"normal\"}");
  EXPECT_EQ(claimants(), 0U);
  add("first");
  center.add(OrientationKind::ui, "first", [](Orientation) { ADD_FAILURE(); });
  add("second");
  awaitClaimants(1);
  const std::vector<std::pair<const char*, Orientation>> cases{
      {"left-up", Orientation::landscapeRight},
      {"right-up", Orientation::landscapeLeft},
      {"bottom-up", Orientation::portraitUpsideDown},
      {"undefined", Orientation::unknown},
      {"normal", Orientation::portrait},
  };
  for (const auto& [word, expected] : cases) {
    SCOPED_TRACE(word);
    hold(word);
    EXPECT_THAT(seen.next(), Optional(expected));
    EXPECT_THAT(seen.next(), Optional(expected));
  }

  center.remove(OrientationKind::device, "first");
  startProxy("{\"has_accelerometer\": true, \"accelerometer_orientation\": \"left-up\"}");
  // Claimed again, and what changed meanwhile is told.
  EXPECT_THAT(seen.next(), Optional(Orientation::landscapeRight));
  hold("normal");
  EXPECT_THAT(seen.next(), Optional(Orientation::portrait));

  center.remove(OrientationKind::device, "second");
  awaitClaimants(0);
  hold("left-up");
  add("third");
  awaitClaimants(1);
  EXPECT_EQ(seen.size(), 0U);
  EXPECT_THAT(LogRecorder::takeErrors(), IsEmpty());
}

TEST_F(OrientationSensorTest, NoBusNoProxyAndNoAccelerometerAreOneLineEach) {
  const auto comeAndGo = [this] {
    for (int i = 0; i < 3; ++i) {
      add("id");
      center.remove(OrientationKind::device, "id");
    }
  };
  add("id");
  EXPECT_THAT(LogRecorder::nextError(), HasSubstr("the system bus"));
  center.remove(OrientationKind::device, "id");
  comeAndGo();

  // With bus and proxy there, the next registration succeeds, and all is said anew when they go.
  startBus();
  startProxy();
  add("id");
  awaitClaimants(1);
  hold("left-up");
  EXPECT_THAT(seen.next(), Optional(Orientation::landscapeRight));
  proxy.reset();
  center.remove(OrientationKind::device, "id");
  add("id");
  EXPECT_THAT(LogRecorder::nextError(), HasSubstr("cannot be claimed"));
  center.remove(OrientationKind::device, "id");
  comeAndGo();
  startProxy();
  add("id");
  hold("right-up");
  awaitClaimants(1);
  EXPECT_THAT(LogRecorder::takeErrors(), IsEmpty());
  center.remove(OrientationKind::device, "id");

  startProxy("{\"has_accelerometer\": false}");
  add("id");
  EXPECT_THAT(LogRecorder::nextError(), HasSubstr("no accelerometer"));
  center.remove(OrientationKind::device, "id");
  comeAndGo();
  startProxy();
  add("id");
  awaitClaimants(1);
  EXPECT_THAT(LogRecorder::takeErrors(), IsEmpty());
  bus.reset();
  EXPECT_THAT(LogRecorder::nextError(), HasSubstr("the system bus was lost"));
}

}  // namespace
}  // namespace quarvel
