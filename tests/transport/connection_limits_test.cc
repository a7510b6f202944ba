// Clients that are too fast, too slow or too many: bounded, held back, and never at others' cost.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <numeric>
#include <string>
#include <thread>

#include "tests/transport/ConnectionFixture.h"
#include "transport/ReplyQueue.h"

namespace quarvel {
namespace {

using ::testing::HasSubstr;
using namespace std::chrono_literals;

TEST(ConnectionLimits, AClientThatIsTooFastWaitsAndLosesNothing) {
  Configuration::Limits byCalls;
  byCalls.queuedCalls = 8;
  Configuration::Limits byBytes;
  byBytes.queuedBytes = 8 * CallBytes(100, "keep:reply:", {100}).size();
  for (const Configuration::Limits& limits : {byCalls, byBytes}) {
    constexpr std::size_t kCalls = 100;
    Service service(limits);
    Client client = service.connect();
    std::string bytes;
    for (std::size_t i = 0; i < kCalls; ++i) {
      bytes += CallBytes(static_cast<std::uint32_t>(100 + i), "keep:reply:", {i});
    }
    ASSERT_TRUE(client.send(bytes));
    ASSERT_TRUE(service.ledger->waitForArrivals(8));
    EXPECT_TRUE(service.connect().isServed()) << "only the fast client waits";

    // Worked off on another thread; each reply is given before its work is done.
    std::thread worker([&] {
      for (std::size_t done = 0; done < kCalls;) {
        if (auto kept = service.ledger->takeKept()) {
          kept->reply(kept->number);
          ++done;
        } else {
          service.ledger->waitForArrivals(done + 2);  // the other client's call counts too
        }
      }
    });
    for (std::size_t i = 0; i < kCalls; ++i) {
      ASSERT_THAT(client.response(), HasSubstr(",null," + std::to_string(i) + "]"));
    }
    worker.join();
    std::vector<std::int64_t> arrived = service.ledger->numbers();
    EXPECT_EQ(arrived.at(8), Client::kServedNumber)
        << "more than eight calls were taken in before one was done";
    arrived.erase(arrived.begin() + 8);
    std::vector<std::int64_t> sent(kCalls);
    std::iota(sent.begin(), sent.end(), 0);
    EXPECT_EQ(arrived, sent);
    EXPECT_LE(service.ledger->largestKept(), 9U);
  }
}

/// Takes calls in until the desk has no room for more.
std::size_t Fill(ReplyQueue& desk) {
  std::size_t calls = 0;
  for (; !desk.mustWaitForRoom(); ++calls) desk.begin(1);
  return calls;
}

void CarryOut(ReplyQueue& desk, std::size_t calls, std::chrono::nanoseconds each) {
  for (; calls > 0; --calls) {
    desk.ran(each);
    desk.carriedOut();
  }
}

void Finish(ReplyQueue& desk, std::size_t calls) {
  for (; calls > 0; --calls) desk.done(1);
}

TEST(ConnectionLimits, AsManyCallsAreAheadOfOthersAsTakeAMoment) {
  const Configuration::Limits limits;
  int woken = 0;
  ReplyQueue desk(limits, [&woken] { ++woken; });
  const auto turnAfter = [&](std::size_t calls, std::chrono::nanoseconds each) {
    CarryOut(desk, calls, each);
    Finish(desk, calls);
    return Fill(desk);
  };
  EXPECT_EQ(Fill(desk), limits.firstTurn);
  std::size_t turn = limits.firstTurn;
  for (int i = 0; i < 20; ++i) turn = turnAfter(turn, 1us);
  EXPECT_GT(turn, 90U) << "light calls are many";
  // One heavy call among them is enough, though none of its like has used up a turn.
  CarryOut(desk, 1, 10ms);
  Finish(desk, 1);
  turn = turnAfter(turn - 1, 50us);
  EXPECT_EQ(turn, 1U);
  for (int i = 0; i < 200; ++i) turn = turnAfter(turn, 1us);
  EXPECT_GT(turn, 90U) << "and it is forgotten";
  EXPECT_GT(woken, 200);
}

TEST(ConnectionLimits, FewerAreAnsweredAndNotDoneWhereThatTakesLong) {
  Configuration::Limits limits;
  ReplyQueue desk(limits, [] {});
  const auto answer = [&] {
    std::size_t calls = 0;
    for (; !desk.mustWaitForRoom(); ++calls) {
      desk.begin(1);
      CarryOut(desk, 1, 1us);
    }
    return calls;
  };
  const std::size_t most = answer();
  EXPECT_GT(most, 16U);
  std::this_thread::sleep_for(5ms);
  Finish(desk, most);
  EXPECT_EQ(answer(), most / 2);
  // What waits for something slow is excused, and says nothing of the rest.
  std::this_thread::sleep_for(5ms);
  desk.excuseThoseBehind();
  EXPECT_EQ(answer(), most / 2);
}

TEST(ConnectionLimits, WhoComesAndGoesAsFastAsHeCanIsPaced) {
  Service service;
  const auto began = std::chrono::steady_clock::now();
  for (int i = 0; i < 1012; ++i) service.connect().hangUp();
  EXPECT_TRUE(service.connect().isServed());
  // 500 more than may come at once, at 4,000 a second.
  EXPECT_GT(std::chrono::steady_clock::now() - began, 120ms);
}

TEST(ConnectionLimits, AClientThatReadsLateIsHeldBackAndGetsEveryReply) {
  constexpr std::size_t kCalls = 300;
  Configuration::Limits limits;
  limits.replyBytes = 64 * 1024;
  Service service(limits);
  Client client = service.connect();
  std::string bytes;
  for (std::size_t i = 0; i < kCalls; ++i) {
    bytes += CallBytes(static_cast<std::uint32_t>(i), "make:size:reply:", {i, 16 * 1024});
  }
  ASSERT_TRUE(client.send(bytes));
  Client bystander = service.connect();
  ASSERT_TRUE(bystander.isServed());
  // What the kernel takes and `replyBytes` hold is far from all.
  ASSERT_TRUE(bystander.isServed());
  EXPECT_LT(service.ledger->numbers().size(), kCalls / 2);
  for (std::size_t i = 0; i < kCalls; ++i) {
    ASSERT_EQ(client.response().substr(0, 12 + std::to_string(i).size()),
              "[1," + std::to_string(i) + ",null,\"xx");
  }
  EXPECT_TRUE(Journal::shared().entries().empty());
}

TEST(ConnectionLimits, RepliesThatComeLaterCountToo) {
  Configuration::Limits limits;
  limits.replyBytes = 1024;
  limits.stall = 1ms;
  limits.queuedCalls = limits.firstTurn = 10'000;
  Service service(limits);
  Client bystander = service.connect();
  Client client = service.connect();
  constexpr std::size_t kCalls = 2000;  // their replies are more than a socket takes unread
  for (std::size_t i = 0; i < kCalls; ++i) ASSERT_TRUE(client.call(1, "keep:reply:", {1 << 30}));
  ASSERT_TRUE(service.ledger->waitForArrivals(kCalls));
  // One by one, so that writing has come to a halt well before too much is held.
  while (auto kept = service.ledger->takeKept()) {
    kept->reply(kept->number);
    ASSERT_TRUE(bystander.isServed());
  }
  EXPECT_TRUE(Journal::shared().waitFor("does not read its replies"));
}

TEST(ConnectionLimits, AMessageThatTheServiceHoldsBackHasNoDeadline) {
  Configuration::Limits limits;
  limits.frame = 1ms;
  limits.queuedCalls = 1;
  Service service(limits);
  Client client = service.connect();
  Client other = service.connect();
  const std::string keep = CallBytes(1, "keep:reply:", {1});
  ASSERT_TRUE(client.send(keep + keep + CallBytes(2, "echo:reply:", {2}).substr(0, 5)));
  ASSERT_TRUE(service.ledger->waitForArrivals(1));
  // The other's message times out meanwhile.
  ASSERT_TRUE(other.send(keep.substr(0, 5)));
  EXPECT_EQ(other.response(), "end");
  EXPECT_TRUE(Journal::shared().waitFor("is disconnected: a message was begun"));
  service.ledger->takeKept()->reply(1);
  EXPECT_EQ(client.response(), "[1,1,null,1]");
}

}  // namespace
}  // namespace quarvel
