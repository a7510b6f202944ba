// A program of its own: the directories of a process are looked up once.

#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <string>
#include <thread>

#include "platform/Log.h"
#include "platform/Notifications.h"
#include "platform/Preferences.h"
#include "platform/linux/sources/VerbosePreferences.h"
#include "tests/TemporaryDirectory.h"

namespace quarvel {
namespace {

TEST(VerbosePreferences, FollowThePreferencesWhenNotified) {
  static const TemporaryDirectory directory;
  for (const char* name : {"RUNTIME", "STATE", "CONFIGURATION"}) {
    setenv((std::string(name) + "_DIRECTORY").c_str(), (directory.path() / name).c_str(), 1);
  }
  const auto verboseAs = [](LogHandle scope, bool wanted) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (ZQLogEnabled(LogLevel::debug, scope) != wanted) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::yield();
    }
    return true;
  };
  const auto write = [](std::string_view text) {
    directory.write("CONFIGURATION/preferences/tarnwick.quarvel.toml", text);
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

}  // namespace
}  // namespace quarvel
