#include <fmt/format.h>
#include <gtest/gtest.h>

#include <atomic>
#include <random>
#include <thread>

#include "Statistics/Service/ZQReportingBlockThrottle.h"
#include "platform/DeviceProperties.h"

namespace quarvel {

std::optional<bool> DevicePropertyBoolean(std::string_view) {
  return std::nullopt;
}

namespace {

using namespace std::chrono_literals;  // NOLINT(google-build-using-namespace): durations in tests

// On real threads, for the thread sanitizer: the simulation runs one thread at a time.
TEST(BlockThrottleOnThreads, CallersThatRaceWithTheFiringLoseAndRepeatNoMessage) {
  constexpr std::size_t kCallers = 4;
  constexpr std::size_t kMessages = 4'000;
  constexpr std::size_t kKinds = 64;
  std::vector<std::atomic<int>> runs(kCallers * kMessages);
  std::vector<std::atomic<int>> runsOfKind(kKinds);
  std::atomic<int> running = 0;
  const auto token = std::make_shared<int>();  // shared by the blocks that are alive
  auto throttle = ZQReportingBlockThrottle::init();
  std::vector<std::thread> callers;
  for (std::size_t caller = 0; caller < kCallers; ++caller) {
    callers.emplace_back([&, caller] {
      std::minstd_rand random(static_cast<std::uint32_t>(caller) + 1);
      for (std::size_t i = 0; i < kMessages; ++i) {
        const std::size_t kind = random() % kKinds;
        const double seconds = static_cast<double>(random() % 100) * 1e-4 - 1e-3;
        throttle->addMessageBlock(
            [&, token, id = caller * kMessages + i, kind] {
              EXPECT_EQ(++running, 1);
              ++runs[id];
              ++runsOfKind[kind];
              --running;
            },
            7, Payload(Dictionary{{"kind", fmt::to_string(kind)}, {"_throttle_seconds", seconds}}),
            3, 1);
        std::this_thread::sleep_for(100us);
      }
    });
  }
  for (std::thread& caller : callers) caller.join();
  throttle->waitForCompletion();
  throttle->setShouldKeepRunning(false);
  EXPECT_TRUE(throttle->timersInFlight().empty());
  EXPECT_TRUE(throttle->unscheduledTimerKeys().empty());
  // The last block leaves the map before it runs, and the worker ends after it.
  const std::weak_ptr released = std::exchange(throttle, nullptr);
  for (int i = 0; i < 1000 && !released.expired(); ++i) std::this_thread::sleep_for(10ms);
  ASSERT_TRUE(released.expired()) << "the worker has not ended within 10 s";
  EXPECT_EQ(token.use_count(), 1) << "blocks neither run nor replaced";
  for (const auto& count : runs) EXPECT_LE(count, 1);
  for (const auto& count : runsOfKind) EXPECT_GE(count, 1);
}

}  // namespace
}  // namespace quarvel
