#include <gtest/gtest.h>
#include <pthread.h>
#include <unistd.h>

#include <array>
#include <cmath>
#include <string>
#include <thread>

#include "platform/Process.h"
#include "platform/Random.h"

namespace quarvel {
namespace {

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
