// What the engineer of a device sets up, through the functions that the service calls: one
// configuration for the process, made before any test.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <thread>

#include "platform/FileSystem.h"
#include "platform/Log.h"
#include "platform/Notifications.h"
#include "platform/Preferences.h"
#include "platform/Tallix.h"
#include "platform/linux/sources/VerbosePreferences.h"
#include "platform/linux/system/Configuration.h"
#include "tests/linux/TemporaryDirectory.h"

namespace quarvel {
namespace {

using ::testing::Contains;
using ::testing::Ge;
using ::testing::Key;
using ::testing::Pair;

/// The fenced block of the documentation that mentions `word`.
std::string documentedExample(std::string_view word) {
  std::stringstream text;
  text << std::ifstream(QUARVEL_SOURCE_DIR "/docs/sources.md").rdbuf();
  const std::string document = text.str();
  const std::size_t at = document.find(word);
  const std::size_t begin = document.rfind("```toml\n", at);
  if (at == document.npos || begin == document.npos) return {};
  return document.substr(begin + 8, document.find("```", at) - begin - 8);
}

class DeviceTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    static const TemporaryDirectory own;
    directory = &own;
    for (const char* name : {"RUNTIME", "STATE", "CONFIGURATION"}) {
      setenv((std::string(name) + "_DIRECTORY").c_str(), (own.path() / name).c_str(), 1);
    }
    setenv("QUARVEL_DIAGNOSTICS_PREFIX", (own.path() / "prefix").c_str(), 1);
    own.write("CONFIGURATION/quarvel.toml", documentedExample("/proc/interrupts"));
  }

  static const TemporaryDirectory* directory;
};

const TemporaryDirectory* DeviceTest::directory = nullptr;

TEST_F(DeviceTest, DocumentedInterruptPatternCounts) {
  ASSERT_FALSE(Configuration::process().tallix.channels.empty());
  std::optional<Error> error;
  const TallixChannels found = TallixCopyChannelsInGroup("Speaker", std::nullopt, error);
  ASSERT_NE(found, nullptr);
  TallixChannels channels;
  const auto subscription = TallixCreateSubscription(found, channels);
  ASSERT_EQ(TallixGetChannelCount(*channels), 1);
  const TallixSamples samples = TallixCreateSamples(*subscription, channels, error);
  ASSERT_NE(samples, nullptr) << error->description();
  std::map<std::string, std::int64_t> figures;
  TallixIterate(*samples, [&figures](const TallixChannelSample& sample) {
    figures.emplace(*TallixChannelGetChannelName(sample), TallixSimpleGetIntegerValue(sample));
    return 0;
  });
  EXPECT_THAT(figures, Contains(Pair("SpuriousInterrupts", Ge(0))));
}

TEST_F(DeviceTest, VerboseSwitchesFollowThePreferencesWhenNotified) {
  const auto verboseAs = [](LogHandle scope, bool wanted) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (ZQLogEnabled(LogLevel::debug, scope) != wanted) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::yield();
    }
    return true;
  };
  const auto write = [](std::string_view text) {
    directory->write("CONFIGURATION/preferences/tarnwick.quarvel.toml", text);
  };
  write("early_verbose = true\nlate_verbose = true");
  const LogHandle early =
      ZQLogRegister(FourCharacterCode("erly"), "erly", "tarnwick.quarvel", "early_verbose", 1, 31);
  EXPECT_FALSE(ZQLogEnabled(LogLevel::debug, early));
  FollowVerbosePreferences();
  EXPECT_TRUE(ZQLogEnabled(LogLevel::debug, early));
  const LogHandle late =
      ZQLogRegister(FourCharacterCode("late"), "late", "tarnwick.quarvel", "late_verbose", 1, 31);
  EXPECT_TRUE(ZQLogEnabled(LogLevel::debug, late));

  write("early_verbose = false\nlate_verbose = 1");
  EXPECT_TRUE(ZQLogEnabled(LogLevel::debug, early));  // nobody has been told yet
  ASSERT_EQ(PostNotification("tarnwick.quarvel.reporting"), 0);
  EXPECT_TRUE(verboseAs(early, false));
  EXPECT_TRUE(ZQLogEnabled(LogLevel::debug, late));
  write("early_verbose = yes, please");  // no TOML: nothing changes
  ASSERT_EQ(PostNotification("tarnwick.quarvel.reporting"), 0);
  EXPECT_TRUE(OpenPreferencesDomain("tarnwick.quarvel").boolean("late_verbose"));
  write("late_verbose = false");
  ASSERT_EQ(PostNotification("tarnwick.quarvel.reporting"), 0);
  EXPECT_TRUE(verboseAs(late, false));
}

TEST_F(DeviceTest, DiagnosticsLieBelowThePrefix) {
  const std::string path = DiagnosticsPath("/private/logs");
  EXPECT_EQ(path, (directory->path() / "prefix/private/logs").native());
  ASSERT_TRUE(CreateDirectory(path, 0777).ok());
  EXPECT_TRUE(WriteFileAtomically(path + "/history.json", "[]").ok());
}

}  // namespace
}  // namespace quarvel
