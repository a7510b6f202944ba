#include <gtest/gtest-spi.h>

#include <cstdio>

#include "platform/Condition.h"
#include "tests/simulation/World.h"

// The whole service on the simulated platform against a model of what it owes. A failure names its
// seed; QUARVEL_SEED replays it, QUARVEL_SEEDS says how many to try. A program of its own, since a
// process asks only once whether it is an internal build.

namespace quarvel {
namespace {

std::string FirstFinding(const World& world) {
  return world.findings().empty() ? "" : world.findings().front();
}

TEST(ServiceSimulation, OwesNobodyAnything) {
  World::Counts total;
  std::size_t seeds = 0;
  for (const auto seed : Seeds()) {
    World world(seed);
    world.run();
    EXPECT_EQ(FirstFinding(world), "") << "QUARVEL_SEED=" << seed;
    ++seeds;
    total.calls += world.counts().calls;
    total.accepted += world.counts().accepted;
    total.handedOver += world.counts().handedOver;
    total.refused += world.counts().refused;
    total.dropped += world.counts().dropped;
  }
  std::printf(
      "harness: simulation: %zu seeds, %zu calls, %zu messages: %zu handed over, %zu refused, %zu "
      "dropped\n",
      seeds, total.calls, total.accepted, total.handedOver, total.refused, total.dropped);
}

TEST(ServiceSimulation, ASeedDoesTheSameAgain) {
  std::set<std::size_t> different;
  for (std::uint64_t seed = 1; seed <= 10; ++seed) {
    World first(seed);
    first.run();
    const std::size_t hash = first.traceHash();
    World second(seed);
    second.run();
    EXPECT_EQ(hash, second.traceHash());
    different.insert(hash);
  }
  EXPECT_EQ(different.size(), 10U);
}

TEST(ServiceSimulation, ALieOfThePlatformIsNoticed) {
  constexpr Lie kLies[] = {Lie::messageLost,       Lie::messageTwice, Lie::messagesSwapped,
                           Lie::singleMessageLost, Lie::flushLost,    Lie::replyLost,
                           Lie::replyTwice,        Lie::historyCut,   Lie::eventLost,
                           Lie::connectionKept};
  for (const Lie lie : kLies) {
    std::uint64_t seed = 0;
    std::string finding;
    while (finding.empty() && seed < 50) {
      World world(++seed, lie);
      world.run();
      finding = FirstFinding(world);
    }
    EXPECT_NE(finding, "") << "lie " << static_cast<int>(lie) << " is believed";
  }
}

TEST(ServiceSimulation, ADeadlockIsNoticedWithItsSeedAndWhoWaits) {
  Simulation simulation(7);
  const auto condition = CreateCondition();
  const auto queue = CreateSerialQueue("the queue", QualityOfService::utility);
  queue->async([condition]() QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    condition->lock();
    condition->lock();
  });
  EXPECT_NONFATAL_FAILURE(simulation.run(), "the queue for a condition's lock");
  EXPECT_NONFATAL_FAILURE(simulation.run(), "QUARVEL_SEED=7");
}

}  // namespace
}  // namespace quarvel
