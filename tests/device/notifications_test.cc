#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "device/NotificationCenter.h"
#include "tests/TemporaryDirectory.h"
#include "tests/device/Collected.h"

namespace quarvel {
namespace {

namespace fs = std::filesystem;

/// A queue whose blocks run when the test says so.
class HandQueue final : public WorkQueue {
 public:
  [[nodiscard]] std::string_view label() const override { return "test"; }
  void async(Block block) override { blocks_.add(std::make_shared<Block>(std::move(block))); }
  void after(std::chrono::milliseconds, Block block) override { async(std::move(block)); }
  [[nodiscard]] bool isCurrent() const override { return false; }

  /// Waits for a block and runs it. False when none came.
  [[nodiscard]] bool runNext() {
    const auto block = blocks_.next();
    if (block) (**block)();
    return block.has_value();
  }
  [[nodiscard]] std::size_t waiting() { return blocks_.size(); }

 private:
  Collected<std::shared_ptr<Block>> blocks_;
};

class NotificationsTest : public ::testing::Test {
 protected:
  void TearDown() override { watch.reset(); }

  TemporaryDirectory directory;
  HandQueue queue;
  std::unique_ptr<DirectoryWatch> watch = std::make_unique<DirectoryWatch>();
  NotificationCenter center{directory.path() / "notify", *watch};
};

TEST_F(NotificationsTest, EachWayOfTouchingAFilePosts) {
  const std::string file = directory.path() / "notify/one";
  const std::vector<std::pair<const char*, std::function<void()>>> ways{
      {"made", [&] { directory.write("notify/one", ""); }},
      {"written", [&] { directory.write("notify/one", "news"); }},
      {"opened and closed", [&] { ::close(::open(file.c_str(), O_WRONLY)); }},
      {"touched by path", [&] { utimensat(AT_FDCWD, file.c_str(), nullptr, 0); }},
      {"replaced", [&] { fs::rename(directory.write("new", ""), file); }},
  };
  NotificationToken one = 0;
  NotificationToken again = 0;
  NotificationToken other = 0;
  std::vector<NotificationToken> called;
  const auto record = [&called](NotificationToken token) { called.push_back(token); };
  ASSERT_EQ(center.add("one", one, queue, record), 0);
  ASSERT_EQ(center.add("one", again, queue, record), 0);
  ASSERT_EQ(center.add("other", other, queue, record), 0);
  for (const auto& [name, touch] : ways) {
    SCOPED_TRACE(name);
    called.clear();
    touch();
    ASSERT_TRUE(queue.runNext());
    ASSERT_TRUE(queue.runNext());
    EXPECT_EQ(called, (std::vector{one, again}));
    // What is left of this touch comes before the next posting, and none of it is of another name.
    directory.write("notify/other", "");
    do {
      ASSERT_TRUE(queue.runNext());
    } while (called.back() != other);
    EXPECT_EQ(std::count(called.begin(), called.end(), other), 1);
  }
}

TEST_F(NotificationsTest, PostingsBeforeTheHandlerBeginsAreOneCallAndLaterOnesAnother) {
  NotificationToken token = 0;
  NotificationToken marker = 0;
  HandQueue markers;
  int calls = 0;
  ASSERT_EQ(center.add("burst", token, queue,
                       [&](NotificationToken) {
                         // Comes while the handler runs: must not be lost.
                         if (++calls == 1) directory.write("notify/burst", "");
                       }),
            0);
  ASSERT_EQ(center.add("marker", marker, markers, [](NotificationToken) {}), 0);
  const auto burst = [&] {
    for (int i = 0; i < 50; ++i) directory.write("notify/burst", "");
    directory.write("notify/marker", "");
    return markers.runNext();  // so all before it have been seen
  };
  ASSERT_TRUE(burst());
  EXPECT_EQ(queue.waiting(), 1U);
  ASSERT_TRUE(queue.runNext());
  ASSERT_TRUE(queue.runNext());
  EXPECT_EQ(calls, 2);
  ASSERT_TRUE(burst());
  EXPECT_EQ(queue.waiting(), 1U);
}

TEST_F(NotificationsTest, OverflowOfTheKernelsQueuePostsEverything) {
  NotificationToken token = 0;
  int calls = 0;
  ASSERT_EQ(center.add("quiet", token, queue, [&calls](NotificationToken) { ++calls; }), 0);
  // The watch is held up until more has happened than the kernel keeps.
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  ASSERT_EQ(
      watch->add(directory.path() / "busy", [released](std::string_view) { released.wait(); }), 0);
  std::ifstream limit("/proc/sys/fs/inotify/max_queued_events");
  int queued = 0;
  limit >> queued;
  ASSERT_GT(queued, 0);
  // Equal events in a row would be merged, hence two files; some were read before the hold-up.
  for (int i = 0; i < queued + 1000; ++i) {
    directory.write(i % 2 == 0 ? "busy/even" : "busy/odd", "");
  }
  release.set_value();
  ASSERT_TRUE(queue.runNext());
  EXPECT_EQ(calls, 1);
}

TEST_F(NotificationsTest, SetUpThatFailsYieldsAStatusAndNoToken) {
  directory.write("file", "");
  NotificationCenter impossible(directory.path() / "file/notify", *watch);
  NotificationToken token = 7;
  EXPECT_EQ(impossible.add("one", token, queue, [](NotificationToken) {}), ENOTDIR);
  EXPECT_EQ(token, 0);
}

}  // namespace
}  // namespace quarvel
