#include <gtest/gtest.h>
#include <sys/stat.h>

#include <atomic>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>

#include "base/Files.h"
#include "tests/TemporaryDirectory.h"

namespace quarvel {
namespace {

namespace fs = std::filesystem;

std::string content(const fs::path& file) {
  std::stringstream text;
  text << std::ifstream(file, std::ios::binary).rdbuf();
  return text.str();
}

TEST(FilesTest, DirectoriesAreMadeWithTheirPermissions) {
  const TemporaryDirectory directory;
  const mode_t mask = umask(077);
  for (const char* path : {"a/b/c", "a/b/d/"}) {
    const fs::path made = directory.path() / path;
    ASSERT_TRUE(MakeDirectory(made.native(), 0777).ok());
    EXPECT_EQ(fs::status(made).permissions(), fs::perms::all);
  }
  EXPECT_EQ(fs::status(directory.path() / "a/b").permissions(), fs::perms::owner_all);
  umask(mask);
  // One that exists stays as it is.
  ASSERT_TRUE(MakeDirectory((directory.path() / "a/b").native(), 0777).ok());
  EXPECT_EQ(fs::status(directory.path() / "a/b").permissions(), fs::perms::owner_all);

  const fs::path file = directory.write("file", "");
  for (const fs::path& impossible : {file, file / "below"}) {
    const Outcome outcome = MakeDirectory(impossible.native(), 0777);
    ASSERT_FALSE(outcome.ok()) << impossible;
    EXPECT_EQ(outcome.error().code, ENOTDIR);
  }
}

TEST(FilesTest, FileIsReplacedAsAWhole) {
  const TemporaryDirectory directory;
  const fs::path file = directory.path() / "history.json";
  const std::string first(200'000, 'a');
  const std::string second(100'000, 'b');
  ASSERT_TRUE(ReplaceFile(file.native(), first).ok());
  std::atomic<bool> done = false;
  std::atomic<int> parts = 0;
  std::thread reader([&] {
    while (!done) {
      const std::string seen = content(file);
      if (seen != first && seen != second) ++parts;
    }
  });
  for (int i = 0; i < 50; ++i) {
    ASSERT_TRUE(ReplaceFile(file.native(), i % 2 == 0 ? second : first).ok());
  }
  done = true;
  reader.join();
  EXPECT_EQ(parts, 0);
  EXPECT_EQ(content(file), first);
}

TEST(FilesTest, WritingThatFailsLeavesNothingBehind) {
  const TemporaryDirectory directory;
  const Outcome missing = ReplaceFile((directory.path() / "no/file").native(), "x");
  ASSERT_FALSE(missing.ok());
  EXPECT_EQ(missing.error().code, ENOENT);
  EXPECT_NE(missing.error().description().find("no/file"), std::string::npos);

  fs::create_directories(directory.path() / "taken/by-a-folder");
  EXPECT_FALSE(ReplaceFile((directory.path() / "taken/by-a-folder").native(), "x").ok());
  EXPECT_EQ(std::distance(fs::directory_iterator(directory.path() / "taken"), {}), 1);
}

}  // namespace
}  // namespace quarvel
