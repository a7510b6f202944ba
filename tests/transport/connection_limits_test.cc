// Clients that are too fast, too slow or too many: bounded, without cost to other clients.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <numeric>
#include <string>
#include <thread>

#include "tests/transport/ConnectionFixture.h"

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
    ASSERT_TRUE(service.journal.waitForCalls(8));
    EXPECT_TRUE(service.connect().isServed()) << "only the fast client waits";

    // Each reply is given before the call completes.
    std::thread worker([&] {
      for (std::size_t done = 0; done < kCalls;) {
        if (auto kept = service.journal.takeKeptCall()) {
          kept->reply(kept->number);
          ++done;
        } else if (!service.journal.waitForCalls(done + 2)) {  // the other client's call counts too
          break;
        }
      }
    });
    for (std::size_t i = 0; i < kCalls; ++i) {
      ASSERT_THAT(client.response(), HasSubstr(",null," + std::to_string(i) + "]"));
    }
    worker.join();
    std::vector<std::int64_t> arrived = service.journal.calls();
    EXPECT_EQ(arrived.at(8), Client::kServedNumber)
        << "more than eight calls were taken in before one completed";
    arrived.erase(arrived.begin() + 8);
    std::vector<std::int64_t> sent(kCalls);
    std::iota(sent.begin(), sent.end(), 0);
    EXPECT_EQ(arrived, sent);
    EXPECT_LE(service.journal.mostKeptCalls(), 9U);
  }
}

TEST(ConnectionLimits, UnstoredCallsHoldBackLaterOnesUntilTheyAreStoredOrSlow) {
  Service service;
  const auto callTwoHundredTimes = [](Client& client) {
    for (int i = 0; i < 200; ++i) ASSERT_TRUE(client.call(1, "answerUnstored:reply:", {i}));
  };
  Client slow = service.connect();
  const auto began = std::chrono::steady_clock::now();
  callTwoHundredTimes(slow);
  EXPECT_TRUE(service.journal.waitForCalls(200)) << "none of them completes";
  EXPECT_GE(std::chrono::steady_clock::now() - began, 50ms) << "more than 128 were unstored";

  Client other = service.connect();
  callTwoHundredTimes(other);
  ASSERT_TRUE(service.journal.waitForCalls(200 + 128));
  while (service.journal.takeKeptCall()) continue;
  EXPECT_TRUE(service.journal.waitForCalls(400)) << "completed calls make room";
}

TEST(ConnectionLimits, ClientsThatReconnectWithoutPauseAreRateLimited) {
  Service service({}, false);
  for (int i = 0; i < 1512; ++i) service.connect().hangUp();
  Client last = service.connect();
  const auto began = std::chrono::steady_clock::now();
  service.begin();
  EXPECT_TRUE(last.isServed());
  // 1000 more than the burst, at 4,000 a second.
  EXPECT_GE(std::chrono::steady_clock::now() - began, 249ms);
}

TEST(ConnectionLimits, AClientThatReadsLateIsHeldBackAndGetsEveryReplyInOrder) {
  constexpr std::size_t kCalls = 300;
  Configuration::Limits limits;
  limits.replyBytes = 64 * 1024;
  Service service(limits);
  Client client = service.connect();
  std::string bytes;
  for (std::size_t i = 0; i < kCalls; ++i) {
    bytes += CallBytes(static_cast<std::uint32_t>(i), "make:size:reply:", {i, 16 * 1024});
    bytes += CallBytes(std::nullopt, "make:size:reply:", {i, 1});  // answered with nothing
  }
  ASSERT_TRUE(client.send(bytes));
  Client bystander = service.connect();
  ASSERT_TRUE(bystander.isServed());
  // The kernel's buffer and `replyBytes` hold far fewer replies.
  ASSERT_TRUE(bystander.isServed());
  EXPECT_LT(service.journal.calls().size(), kCalls);
  for (std::size_t i = 0; i < kCalls; ++i) {
    ASSERT_EQ(client.response().substr(0, 12 + std::to_string(i).size()),
              "[1," + std::to_string(i) + ",null,\"xx");
  }
  EXPECT_TRUE(service.journal.waitForCalls(2 * kCalls + 2));
  EXPECT_TRUE(service.journal.entries().empty());
}

TEST(ConnectionLimits, RepliesThatComeLaterCountToo) {
  Configuration::Limits limits;
  limits.replyBytes = 1024;
  limits.stall = 1ms;
  Service service(limits);
  Client bystander = service.connect();
  Client client = service.connect();
  constexpr std::size_t kCalls = 2000;  // their replies are more than a socket takes unread
  for (std::size_t i = 0; i < kCalls; ++i) ASSERT_TRUE(client.call(1, "later:reply:", {1 << 30}));
  ASSERT_TRUE(service.journal.waitForCalls(kCalls));
  // One by one, so that the socket is full well before `replyBytes` are held.
  while (auto kept = service.journal.takeKeptCall()) {
    kept->reply(kept->number);
    ASSERT_TRUE(bystander.isServed());
  }
  EXPECT_TRUE(service.journal.waitFor("does not read its replies"));
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
  ASSERT_TRUE(service.journal.waitForCalls(1));
  // Meanwhile the other client's message times out.
  ASSERT_TRUE(other.send(keep.substr(0, 5)));
  EXPECT_EQ(other.response(), "end");
  EXPECT_TRUE(service.journal.waitFor("is disconnected: a message was begun"));
  service.journal.takeKeptCall()->reply(1);
  EXPECT_EQ(client.response(), "[1,1,null,1]");
}

}  // namespace
}  // namespace quarvel
