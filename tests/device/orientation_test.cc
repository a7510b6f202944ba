#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <future>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "device/OrientationFiles.h"
#include "tests/LogRecorder.h"
#include "tests/TemporaryDirectory.h"
#include "tests/device/Collected.h"

namespace quarvel {
namespace {

using ::testing::HasSubstr;
using testing::LogRecorder;
using ::testing::Optional;

class OrientationTest : public ::testing::Test {
 protected:
  void SetUp() override {
    LogRecorder::take();
    center.setSource(std::make_unique<OrientationFiles>(center, directory.path(), *watch));
  }
  void TearDown() override { watch.reset(); }

  OrientationHandler record(Collected<Orientation>& into) {
    return [&into](Orientation orientation) { into.add(orientation); };
  }

  TemporaryDirectory directory;
  std::unique_ptr<DirectoryWatch> watch = std::make_unique<DirectoryWatch>();
  OrientationCenter center;
};

TEST_F(OrientationTest, ChangesOfTheFilesReachTheirHandlers) {
  directory.write("device-orientation", "portrait");
  Collected<Orientation> device;
  Collected<Orientation> ui;
  center.add(OrientationKind::device, "id", record(device));
  center.add(OrientationKind::ui, "id", record(ui));
  const std::vector<std::pair<const char*, Orientation>> cases{
      {"2\n", Orientation::portraitUpsideDown},
      {"landscapeLeft", Orientation::landscapeLeft},
      {" landscapeRight\n", Orientation::landscapeRight},
      {"5", Orientation::faceUp},
      {"faceDown", Orientation::faceDown},
      {"unknown", Orientation::unknown},
      {"1", Orientation::portrait},
  };
  directory.write("device-orientation", "portrait");  // as it was: no change
  for (const auto& [text, expected] : cases) {
    SCOPED_TRACE(text);
    directory.write("device-orientation", text);
    EXPECT_THAT(device.next(), Optional(expected));
  }
  EXPECT_EQ(ui.size(), 0U);
  directory.write("ui-orientation", "3");
  EXPECT_THAT(ui.next(), Optional(Orientation::landscapeLeft));
  EXPECT_EQ(device.size(), 0U);
}

TEST_F(OrientationTest, TextThatIsNoOrientationIsLoggedAndChangesNothing) {
  Collected<Orientation> device;
  center.add(OrientationKind::device, "id", record(device));
  for (const std::string text : {"7", "-1", "1 2", "Portrait", "sideways"}) {
    directory.write("device-orientation", text);
    // A file that is written in place may be seen empty on the way.
    std::string line;
    do {
      line = LogRecorder::nextError();
    } while (line.find("\"\"") != line.npos);
    EXPECT_THAT(line, HasSubstr("\"" + text + "\""));
  }
  directory.write("device-orientation", "faceUp");
  EXPECT_THAT(device.next(), Optional(Orientation::faceUp));
}

TEST_F(OrientationTest, OneHandlerForAnIDAndNoneAfterUnregistering) {
  Collected<Orientation> replaced;
  Collected<Orientation> own;
  Collected<Orientation> other;
  center.add(OrientationKind::device, "id", record(replaced));
  center.add(OrientationKind::device, "id", record(own));
  center.add(OrientationKind::device, "other", record(other));
  directory.write("device-orientation", "1");
  EXPECT_THAT(own.next(), Optional(Orientation::portrait));
  EXPECT_THAT(other.next(), Optional(Orientation::portrait));
  center.remove(OrientationKind::ui, "id");
  center.remove(OrientationKind::device, "id");
  center.remove(OrientationKind::device, "id");
  directory.write("device-orientation", "2");
  EXPECT_THAT(other.next(), Optional(Orientation::portraitUpsideDown));
  center.remove(OrientationKind::device, "other");
  // What happened while nobody listened is where the next one starts.
  directory.write("device-orientation", "3");
  center.add(OrientationKind::device, "other", record(other));
  directory.write("device-orientation", "4");
  EXPECT_THAT(other.next(), Optional(Orientation::landscapeRight));
  EXPECT_EQ(replaced.size() + own.size(), 0U);
}

TEST_F(OrientationTest, UnregisteringWaitsForTheHandlerUnlessCalledFromIt) {
  std::promise<void> entered;
  std::promise<void> removing;
  bool left = false;  // not atomic: only a removal that waits may read it
  center.add(OrientationKind::device, "slow", [&](Orientation) {
    entered.set_value();
    removing.get_future().wait();
    for (int i = 0; i < 1000; ++i) std::this_thread::yield();
    left = true;
  });
  Collected<Orientation> after;
  center.add(OrientationKind::device, "within", [&](Orientation orientation) {
    center.remove(OrientationKind::device, "within");
    after.add(orientation);
  });
  directory.write("device-orientation", "1");
  entered.get_future().wait();
  removing.set_value();
  center.remove(OrientationKind::device, "slow");
  EXPECT_TRUE(left);
  EXPECT_THAT(after.next(), Optional(Orientation::portrait));
}

}  // namespace
}  // namespace quarvel
