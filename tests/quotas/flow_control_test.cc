// Decisions of flow control on a virtual clock: each limit, from both sides, and its recovery.

#include "quotas/FlowControl.h"

#include <gtest/gtest.h>

namespace quarvel {
namespace {

using namespace std::chrono_literals;

FlowInstant now{1h};
FlowInstant Clock() {
  return now;
}

/// Calls of one byte each.
class CallFlowTest : public ::testing::Test {
 protected:
  void execute(std::size_t calls, std::chrono::nanoseconds each) {
    for (; calls > 0; --calls) {
      flow_.blockRan(each);
      wakes_ += flow_.callExecuted() ? 1 : 0;
    }
  }
  /// Takes calls in until the limit. With `executed`, each is executed at once and stays unstored.
  std::size_t fill(bool executed = false) {
    std::size_t calls = 0;
    for (; !flow_.mustWait(Clock); ++calls) {
      flow_.callBegun(1);
      if (executed) execute(1, 1us);
    }
    return calls;
  }
  void complete(std::size_t calls) {
    for (; calls > 0; --calls) wakes_ += flow_.callCompleted(1) ? 1 : 0;
  }

  CallFlow flow_{256, 1000};
  int wakes_ = 0;
};

TEST_F(CallFlowTest, TurnFollowsTheTimeOfCallsAndGrowsAgain) {
  std::size_t turn = fill();
  EXPECT_EQ(turn, 16U);
  const auto turnAfter = [&](std::size_t calls, std::chrono::nanoseconds each) {
    execute(calls, each);
    complete(calls);
    return turn = fill();
  };
  for (int i = 0; i < 20; ++i) turnAfter(turn, 1us);
  EXPECT_GT(turn, 90U) << "100 calls of 1 us take the turn of 0.1 ms";
  // One heavy call among light ones counts at once, with a quarter of its time.
  execute(turn - 1, 1us);
  complete(turn - 1);
  EXPECT_EQ(turnAfter(1, 200us), 2U);
  EXPECT_EQ(turnAfter(turn, 10ms), 1U);
  for (int i = 0; i < 200; ++i) turnAfter(turn, 1us);
  EXPECT_GT(turn, 90U) << "after the heavy calls the turn grows again";
  for (int i = 0; i < 200; ++i) turnAfter(turn, 0us);
  EXPECT_EQ(turn, 256U) << "as far as the configured limit";
  EXPECT_EQ(wakes_, 422) << "one wake for each full turn";
}

TEST_F(CallFlowTest, UnstoredLimitFollowsTheStoreAndGrowsAgain) {
  const std::pair<std::chrono::nanoseconds, std::size_t> steps[] = {
      {2001us, 64}, {2000us, 64}, {5s, 32},     {500us, 32}, {499us, 64},
      {1us, 128},   {1us, 128},   {2001us, 64}, {3ms, 32},   {3ms, 16},
      {3ms, 8},     {3ms, 4},     {3ms, 2},     {3ms, 1},    {3ms, 1},
  };
  std::size_t limit = fill(true);
  EXPECT_EQ(limit, 128U);
  for (const auto& [took, newLimit] : steps) {
    now += took;
    complete(limit - limit / 2 - 1);
    EXPECT_TRUE(flow_.mustWait(Clock)) << "less than half is stored";
    complete(limit / 2 + 1);
    limit = fill(true);
    EXPECT_EQ(limit, newLimit) << took.count() << " ns";
  }
}

TEST_F(CallFlowTest, SlowCallsAreExemptOnceNoneCompletes) {
  ASSERT_EQ(fill(true), 128U);
  const std::size_t before = flow_.completedCalls();
  complete(1);
  flow_.exemptSlowCalls(before);
  EXPECT_TRUE(flow_.mustWait(Clock)) << "a call completed meanwhile";
  now += 50ms;
  flow_.exemptSlowCalls(before + 1);
  EXPECT_EQ(fill(true), 128U) << "beside 127 exempt calls; their time says nothing about the store";
}

TEST(FlowControlTest, CallsCountWithTheirBytesUntilTheyAreStoredAlsoExemptOnes) {
  CallFlow flow(256, 8);
  for (int i = 0; i < 8; ++i) {
    ASSERT_FALSE(flow.mustWait(Clock));
    flow.callBegun(1);
    EXPECT_FALSE(flow.callExecuted());
  }
  flow.exemptSlowCalls(0);
  EXPECT_TRUE(flow.mustWait(Clock));
  for (int i = 0; i < 3; ++i) EXPECT_FALSE(flow.callCompleted(1));
  EXPECT_TRUE(flow.callCompleted(1)) << "half is free";
  EXPECT_FALSE(flow.isWaiting());
  EXPECT_FALSE(flow.callCompleted(1)) << "woken once";
}

TEST(FlowControlTest, ReadTurnEndsAtItsTimeAndLooksAtTheClockEachSixteenCalls) {
  ReadTurn turn(now);
  const auto isOverAfterSixteen = [&turn] {
    for (int i = 0; i < 15; ++i) EXPECT_FALSE(turn.isOverAfterCall(nullptr));
    return turn.isOverAfterCall(Clock);
  };
  now += 200us - 1ns;
  EXPECT_FALSE(isOverAfterSixteen());
  now += 1ns;
  EXPECT_TRUE(isOverAfterSixteen());
}

TEST(FlowControlTest, AcceptsABurstAndThenFourThousandASecond) {
  AcceptRateLimit limit;
  const auto accepted = [&limit] {
    int clients = 0;
    for (; limit.allowsOne(now); ++clients) limit.accepted(now);
    return clients;
  };
  EXPECT_EQ(accepted(), 513) << "the bucket of 512 tokens, and the token of now";
  now += 250us - 1ns;
  EXPECT_EQ(accepted(), 0);
  now += 1ns;
  EXPECT_EQ(accepted(), 1);
  now = limit.nextTurn();
  EXPECT_EQ(accepted(), 5);
  now += 1s;
  EXPECT_EQ(accepted(), 513) << "the bucket holds no more";
}

TEST(FlowControlTest, ChurnPausesAcceptingUntilHalfOfTheChangesHaveEnded) {
  ChurnLimit churn;
  for (int round = 0; round < 2; ++round) {
    for (int i = 0; i < 8; ++i) {
      EXPECT_FALSE(churn.mustWait());
      churn.changeBegun();
    }
    EXPECT_TRUE(churn.mustWait());
    for (int i = 0; i < 3; ++i) EXPECT_FALSE(churn.changeEnded());
    EXPECT_TRUE(churn.changeEnded());
    for (int i = 0; i < 4; ++i) EXPECT_FALSE(churn.changeEnded()) << "woken once";
  }
}

}  // namespace
}  // namespace quarvel
