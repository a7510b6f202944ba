#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "device/PreferencesStore.h"
#include "tests/LogRecorder.h"
#include "tests/TemporaryDirectory.h"

namespace quarvel {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using testing::LogRecorder;
using ::testing::SizeIs;

class PreferencesTest : public ::testing::Test {
 protected:
  void SetUp() override { LogRecorder::take(); }

  PreferencesDomain written(std::string_view text) {
    directory.write("some.domain.toml", text);
    return store.open("some.domain");
  }

  TemporaryDirectory directory;
  PreferencesStore store{directory.path()};
};

TEST_F(PreferencesTest, RandomBytesChangeNothing) {
  EXPECT_EQ(written("name = \"Kitchen\"").string("name"), "Kitchen");
  std::mt19937 random(20'260'131);
  for (int i = 0; i < 500; ++i) {
    std::string bytes(1 + random() % 300, '\0');
    for (char& byte : bytes) byte = static_cast<char>(random());
    if (bytes.front() == '#') continue;
    EXPECT_EQ(written(bytes).string("name"), "Kitchen") << i;
  }
}

TEST_F(PreferencesTest, ValuesAreReadAsStringsAndBooleans) {
  const struct {
    const char* value;
    std::optional<std::string> string;
    bool boolean;
  } cases[] = {
      {"true", std::nullopt, true},
      {"false", std::nullopt, false},
      {"0", "0", false},
      {"-3", "-3", true},
      {"9223372036854775807", "9223372036854775807", true},
      {"0.0", "0", false},
      {"2.5", "2.5", true},
      {"\"\"", "", false},
      {"\"Kitchen\"", "Kitchen", false},
      {"\"YES\"", "YES", true},
      {"\"On\"", "On", true},
      {"\"True\"", "True", true},
      {"\"1\"", "1", true},
      {"\"no\"", "no", false},
      {"\"yes, please\"", "yes, please", false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.value);
    const PreferencesDomain domain = written(std::string("key = ") + c.value);
    EXPECT_TRUE(domain.hasValue("key"));
    EXPECT_EQ(domain.string("key"), c.string);
    EXPECT_EQ(domain.boolean("key"), c.boolean);
    EXPECT_FALSE(domain.hasValue("other"));
    EXPECT_EQ(domain.string("other"), std::nullopt);
    EXPECT_FALSE(domain.boolean("other"));
  }
}

TEST_F(PreferencesTest, FileThatCannotBeUnderstoodChangesNothing) {
  const struct {
    const char* name;
    std::string text;
    const char* line;
  } cases[] = {
      {"torn", "device_name = \"x\"\ndisable_reporting = tr", "some.domain.toml:2: "},
      {"twice", "disable_reporting = false\ndisable_reporting = false\n", "some.domain.toml:2: "},
      {"list", "\n\ndisable_reporting = [false]\n", "some.domain.toml:3: "},
      {"table", "[disable_reporting]\nvalue = false\n", "some.domain.toml:1: "},
      {"date", "\ndisable_reporting = 2026-01-31\n", "some.domain.toml:2: "},
      {"no text", "disable_reporting = \"\xff\"\n", "some.domain.toml:1: "},
      {"endless", std::string(PreferencesStore::kMaximumBytes, '\n') + "a = 1",
       "some.domain.toml: "},
  };
  EXPECT_FALSE(written("disable_reporting = nonsense").hasValue("disable_reporting"));
  EXPECT_THAT(LogRecorder::nextError(), HasSubstr("some.domain.toml:1: "));
  EXPECT_TRUE(written("disable_reporting = true").boolean("disable_reporting"));
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    EXPECT_TRUE(written(c.text).boolean("disable_reporting"));
    EXPECT_TRUE(store.open("some.domain").boolean("disable_reporting"));
    // Once, though it was opened twice.
    EXPECT_THAT(LogRecorder::takeErrors(), ElementsAre(HasSubstr(c.line)));
    EXPECT_FALSE(store.open("other.domain").hasValue("disable_reporting"));
  }
  EXPECT_FALSE(written("device_name = 'x'").hasValue("disable_reporting"));
  EXPECT_TRUE(written("disable_reporting = true").boolean("disable_reporting"));

  // A domain that is gone has no values; one that cannot be read keeps them.
  const std::filesystem::path file = directory.path() / "some.domain.toml";
  std::filesystem::remove(file);
  std::filesystem::create_directory(file);
  EXPECT_TRUE(store.open("some.domain").boolean("disable_reporting"));
  EXPECT_THAT(LogRecorder::takeErrors(), SizeIs(1));
  std::filesystem::remove(file);
  EXPECT_FALSE(store.open("some.domain").hasValue("disable_reporting"));
  EXPECT_THAT(LogRecorder::takeErrors(), IsEmpty());
}

}  // namespace
}  // namespace quarvel
